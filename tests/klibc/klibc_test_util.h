// Helpers shared by the core library's tests.
#ifndef ZARK_TESTS_KLIBC_TEST_UTIL_H
#define ZARK_TESTS_KLIBC_TEST_UTIL_H

#include "klibc.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

namespace zark::test {

struct SzListDeleter {
  void operator()(KLIBSZLIST *list) const { KLIBCSzListFree(list); }
};
using SzListPtr = std::unique_ptr<KLIBSZLIST, SzListDeleter>;

// A list allocated with the module's usual capacity, or the given one.
inline SzListPtr MakeList(int capacity = 1024) {
  return SzListPtr(KLIBCSzListAlloc(capacity));
}

// Lets a call that takes KLIBSZLIST** update the owning pointer.
class ListSlot {
public:
  explicit ListSlot(SzListPtr &owner) : mOwner(owner), mRaw(owner.release()) {}
  ~ListSlot() { mOwner.reset(mRaw); }
  ListSlot(const ListSlot &) = delete;
  ListSlot &operator=(const ListSlot &) = delete;
  operator KLIBSZLIST **() { return &mRaw; }

private:
  SzListPtr &mOwner;
  KLIBSZLIST *mRaw;
};

inline std::vector<std::string> Items(const KLIBSZLIST *list) {
  std::vector<std::string> items;
  for (int i = 0; i < list->nItem; ++i) {
    items.emplace_back(KLIBCSzListGet(list, i));
  }
  return items;
}

// Puts the calling thread's error state back to "nothing recorded".
inline void ClearError() {
  KLIBCErrSetEx(KLIBC_ERR_NONE, nullptr, 0);
}

// Checks the recorded error code and that it names a source of the library
// and a line.
inline void ExpectError(int code) {
  EXPECT_EQ(KLIBCErrGet(), code);
  EXPECT_EQ(std::string(KLIBCErrorGetFile()).rfind("platform/klibc/src/", 0),
            0u)
      << KLIBCErrorGetFile();
  EXPECT_GT(KLIBCErrorGetLine(), 0);
}

inline void ExpectNoError() {
  EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_NONE);
  EXPECT_STREQ(KLIBCErrorGetFile(), "");
  EXPECT_EQ(KLIBCErrorGetLine(), 0);
}

} // namespace zark::test

#endif
