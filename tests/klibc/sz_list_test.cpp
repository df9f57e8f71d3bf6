#include "klibc.h"
#include "klibc_test_util.h"
#include "sz_list.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace zark::test {
namespace {

using Strings = std::vector<std::string>;

class KlibcSzList : public ::testing::Test {
protected:
  void SetUp() override { ClearError(); }
};

TEST_F(KlibcSzList, AllocStartsEmptyWithTheAskedCapacity) {
  SzListPtr list = MakeList(1024);
  ASSERT_NE(list, nullptr);
  EXPECT_EQ(list->nItem, 0);
  EXPECT_EQ(list->nAlloc, 1024);
  ExpectNoError();
}

TEST_F(KlibcSzList, AllocOfZeroCapacityStillHasRoomForOne) {
  SzListPtr list = MakeList(0);
  ASSERT_NE(list, nullptr);
  EXPECT_EQ(list->nItem, 0);
  EXPECT_EQ(list->nAlloc, 1);
}

TEST_F(KlibcSzList, AllocRejectsNegativeCapacity) {
  EXPECT_EQ(KLIBCSzListAlloc(-1), nullptr);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
}

TEST_F(KlibcSzList, AllocRejectsCapacityPastTheHardLimit) {
  EXPECT_EQ(KLIBCSzListAlloc(klibc::kSzListMaxItems + 1), nullptr);
  ExpectError(KLIBC_ERR_TOO_LARGE);
}

TEST_F(KlibcSzList, FreeAcceptsNull) {
  KLIBCSzListFree(nullptr);
  ExpectNoError();
}

TEST_F(KlibcSzList, PushReturnsIndexAndCopiesText) {
  SzListPtr list = MakeList();
  std::string text = "alpha";
  EXPECT_EQ(KLIBCSzListPush(ListSlot(list), text.c_str()), 0);
  EXPECT_EQ(KLIBCSzListPush(ListSlot(list), "beta"), 1);
  EXPECT_EQ(KLIBCSzListPush(ListSlot(list), ""), 2);
  text[0] = 'X';
  EXPECT_EQ(Items(list.get()), (Strings{"alpha", "beta", ""}));
  EXPECT_EQ(list->nItem, 3);
  ExpectNoError();
}

TEST_F(KlibcSzList, PushGrowsPastCapacityAndUpdatesThePointer) {
  SzListPtr list = MakeList(1);
  KLIBSZLIST *raw = list.release();
  Strings expected;
  for (int i = 0; i < 100; ++i) {
    expected.push_back("item" + std::to_string(i));
    ASSERT_EQ(KLIBCSzListPush(&raw, expected.back().c_str()), i);
    ASSERT_NE(raw, nullptr);
    EXPECT_GE(raw->nAlloc, raw->nItem);
  }
  list.reset(raw);
  EXPECT_EQ(list->nItem, 100);
  EXPECT_EQ(Items(list.get()), expected);
  ExpectNoError();
}

TEST_F(KlibcSzList, PushStopsAtTheHardLimit) {
  SzListPtr list = MakeList(klibc::kSzListMaxItems);
  ASSERT_NE(list, nullptr);
  for (int i = 0; i < klibc::kSzListMaxItems; ++i) {
    ASSERT_EQ(KLIBCSzListPush(ListSlot(list), ""), i);
  }
  EXPECT_EQ(KLIBCSzListPush(ListSlot(list), "one too many"), -1);
  ExpectError(KLIBC_ERR_TOO_LARGE);
  EXPECT_EQ(list->nItem, klibc::kSzListMaxItems);
}

TEST_F(KlibcSzList, PushRejectsNullArguments) {
  SzListPtr list = MakeList();
  EXPECT_EQ(KLIBCSzListPush(ListSlot(list), nullptr), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCSzListPush(nullptr, "a"), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  KLIBSZLIST *none = nullptr;
  EXPECT_EQ(KLIBCSzListPush(&none, "a"), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  EXPECT_EQ(none, nullptr);
  EXPECT_EQ(list->nItem, 0);
}

TEST_F(KlibcSzList, GetRejectsIndicesOutsideTheList) {
  SzListPtr list = MakeList();
  ASSERT_EQ(KLIBCSzListPush(ListSlot(list), "only"), 0);
  EXPECT_STREQ(KLIBCSzListGet(list.get(), 0), "only");
  ExpectNoError();
  EXPECT_EQ(KLIBCSzListGet(list.get(), 1), nullptr);
  ExpectError(KLIBC_ERR_OUT_OF_RANGE);
  ClearError();
  EXPECT_EQ(KLIBCSzListGet(list.get(), -1), nullptr);
  ExpectError(KLIBC_ERR_OUT_OF_RANGE);
  ClearError();
  EXPECT_EQ(KLIBCSzListGet(nullptr, 0), nullptr);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
}

TEST_F(KlibcSzList, ErrorNamesTheListSourceAndLine) {
  SzListPtr list = MakeList();
  EXPECT_EQ(KLIBCSzListGet(list.get(), 0), nullptr);
  EXPECT_STREQ(KLIBCErrorGetFile(), "platform/klibc/src/sz_list.cpp");
  EXPECT_GT(KLIBCErrorGetLine(), 0);
}

TEST_F(KlibcSzList, RemoveKeepsTheOrderOfTheRest) {
  SzListPtr list = MakeList();
  for (const char *text : {"a", "b", "c", "d", "e"}) {
    ASSERT_GE(KLIBCSzListPush(ListSlot(list), text), 0);
  }
  EXPECT_EQ(KLIBCSzListRemove(list.get(), 1), 0);
  EXPECT_EQ(Items(list.get()), (Strings{"a", "c", "d", "e"}));
  EXPECT_EQ(KLIBCSzListRemove(list.get(), 3), 0);
  EXPECT_EQ(Items(list.get()), (Strings{"a", "c", "d"}));
  EXPECT_EQ(KLIBCSzListRemove(list.get(), 0), 0);
  EXPECT_EQ(Items(list.get()), (Strings{"c", "d"}));
  EXPECT_EQ(list->nItem, 2);
  ExpectNoError();
}

TEST_F(KlibcSzList, RemoveRejectsIndicesOutsideTheList) {
  SzListPtr list = MakeList();
  ASSERT_EQ(KLIBCSzListPush(ListSlot(list), "a"), 0);
  EXPECT_EQ(KLIBCSzListRemove(list.get(), 1), -1);
  ExpectError(KLIBC_ERR_OUT_OF_RANGE);
  ClearError();
  EXPECT_EQ(KLIBCSzListRemove(list.get(), -1), -1);
  ExpectError(KLIBC_ERR_OUT_OF_RANGE);
  ClearError();
  EXPECT_EQ(KLIBCSzListRemove(nullptr, 0), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  EXPECT_EQ(Items(list.get()), (Strings{"a"}));
}

TEST_F(KlibcSzList, RemoveAllEmptiesTheListWhichStaysUsable) {
  SzListPtr list = MakeList(2);
  for (const char *text : {"a", "b", "c"}) {
    ASSERT_GE(KLIBCSzListPush(ListSlot(list), text), 0);
  }
  EXPECT_EQ(KLIBCSzListRemoveAll(list.get()), 0);
  EXPECT_EQ(list->nItem, 0);
  EXPECT_EQ(KLIBCSzListGet(list.get(), 0), nullptr);
  EXPECT_EQ(KLIBCSzListPush(ListSlot(list), "again"), 0);
  EXPECT_EQ(Items(list.get()), (Strings{"again"}));
}

TEST_F(KlibcSzList, RemoveAllRejectsNull) {
  EXPECT_EQ(KLIBCSzListRemoveAll(nullptr), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
}

TEST_F(KlibcSzList, FindReturnsTheFirstEqualItem) {
  SzListPtr list = MakeList();
  for (const char *text : {"ssh", "http", "ftp", "http", ""}) {
    ASSERT_GE(KLIBCSzListPush(ListSlot(list), text), 0);
  }
  EXPECT_EQ(KLIBCSzListFind(list.get(), "ssh"), 0);
  EXPECT_EQ(KLIBCSzListFind(list.get(), "http"), 1);
  EXPECT_EQ(KLIBCSzListFind(list.get(), "ftp"), 2);
  EXPECT_EQ(KLIBCSzListFind(list.get(), ""), 4);
  ExpectNoError();
}

TEST_F(KlibcSzList, FindOfAnAbsentTextIsNegativeWithoutError) {
  SzListPtr list = MakeList();
  EXPECT_LT(KLIBCSzListFind(list.get(), "x"), 0);
  ASSERT_GE(KLIBCSzListPush(ListSlot(list), "HTTP"), 0);
  ASSERT_GE(KLIBCSzListPush(ListSlot(list), "http2"), 0);
  EXPECT_LT(KLIBCSzListFind(list.get(), "http"), 0);
  ExpectNoError();
}

TEST_F(KlibcSzList, FindRejectsNullArguments) {
  SzListPtr list = MakeList();
  EXPECT_EQ(KLIBCSzListFind(nullptr, "a"), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCSzListFind(list.get(), nullptr), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
}

SzListPtr ListOf(const Strings &items) {
  SzListPtr list = MakeList();
  for (const std::string &item : items) {
    EXPECT_GE(KLIBCSzListPush(ListSlot(list), item.c_str()), 0);
  }
  return list;
}

TEST_F(KlibcSzList, SortAscendingByByteValue) {
  SzListPtr list = ListOf({"udp", "b", "a", "ab", "B", "", "\xC3\xA9"});
  EXPECT_EQ(KLIBCSzListSortItems(list.get(), 1), 0);
  EXPECT_EQ(Items(list.get()),
            (Strings{"", "B", "a", "ab", "b", "udp", "\xC3\xA9"}));
  ExpectNoError();
}

TEST_F(KlibcSzList, SortDescendingForZero) {
  SzListPtr list = ListOf({"b", "a", "c", "ab"});
  EXPECT_EQ(KLIBCSzListSortItems(list.get(), 0), 0);
  EXPECT_EQ(Items(list.get()), (Strings{"c", "b", "ab", "a"}));
}

TEST_F(KlibcSzList, SortAscendingForAnyNonZero) {
  SzListPtr list = ListOf({"b", "a"});
  EXPECT_EQ(KLIBCSzListSortItems(list.get(), -7), 0);
  EXPECT_EQ(Items(list.get()), (Strings{"a", "b"}));
}

// The item pointers of the texts that start with c, in list order.
std::vector<const char *> ItemsStartingWith(const KLIBSZLIST *list, char c) {
  std::vector<const char *> found;
  for (int i = 0; i < list->nItem; ++i) {
    const char *item = KLIBCSzListGet(list, i);
    if (item[0] == c) {
      found.push_back(item);
    }
  }
  return found;
}

// Equal texts are told apart by their storage: a stable sort keeps the
// item pointers of equal texts in their old order, in both directions.
void ExpectStable(int ascending) {
  SzListPtr list = ListOf({"x", "m", "x", "a", "m", "x"});
  const std::vector<const char *> xs = ItemsStartingWith(list.get(), 'x');
  const std::vector<const char *> ms = ItemsStartingWith(list.get(), 'm');
  ASSERT_EQ(KLIBCSzListSortItems(list.get(), ascending), 0);
  EXPECT_EQ(Items(list.get()), ascending
                                   ? (Strings{"a", "m", "m", "x", "x", "x"})
                                   : (Strings{"x", "x", "x", "m", "m", "a"}));
  EXPECT_EQ(ItemsStartingWith(list.get(), 'x'), xs);
  EXPECT_EQ(ItemsStartingWith(list.get(), 'm'), ms);
}

TEST_F(KlibcSzList, SortIsStableAscending) {
  ExpectStable(1);
}

TEST_F(KlibcSzList, SortIsStableDescending) {
  ExpectStable(0);
}

TEST_F(KlibcSzList, SortOfEmptyListSucceeds) {
  SzListPtr list = MakeList();
  EXPECT_EQ(KLIBCSzListSortItems(list.get(), 1), 0);
  EXPECT_EQ(list->nItem, 0);
}

TEST_F(KlibcSzList, SortRejectsNull) {
  EXPECT_EQ(KLIBCSzListSortItems(nullptr, 1), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
}

TEST_F(KlibcSzList, SuccessLeavesAnEarlierErrorInPlace) {
  SzListPtr list = MakeList();
  EXPECT_EQ(KLIBCSzListGet(list.get(), 3), nullptr);
  const int line = KLIBCErrorGetLine();
  EXPECT_EQ(KLIBCSzListPush(ListSlot(list), "a"), 0);
  EXPECT_STREQ(KLIBCSzListGet(list.get(), 0), "a");
  EXPECT_EQ(KLIBCSzListSortItems(list.get(), 1), 0);
  EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_OUT_OF_RANGE);
  EXPECT_EQ(KLIBCErrorGetLine(), line);
}

} // namespace
} // namespace zark::test
