// Service definition files, parsed from text.
#include "service_file.h"

#include "zarkfw.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

using zark::fw::ParseServiceFile;
using zark::fw::ServiceFileParse;
using Names = std::vector<std::string>;

// True when some problem line contains text.
bool HasProblem(const ServiceFileParse &parsed, const std::string &text) {
  for (const std::string &problem : parsed.problems) {
    if (problem.find(text) != std::string::npos) {
      return true;
    }
  }
  return false;
}

TEST(FirewallServiceFile, ReadsEveryKeyOfASection) {
  auto parsed = ParseServiceFile("# FTP\n"
                                 "[ftp_passive]\n"
                                 "title=\"FTP passive data ports\"\n"
                                 "protocol=tcp\n"
                                 "ports=55536-55899\n"
                                 "forwardable=yes\n");
  EXPECT_TRUE(parsed.problems.empty());
  EXPECT_EQ(parsed.sectionNames, Names{"ftp_passive"});
  ASSERT_EQ(parsed.sections.size(), 1u);
  const auto &section = parsed.sections[0];
  EXPECT_EQ(section.name, "ftp_passive");
  EXPECT_EQ(section.line, 2);
  EXPECT_EQ(section.title, "FTP passive data ports");
  EXPECT_EQ(section.protoMask, ZARK_FW_PROTO_TCP);
  EXPECT_TRUE(section.forwardable);
  ASSERT_TRUE(section.ports.has_value());
  EXPECT_EQ(*section.ports, Names{"55536-55899"});
}

TEST(FirewallServiceFile, ProtocolWordsGiveTheirMasks) {
  auto parsed = ParseServiceFile("[t]\nprotocol=tcp\nports=1\n"
                                 "[u]\nprotocol=udp\nports=2\n"
                                 "[b]\nprotocol=both\nports=3\n");
  ASSERT_EQ(parsed.sections.size(), 3u);
  EXPECT_EQ(parsed.sections[0].protoMask, 1);
  EXPECT_EQ(parsed.sections[1].protoMask, 2);
  EXPECT_EQ(parsed.sections[2].protoMask, 3);
}

TEST(FirewallServiceFile, ForwardableDefaultsToYesAndNoClearsIt) {
  auto parsed =
      ParseServiceFile("[a]\nprotocol=tcp\nports=1\n"
                       "[b]\nprotocol=tcp\nports=2\nforwardable=no\n");
  ASSERT_EQ(parsed.sections.size(), 2u);
  EXPECT_TRUE(parsed.sections[0].forwardable);
  EXPECT_FALSE(parsed.sections[1].forwardable);
}

TEST(FirewallServiceFile, MissingPortsKeyIsNoListAndEmptyValueAnEmptyOne) {
  auto parsed = ParseServiceFile("[none]\nprotocol=tcp\n"
                                 "[empty]\nprotocol=udp\nports=\n");
  ASSERT_EQ(parsed.sections.size(), 2u);
  EXPECT_FALSE(parsed.sections[0].ports.has_value());
  ASSERT_TRUE(parsed.sections[1].ports.has_value());
  EXPECT_TRUE(parsed.sections[1].ports->empty());
}

TEST(FirewallServiceFile, BadSectionIsSkippedAndTheRestKept) {
  auto parsed = ParseServiceFile("[good1]\nprotocol=tcp\nports=21\n"
                                 "[badports]\nprotocol=tcp\nports=21,abc\n"
                                 "[good2]\nprotocol=udp\nports=1194\n");
  ASSERT_EQ(parsed.sections.size(), 2u);
  EXPECT_EQ(parsed.sections[0].name, "good1");
  EXPECT_EQ(parsed.sections[1].name, "good2");
  EXPECT_EQ(parsed.sectionNames, (Names{"good1", "badports", "good2"}));
  EXPECT_TRUE(HasProblem(
      parsed, "line 4: section [badports] skipped: bad port \"abc\""));
}

TEST(FirewallServiceFile, RefusesBadProtocolAndForwardable) {
  auto parsed =
      ParseServiceFile("[p1]\nports=1\n"
                       "[p2]\nprotocol=TCP\nports=1\n"
                       "[p3]\nprotocol=tcp,udp\nports=1\n"
                       "[f1]\nprotocol=tcp\nports=1\nforwardable=1\n");
  EXPECT_TRUE(parsed.sections.empty());
  EXPECT_TRUE(HasProblem(parsed, "section [p1] skipped: no protocol"));
  EXPECT_TRUE(HasProblem(parsed, "section [p2] skipped: bad protocol \"TCP\""));
  EXPECT_TRUE(HasProblem(parsed, "section [p3] skipped: bad protocol"));
  EXPECT_TRUE(HasProblem(parsed, "section [f1] skipped: bad forwardable"));
}

TEST(FirewallServiceFile, KeysBeforeAnyHeaderAreIgnored) {
  auto parsed = ParseServiceFile("protocol=tcp\nports=80\n");
  EXPECT_TRUE(parsed.sections.empty());
  EXPECT_TRUE(parsed.sectionNames.empty());
  EXPECT_TRUE(HasProblem(parsed, "line 1: key \"protocol\" ignored: no "
                                 "section header before it"));
  EXPECT_TRUE(HasProblem(parsed, "no section header"));
}

TEST(FirewallServiceFile, EmptyTextHasNothing) {
  auto parsed = ParseServiceFile("");
  EXPECT_TRUE(parsed.sections.empty());
  EXPECT_TRUE(parsed.sectionNames.empty());
  EXPECT_TRUE(HasProblem(parsed, "no section header"));
}

TEST(FirewallServiceFile, RepeatedSectionKeepsTheFirst) {
  auto parsed = ParseServiceFile("[a]\nprotocol=tcp\nports=1\n"
                                 "[a]\nprotocol=udp\nports=2\n");
  ASSERT_EQ(parsed.sections.size(), 1u);
  EXPECT_EQ(parsed.sections[0].protoMask, ZARK_FW_PROTO_TCP);
  EXPECT_EQ(parsed.sectionNames, Names{"a"});
  EXPECT_TRUE(HasProblem(parsed, "line 4: section [a] skipped: repeats"));
}

TEST(FirewallServiceFile, RepeatedKeyKeepsTheFirstValue) {
  auto parsed = ParseServiceFile("[a]\nprotocol=tcp\nports=1\nports=2\n");
  ASSERT_EQ(parsed.sections.size(), 1u);
  EXPECT_EQ(*parsed.sections[0].ports, Names{"1"});
  EXPECT_TRUE(HasProblem(parsed, "line 4: repeated key \"ports\""));
}

TEST(FirewallServiceFile, FollowsTheKeyValueLineSyntax) {
  // Blanks, CRLF endings, quoting, both comment marks, a byte order mark,
  // text after "]" and unknown keys.
  auto parsed = ParseServiceFile("\xEF\xBB\xBF; comment\r\n"
                                 "  [ web ]  trailing\r\n"
                                 "  protocol =  tcp \r\n"
                                 "ports = \" 80 , 443 \"\r\n"
                                 "# another\r\n"
                                 "owner=some tool\r\n");
  ASSERT_EQ(parsed.sections.size(), 1u)
      << ::testing::PrintToString(parsed.problems);
  EXPECT_EQ(parsed.sections[0].name, "web");
  EXPECT_EQ(*parsed.sections[0].ports, (Names{"80", "443"}));
  EXPECT_TRUE(parsed.problems.empty())
      << ::testing::PrintToString(parsed.problems);
}

TEST(FirewallServiceFile, HeaderWithoutClosingBracketIsNoHeader) {
  auto parsed = ParseServiceFile("[a]\nprotocol=tcp\nports=1\n[b\nports=2\n");
  EXPECT_EQ(parsed.sectionNames, Names{"a"});
  ASSERT_EQ(parsed.sections.size(), 1u);
  // "ports=2" then belongs to [a] again, whose first ports value counts.
  EXPECT_EQ(*parsed.sections[0].ports, Names{"1"});
  EXPECT_TRUE(HasProblem(parsed, "line 4: ignored: section header without"));
}

TEST(FirewallServiceFile, RefusesEmptyAndOverlongNames) {
  std::string longName(zark::fw::kMaxSectionName + 1, 'n');
  std::string fitting(zark::fw::kMaxSectionName, 'f');
  auto parsed = ParseServiceFile("[]\nprotocol=tcp\nports=1\n[" + longName +
                                 "]\nprotocol=tcp\nports=1\n[" + fitting +
                                 "]\nprotocol=tcp\nports=1\n");
  ASSERT_EQ(parsed.sections.size(), 1u);
  EXPECT_EQ(parsed.sections[0].name, fitting);
  EXPECT_TRUE(HasProblem(parsed, "empty section name"));
  EXPECT_TRUE(HasProblem(parsed, "section name longer than 255 bytes"));
}

TEST(FirewallServiceFile, StrayLinesAreReportedButDoNotSkipTheSection) {
  auto parsed = ParseServiceFile("[a]\nprotocol=tcp\njunk line\nports=1\n");
  ASSERT_EQ(parsed.sections.size(), 1u);
  EXPECT_TRUE(HasProblem(parsed, "line 3: ignored: not a section header"));
}

} // namespace
