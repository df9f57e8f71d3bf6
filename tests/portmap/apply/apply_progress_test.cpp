// Progress percentages and lines of applying rules. Pure.
#include "apply/apply_progress.h"

#include <gtest/gtest.h>

namespace zark::portmap {
namespace {

TEST(PortMapRouterApplyProgress, DeletionsAreTheFirstHalf) {
  EXPECT_EQ(0, ProgressPercentage("del", 0, 6));
  EXPECT_EQ(25, ProgressPercentage("del", 3, 6));
  EXPECT_EQ(50, ProgressPercentage("del", 6, 6));
  EXPECT_EQ(50, ProgressPercentage("del", 0, 0));
}

TEST(PortMapRouterApplyProgress, AdditionsAreTheSecondHalf) {
  EXPECT_EQ(50, ProgressPercentage("add", 0, 4));
  EXPECT_EQ(75, ProgressPercentage("add", 3, 6));
  EXPECT_EQ(100, ProgressPercentage("add", 6, 6));
  EXPECT_EQ(100, ProgressPercentage("add", 9, 6));
  EXPECT_EQ(100, ProgressPercentage("add", 0, 0));
}

TEST(PortMapRouterApplyProgress, Lines) {
  EXPECT_EQ("del=3/6\n", ProgressLine("del", 3, 6));
  EXPECT_EQ("add=0/0\n", ProgressLine("add", 0, 0));
}

} // namespace
} // namespace zark::portmap
