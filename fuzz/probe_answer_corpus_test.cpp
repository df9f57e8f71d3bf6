// Saved answers of the probe service (corpus/answers.tsv: expected status,
// a tab, the answer line) and answers drawn from a fixed-seed generator of
// the pieces that matter to the parser, all through the fuzz target's
// checks.
#include "probe_answer_fuzz.h"
#include "reach/probe_client.h"

#include <gtest/gtest.h>

#include <fstream>
#include <random>

namespace zark::portmap {
namespace {

std::string Outcome(const std::string &line) {
  std::optional<ProbeAnswer> answer = ParseProbeAnswer(line);
  return answer ? ProbeStatusName(answer->status) : "none";
}

TEST(PortTestProbeAnswerCorpus, SavedAnswersParseAsRecorded) {
  std::ifstream in(ZARK_PORTTEST_CORPUS_DIR "/answers.tsv");
  ASSERT_TRUE(in.good()) << "corpus missing in " << ZARK_PORTTEST_CORPUS_DIR;
  std::string row;
  int lines = 0;
  while (std::getline(in, row)) {
    if (row.empty() || row[0] == '#') {
      continue;
    }
    std::size_t tab = row.find('\t');
    ASSERT_NE(std::string::npos, tab) << row;
    const std::string line = row.substr(tab + 1);
    EXPECT_EQ(row.substr(0, tab), Outcome(line)) << line;
    EXPECT_EQ("", porttest::CheckAnswerParse(line)) << line;
    ++lines;
  }
  EXPECT_GE(lines, 20);
}

TEST(PortTestProbeAnswerCorpus, GeneratedAnswersKeepThePromises) {
  const std::string kPieces[] = {"{",
                                 "}",
                                 "\"result\"",
                                 "\"reason\"",
                                 "\"address\"",
                                 ":",
                                 ",",
                                 "\"reachable\"",
                                 "\"error\"",
                                 "\"rate-limited\"",
                                 "\"retry_after_ms\"",
                                 "-1",
                                 "250",
                                 "\"\"",
                                 "[",
                                 "]",
                                 "null",
                                 " ",
                                 "\"detail\"",
                                 "\\u0000",
                                 "1e999",
                                 "\"x\""};
  std::mt19937 generator(20240918);
  std::uniform_int_distribution<std::size_t> length(0, 14);
  std::uniform_int_distribution<std::size_t> pick(0, std::size(kPieces) - 1);
  for (int round = 0; round < 20000; ++round) {
    std::string line;
    for (std::size_t n = length(generator); n > 0; --n) {
      line += kPieces[pick(generator)];
    }
    ASSERT_EQ("", porttest::CheckAnswerParse(line))
        << "input: [" << line << "]";
  }
}

} // namespace
} // namespace zark::portmap
