// Runs the fuzz target's checks over the saved corpus and over texts drawn
// from a fixed-seed generator built from the characters that matter to the
// parser.
#include "key_value_parser_fuzz.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <random>
#include <sstream>
#include <string>

namespace zark::test {
namespace {

namespace fs = std::filesystem;

TEST(KlibcKeyValueParserCorpus, SavedInputsKeepThePromises) {
  int inputs = 0;
  for (const auto &entry : fs::directory_iterator(ZARK_KLIBC_CORPUS_DIR)) {
    std::ifstream in(entry.path(), std::ios::binary);
    std::stringstream text;
    text << in.rdbuf();
    EXPECT_EQ(CheckKeyValueParse(text.str()), "") << entry.path();
    ++inputs;
  }
  EXPECT_GE(inputs, 5) << "corpus missing in " << ZARK_KLIBC_CORPUS_DIR;
}

TEST(KlibcKeyValueParserCorpus, GeneratedInputsKeepThePromises) {
  using namespace std::string_literals;
  const std::string kTokens[] = {"[",  "]", "=",   "#",           ";",
                                 "\"", " ", "\t",  "\r",          "\n",
                                 "a",  "b", "\0"s, "\xEF\xBB\xBF"};
  std::mt19937 generator(20240601);
  std::uniform_int_distribution<std::size_t> length(0, 40);
  std::uniform_int_distribution<std::size_t> pick(0, std::size(kTokens) - 1);
  for (int round = 0; round < 5000; ++round) {
    std::string text;
    for (std::size_t n = length(generator); n > 0; --n) {
      text += kTokens[pick(generator)];
    }
    const std::string broken = CheckKeyValueParse(text);
    ASSERT_EQ(broken, "") << "input: [" << text << "]";
  }
}

} // namespace
} // namespace zark::test
