// The saved request corpus: each line of corpus/requests.tsv is an expected
// outcome, a tab, and a request line (with \t, \r, \n, \\ and \xHH
// escapes). Every corpus line and every line drawn from a fixed-seed
// generator of the characters that matter to the parser must also keep the
// parser's promises (probe_request_fuzz.cpp).
#include "probe_protocol.h"
#include "probe_request_fuzz.h"

#include <gtest/gtest.h>

#include <fstream>
#include <random>
#include <string>

namespace zark::probe {
namespace {

std::string Unescape(const std::string &text) {
  std::string out;
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '\\' || i + 1 == text.size()) {
      out += text[i];
      continue;
    }
    char next = text[++i];
    switch (next) {
    case 't':
      out += '\t';
      break;
    case 'r':
      out += '\r';
      break;
    case 'n':
      out += '\n';
      break;
    case 'x':
      out += static_cast<char>(std::stoi(text.substr(i + 1, 2), nullptr, 16));
      i += 2;
      break;
    default:
      out += next;
      break;
    }
  }
  return out;
}

std::string Outcome(const std::string &line) {
  ParsedRequest parsed = ParseRequestLine(line);
  if (parsed.error != ParseError::kNone) {
    return ParseErrorName(parsed.error);
  }
  std::string canonical = FormatRequest(parsed.request);
  canonical.pop_back();
  return "ok " + canonical;
}

TEST(ProbeRequestCorpus, SavedLinesParseAsRecorded) {
  std::ifstream in(ZARK_PROBE_CORPUS_DIR "/requests.tsv");
  ASSERT_TRUE(in.good()) << "corpus missing in " << ZARK_PROBE_CORPUS_DIR;
  std::string row;
  int lines = 0;
  while (std::getline(in, row)) {
    if (row.empty() || row[0] == '#') {
      continue;
    }
    std::size_t tab = row.find('\t');
    ASSERT_NE(std::string::npos, tab) << row;
    const std::string expected = row.substr(0, tab);
    const std::string line = Unescape(row.substr(tab + 1));
    EXPECT_EQ(expected, Outcome(line)) << "[" << row.substr(tab + 1) << "]";
    EXPECT_EQ("", test::CheckRequestParse(line)) << row;
    ++lines;
  }
  EXPECT_GE(lines, 40);
}

TEST(ProbeRequestCorpus, GeneratedLinesKeepThePromises) {
  using namespace std::string_literals;
  const std::string kPieces[] = {
      "check", "address", "tcp",   "udp",   " ", "\t", "\r",       "0",
      "1",     "8080",    "65535", "65536", ".", ":",  "a",        "Z",
      "-",     "_",       "\0"s,   "\xff",  "[", "]",  "10.0.0.1", "::1"};
  std::mt19937 generator(20240917);
  std::uniform_int_distribution<std::size_t> length(0, 12);
  std::uniform_int_distribution<std::size_t> pick(0, std::size(kPieces) - 1);
  int accepted = 0;
  for (int round = 0; round < 20000; ++round) {
    std::string line;
    for (std::size_t n = length(generator); n > 0; --n) {
      line += kPieces[pick(generator)];
    }
    const std::string broken = test::CheckRequestParse(line);
    ASSERT_EQ("", broken) << "input: [" << line << "]";
    accepted += ParseRequestLine(line).error == ParseError::kNone ? 1 : 0;
  }
  // The generator does reach accepted requests, not only refusals.
  EXPECT_GT(accepted, 0);
}

} // namespace
} // namespace zark::probe
