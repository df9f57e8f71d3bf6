#include "polling_seam.h"

#include <dlfcn.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <mutex>

namespace zark::moduletest {
namespace {

std::atomic<bool> gListFails{false};
std::atomic<bool> gStartCaptures{false};
std::mutex gMutex;
std::vector<CapturedStart> gCaptured;

// The facility's own member functions, found by their mangled names.
const char kListSymbol[] =
    "_ZN4ZARK10APIPolling4ListERKNSt7__cxx1112basic_stringIcSt11char_"
    "traitsIcESaIcEEERKN4Json5ValueERSA_";
const char kStartSymbol[] =
    "_ZN4ZARK10APIPolling5StartEPNS_11APIResponseEPFvPNS_10APIRequestES2_"
    "PvES5_";

void *Real(const char *symbol) {
  void *real = dlsym(RTLD_NEXT, symbol);
  if (!real) {
    fprintf(stderr, "polling_seam: %s not found in the framework\n", symbol);
    std::abort();
  }
  return real;
}

} // namespace

void SetListFails(bool fails) {
  gListFails = fails;
}
void SetStartCaptures(bool captures) {
  gStartCaptures = captures;
}

std::vector<CapturedStart> CapturedStarts() {
  std::lock_guard lock(gMutex);
  return gCaptured;
}

void ResetPollingSeam() {
  gListFails = false;
  gStartCaptures = false;
  std::lock_guard lock(gMutex);
  gCaptured.clear();
}

} // namespace zark::moduletest

namespace ZARK {

bool APIPolling::List(const std::string &prefix, const Json::Value &groups,
                      Json::Value &result) {
  using RealList = bool (*)(APIPolling *, const std::string &,
                            const Json::Value &, Json::Value &);
  static RealList real = reinterpret_cast<RealList>(
      zark::moduletest::Real(zark::moduletest::kListSymbol));
  if (zark::moduletest::gListFails) {
    return false;
  }
  return real(this, prefix, groups, result);
}

bool APIPolling::Start(APIResponse *response, APIPollingCallback callback,
                       void *argument) {
  using RealStart =
      bool (*)(APIPolling *, APIResponse *, APIPollingCallback, void *);
  static RealStart real = reinterpret_cast<RealStart>(
      zark::moduletest::Real(zark::moduletest::kStartSymbol));
  if (zark::moduletest::gStartCaptures) {
    std::lock_guard lock(zark::moduletest::gMutex);
    zark::moduletest::gCaptured.push_back({callback, argument});
    return true;
  }
  return real(this, response, callback, argument);
}

} // namespace ZARK
