// Runs the saved fuzz corpus, and deterministic mutations of it, through
// the fuzz target's checks as ordinary tests.
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

namespace fs = std::filesystem;

std::vector<std::string> Corpus() {
  std::vector<std::string> inputs;
  for (const auto &entry : fs::directory_iterator(ZARK_DETECT_CORPUS_DIR)) {
    std::ifstream in(entry.path(), std::ios::binary);
    std::stringstream content;
    content << in.rdbuf();
    inputs.push_back(content.str());
  }
  return inputs;
}

int RunOne(const std::string &input) {
  return LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t *>(input.data()),
                                input.size());
}

TEST(DetectFuzzCorpus, SavedCorpusKeepsTheParsersPromises) {
  const std::vector<std::string> inputs = Corpus();
  EXPECT_GE(inputs.size(), 12u);
  for (const std::string &input : inputs) {
    EXPECT_EQ(0, RunOne(input));
  }
}

// Flipped, cut, repeated and spliced bytes of every corpus input, the first
// byte (the parser's choice) kept.
TEST(DetectFuzzCorpus, MutationsKeepTheParsersPromises) {
  const std::vector<std::string> inputs = Corpus();
  std::mt19937 random(20240613);
  int runs = 0;
  for (const std::string &input : inputs) {
    for (int round = 0; round < 300; ++round) {
      std::string mutated = input;
      const int edits = 1 + static_cast<int>(random() % 8);
      for (int edit = 0; edit < edits && mutated.size() > 1; ++edit) {
        const std::size_t at = 1 + random() % (mutated.size() - 1);
        switch (random() % 5) {
        case 0:
          mutated[at] = static_cast<char>(random());
          break;
        case 1:
          mutated.resize(at);
          break;
        case 2:
          mutated.insert(at, mutated.substr(at, random() % 16));
          break;
        case 3:
          mutated.erase(at, random() % 8);
          break;
        default: {
          const std::string &other = inputs[random() % inputs.size()];
          mutated.insert(at, other.substr(1, random() % 64));
          break;
        }
        }
      }
      EXPECT_EQ(0, RunOne(mutated));
      ++runs;
    }
  }
  EXPECT_EQ(static_cast<int>(inputs.size()) * 300, runs);
}

} // namespace
