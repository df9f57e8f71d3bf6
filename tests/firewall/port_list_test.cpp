// Port lists of firewall sections.
#include "port_list.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

using zark::fw::ParsePortList;
using Items = std::vector<std::string>;

TEST(FirewallPortList, AcceptsTheThreeItemForms) {
  auto parsed = ParsePortList("21,55536-55899,8080-");
  ASSERT_TRUE(parsed.ok) << parsed.problem;
  EXPECT_EQ(parsed.items, (Items{"21", "55536-55899", "8080-"}));
  EXPECT_EQ(parsed.problem, "");
}

TEST(FirewallPortList, TrimsBlanksAroundItems) {
  auto parsed = ParsePortList("  445 ,\t139  ");
  ASSERT_TRUE(parsed.ok) << parsed.problem;
  EXPECT_EQ(parsed.items, (Items{"445", "139"}));
}

TEST(FirewallPortList, EmptyTextIsAnEmptyList) {
  for (const char *text : {"", "   ", "\t"}) {
    auto parsed = ParsePortList(text);
    EXPECT_TRUE(parsed.ok) << "[" << text << "]";
    EXPECT_TRUE(parsed.items.empty()) << "[" << text << "]";
  }
}

TEST(FirewallPortList, AcceptsTheWholePortSpace) {
  auto parsed = ParsePortList("0,65535,0-65535,65535-65535");
  ASSERT_TRUE(parsed.ok) << parsed.problem;
  EXPECT_EQ(parsed.items.size(), 4u);
}

TEST(FirewallPortList, RefusesPortsPastTheEnd) {
  for (const char *text : {"65536", "65530-65540", "99999", "1-70000"}) {
    auto parsed = ParsePortList(text);
    EXPECT_FALSE(parsed.ok) << text;
    EXPECT_TRUE(parsed.items.empty()) << text;
    EXPECT_NE(parsed.problem, "") << text;
  }
}

TEST(FirewallPortList, RefusesBackwardRanges) {
  auto parsed = ParsePortList("90-80");
  EXPECT_FALSE(parsed.ok);
  EXPECT_NE(parsed.problem.find("90-80"), std::string::npos) << parsed.problem;
}

TEST(FirewallPortList, RefusesEmptyItems) {
  for (const char *text : {"80,,90", "80,", ",80", ","}) {
    auto parsed = ParsePortList(text);
    EXPECT_FALSE(parsed.ok) << text;
    EXPECT_EQ(parsed.problem, "empty port item") << text;
  }
}

TEST(FirewallPortList, RefusesOtherText) {
  for (const char *text : {"http", "80a", "-80", "8 0", "80 - 90", "+80",
                           "0x50", "80-90-100", "000080", "1-2-", "80;90"}) {
    auto parsed = ParsePortList(text);
    EXPECT_FALSE(parsed.ok) << text;
    EXPECT_TRUE(parsed.items.empty()) << text;
  }
}

TEST(FirewallPortList, OneBadItemRefusesTheWholeList) {
  auto parsed = ParsePortList("21,22,x,23");
  EXPECT_FALSE(parsed.ok);
  EXPECT_TRUE(parsed.items.empty());
  EXPECT_EQ(parsed.problem, "bad port \"x\"");
}

} // namespace
