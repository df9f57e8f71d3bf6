// Runs the saved fuzz corpus, and random texts built from the parser's own
// vocabulary, through the fuzz target's checks as ordinary tests.
#include <gtest/gtest.h>

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <random>
#include <sstream>
#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);

namespace {

int RunOne(const std::string &text) {
  return LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t *>(text.data()),
                                text.size());
}

TEST(FirewallServiceFileFuzz, SavedCorpusKeepsTheParsersPromises) {
  namespace fs = std::filesystem;
  int files = 0;
  for (const auto &entry : fs::directory_iterator(ZARK_FIREWALL_CORPUS_DIR)) {
    std::ifstream in(entry.path(), std::ios::binary);
    std::stringstream content;
    content << in.rdbuf();
    EXPECT_EQ(RunOne(content.str()), 0) << entry.path();
    ++files;
  }
  EXPECT_GE(files, 5);
}

// Texts glued from fragments that reach every branch of the parser.
TEST(FirewallServiceFileFuzz, RandomFragmentTextsKeepThePromises) {
  const std::vector<std::string> fragments = {"[a]",
                                              "[b]",
                                              "[]",
                                              "[ a ]x",
                                              "[c",
                                              "\n",
                                              "\r\n",
                                              "protocol",
                                              "ports",
                                              "forwardable",
                                              "title",
                                              "=",
                                              "tcp",
                                              "udp",
                                              "both",
                                              "yes",
                                              "no",
                                              "80",
                                              "65535",
                                              "65536",
                                              "1-2",
                                              "9-1",
                                              ",",
                                              "-",
                                              " ",
                                              "\"",
                                              "#",
                                              ";",
                                              "\xEF\xBB\xBF",
                                              std::string("\0", 1),
                                              "\t",
                                              "owner=x",
                                              "00000",
                                              "123456"};
  std::mt19937 rng(20240611);
  std::uniform_int_distribution<size_t> pick(0, fragments.size() - 1);
  std::uniform_int_distribution<int> length(0, 60);
  for (int round = 0; round < 10000; ++round) {
    std::string text;
    int count = length(rng);
    for (int i = 0; i < count; ++i) {
      text += fragments[pick(rng)];
    }
    ASSERT_EQ(RunOne(text), 0) << text;
  }
}

} // namespace
