#include "file_exist_probe.h"

#include "hermetic.h"
#include "klibc.h"

#include <dlfcn.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace zark::moduletest {
namespace {

// Plain arrays with constant initialisation: the first call may come from a
// static initialiser, before any dynamic initialisation of this file.
constexpr int kMaxCalls = 64;
constexpr int kMaxPath = 256;
struct Slot {
  char path[kMaxPath];
  bool beforeNamespace;
  int result;
};
Slot gSlots[kMaxCalls];
std::atomic<int> gCount{0};
std::atomic<int> gFirst{0}; // calls before this index were cleared

using FileExistFn = int (*)(const char *);

// Makes the test executable itself depend on the core library, so that the
// library is in the global scope where RTLD_NEXT finds the real call even
// when only a dlopen()ed module uses it.
[[maybe_unused]] int (*const volatile kKeepCoreLibrary)(void) = KLIBCErrGet;

FileExistFn RealFileExist() {
  static FileExistFn real =
      reinterpret_cast<FileExistFn>(dlsym(RTLD_NEXT, "KLIBCFileExist"));
  if (!real) {
    fprintf(stderr, "file_exist_probe: the core library's KLIBCFileExist "
                    "is not loaded\n");
    std::abort();
  }
  return real;
}

} // namespace

std::vector<FileExistCall> FileExistCalls() {
  std::vector<FileExistCall> calls;
  int end = std::min(gCount.load(), kMaxCalls);
  for (int i = gFirst.load(); i < end; ++i) {
    calls.push_back(
        {gSlots[i].path, gSlots[i].beforeNamespace, gSlots[i].result});
  }
  return calls;
}

void ClearFileExistCalls() {
  gFirst = std::min(gCount.load(), kMaxCalls);
}

} // namespace zark::moduletest

extern "C" int KLIBCFileExist(const char *path) {
  using namespace zark::moduletest;
  bool before = !zark::test::InPrivateMountNamespace();
  int result = before ? 0 : RealFileExist()(path);
  int index = gCount.fetch_add(1);
  if (index < kMaxCalls) {
    snprintf(gSlots[index].path, kMaxPath, "%s", path ? path : "(null)");
    gSlots[index].beforeNamespace = before;
    gSlots[index].result = result;
  }
  return result;
}
