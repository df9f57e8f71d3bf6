#include "klibc.h"
#include "klibc_test_util.h"

#include <gtest/gtest.h>

#include <ostream>
#include <string>
#include <vector>

namespace zark::test {
namespace {

using Strings = std::vector<std::string>;

struct SplitCase {
  const char *name; // names the case in test names
  const char *text;
  const char *sep;
  Strings sepPieces; // KLIBCStrSep
  Strings tokPieces; // KLIBCStrTok
};

void PrintTo(const SplitCase &c, std::ostream *out) {
  *out << c.name;
}

class KlibcStrSplit : public ::testing::TestWithParam<SplitCase> {
protected:
  void SetUp() override { ClearError(); }
};

TEST_P(KlibcStrSplit, StrSepKeepsEmptyPieces) {
  const SplitCase &c = GetParam();
  SzListPtr list = MakeList();
  EXPECT_EQ(KLIBCStrSep(c.text, c.sep, ListSlot(list)),
            static_cast<int>(c.sepPieces.size()));
  EXPECT_EQ(Items(list.get()), c.sepPieces);
  ExpectNoError();
}

TEST_P(KlibcStrSplit, StrTokSkipsEmptyPieces) {
  const SplitCase &c = GetParam();
  SzListPtr list = MakeList();
  EXPECT_EQ(KLIBCStrTok(c.text, c.sep, ListSlot(list)),
            static_cast<int>(c.tokPieces.size()));
  EXPECT_EQ(Items(list.get()), c.tokPieces);
  ExpectNoError();
}

INSTANTIATE_TEST_SUITE_P(
    Klibc, KlibcStrSplit,
    ::testing::Values(
        SplitCase{"Empty", "", ",", {}, {}},
        SplitCase{"LoneSeparator", ",", ",", {"", ""}, {}},
        SplitCase{"OnePiece", "a", ",", {"a"}, {"a"}},
        SplitCase{"TwoPieces", "a,b", ",", {"a", "b"}, {"a", "b"}},
        SplitCase{"EmptyMiddle", "a,,b", ",", {"a", "", "b"}, {"a", "b"}},
        SplitCase{"EmptyBothEnds", ",a,", ",", {"", "a", ""}, {"a"}},
        SplitCase{"EmptyEnd", "a,", ",", {"a", ""}, {"a"}},
        SplitCase{
            "MixedEmpties", ",a,,b,", ",", {"", "a", "", "b", ""}, {"a", "b"}},
        SplitCase{"OnlySeparators", ",,,", ",", {"", "", "", ""}, {}},
        // sep is a set of characters, not a string
        SplitCase{
            "SeparatorSet", "a,b;c", ",;", {"a", "b", "c"}, {"a", "b", "c"}},
        SplitCase{
            "AdjacentSetMembers", "a;,b", ",;", {"a", "", "b"}, {"a", "b"}},
        SplitCase{"BlankSeparators",
                  "80 443\t8080",
                  " \t",
                  {"80", "443", "8080"},
                  {"80", "443", "8080"}},
        SplitCase{"AllSeparators", "ab", "ba", {"", "", ""}, {}},
        // blanks are kept: only the separators split
        SplitCase{"BlanksKept", " a , b ", ",", {" a ", " b "}, {" a ", " b "}},
        SplitCase{"PortRanges",
                  "8000-8010,9000-",
                  ",",
                  {"8000-8010", "9000-"},
                  {"8000-8010", "9000-"}},
        // no separators: the whole text is one piece
        SplitCase{"NoSeparators", "a,b", "", {"a,b"}, {"a,b"}},
        SplitCase{"EmptyWithNoSeparators", "", "", {}, {}}));

class KlibcStrSplitList : public ::testing::Test {
protected:
  void SetUp() override { ClearError(); }
};

TEST_F(KlibcStrSplitList, AppendsAfterExistingItems) {
  SzListPtr list = MakeList();
  ASSERT_EQ(KLIBCSzListPush(ListSlot(list), "first"), 0);
  EXPECT_EQ(KLIBCStrSep("a,b", ",", ListSlot(list)), 2);
  EXPECT_EQ(KLIBCStrTok(",c,", ",", ListSlot(list)), 1);
  EXPECT_EQ(Items(list.get()), (Strings{"first", "a", "b", "c"}));
}

TEST_F(KlibcStrSplitList, GrowsTheListAndUpdatesThePointer) {
  SzListPtr list = MakeList(1);
  std::string text;
  Strings expected;
  for (int i = 0; i < 300; ++i) {
    expected.push_back(std::to_string(i));
    text += (i == 0 ? "" : ",") + expected.back();
  }
  EXPECT_EQ(KLIBCStrSep(text.c_str(), ",", ListSlot(list)), 300);
  EXPECT_EQ(Items(list.get()), expected);
  EXPECT_GE(list->nAlloc, 300);
}

TEST_F(KlibcStrSplitList, RejectsNullArguments) {
  SzListPtr list = MakeList();
  KLIBSZLIST *none = nullptr;
  for (auto split : {KLIBCStrSep, KLIBCStrTok}) {
    ClearError();
    EXPECT_EQ(split(nullptr, ",", ListSlot(list)), -1);
    ExpectError(KLIBC_ERR_BAD_PARAMETER);
    ClearError();
    EXPECT_EQ(split("a", nullptr, ListSlot(list)), -1);
    ExpectError(KLIBC_ERR_BAD_PARAMETER);
    ClearError();
    EXPECT_EQ(split("a", ",", nullptr), -1);
    ExpectError(KLIBC_ERR_BAD_PARAMETER);
    ClearError();
    EXPECT_EQ(split("a", ",", &none), -1);
    ExpectError(KLIBC_ERR_BAD_PARAMETER);
  }
  EXPECT_EQ(list->nItem, 0);
}

TEST_F(KlibcStrSplitList, FailureAtTheHardLimitTakesBackItsPieces) {
  // One piece more than a list may hold: the split fails as a whole and
  // the list keeps only what it had before.
  std::string text(static_cast<std::size_t>(1 << 20), ',');
  SzListPtr list = MakeList();
  ASSERT_EQ(KLIBCSzListPush(ListSlot(list), "before"), 0);
  EXPECT_EQ(KLIBCStrSep(text.c_str(), ",", ListSlot(list)), -1);
  ExpectError(KLIBC_ERR_TOO_LARGE);
  EXPECT_EQ(Items(list.get()), (Strings{"before"}));
  ClearError();
  // StrTok skips the empty pieces, so the same text fits.
  EXPECT_EQ(KLIBCStrTok(text.c_str(), ",", ListSlot(list)), 0);
  ExpectNoError();
}

} // namespace
} // namespace zark::test
