// Random secrets and their comparison.
#include "random_token.h"

#include <gtest/gtest.h>

#include <set>

namespace zark::host {
namespace {

TEST(HostToken, RandomHexIs32LowerCaseDigits) {
  std::set<std::string> seen;
  for (int i = 0; i < 64; ++i) {
    std::optional<std::string> hex = RandomHex128();
    ASSERT_TRUE(hex.has_value());
    EXPECT_EQ(hex->size(), 32u);
    EXPECT_EQ(hex->find_first_not_of("0123456789abcdef"), std::string::npos);
    seen.insert(*hex);
  }
  EXPECT_EQ(seen.size(), 64u);
}

TEST(HostToken, ConstantTimeEqualsComparesWholeStrings) {
  EXPECT_TRUE(ConstantTimeEquals("", ""));
  EXPECT_TRUE(ConstantTimeEquals("abc", "abc"));
  EXPECT_FALSE(ConstantTimeEquals("abc", "abd"));
  EXPECT_FALSE(ConstantTimeEquals("abc", "xbc"));
  EXPECT_FALSE(ConstantTimeEquals("abc", "abcd"));
  EXPECT_FALSE(ConstantTimeEquals("abc", ""));
  EXPECT_FALSE(ConstantTimeEquals(std::string_view("a\0b", 3),
                                  std::string_view("a\0c", 3)));
}

} // namespace
} // namespace zark::host
