// The saved fuzz corpus of the router part's parsers, run as an ordinary
// test: every file must keep the parsers' promises.
#include "router_parsers_fuzz.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

namespace zark::test {
namespace {

namespace fs = std::filesystem;

std::vector<std::string> CorpusFiles() {
  std::vector<std::string> names;
  for (const auto &entry : fs::directory_iterator(ZARK_ROUTER_CORPUS_DIR)) {
    names.push_back(entry.path().filename().string());
  }
  std::sort(names.begin(), names.end());
  return names;
}

class PortMapRouterParserCorpus : public testing::TestWithParam<std::string> {};

TEST_P(PortMapRouterParserCorpus, KeepsItsPromises) {
  std::ifstream in(fs::path(ZARK_ROUTER_CORPUS_DIR) / GetParam(),
                   std::ios::binary);
  std::stringstream content;
  content << in.rdbuf();
  EXPECT_EQ("", CheckRouterParsers(content.str()));
}

INSTANTIATE_TEST_SUITE_P(Files, PortMapRouterParserCorpus,
                         testing::ValuesIn(CorpusFiles()),
                         [](const testing::TestParamInfo<std::string> &info) {
                           std::string name = info.param;
                           std::replace_if(
                               name.begin(), name.end(),
                               [](char c) { return !std::isalnum(c); }, '_');
                           return name;
                         });

TEST(PortMapRouterParserCorpusFiles, AreThere) {
  EXPECT_GE(CorpusFiles().size(), 10u);
}

// The checks themselves catch what they promise to catch.
TEST(PortMapRouterParserChecks, NoticeBrokenInputsOfEachKind) {
  EXPECT_EQ("", CheckRouterParsers("p8000-8002,22"));
  EXPECT_EQ("", CheckRouterParsers("uhttp://192.168.1.1:5000/x"));
  EXPECT_EQ("", CheckRouterParsers("s{\"version\":1,\"routers\":[]}"));
  EXPECT_EQ("", CheckRouterParsers("snot json"));
}

} // namespace
} // namespace zark::test
