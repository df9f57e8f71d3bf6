// A seam in front of the host's polling facility for one test executable:
// List can be made to fail (the real facility fails only for a malformed
// group list, which the module never passes), and Start can capture the
// task callback instead of running it, so that a test can call the callback
// itself with null objects. Otherwise both forward to the real facility.
#ifndef ZARK_TESTS_MODULE_POLLING_SEAM_H
#define ZARK_TESTS_MODULE_POLLING_SEAM_H

#include "webapi.h"

#include <vector>

namespace zark::moduletest {

struct CapturedStart {
  ZARK::APIPollingCallback callback;
  void *argument;
};

void SetListFails(bool fails);
void SetStartCaptures(bool captures);
std::vector<CapturedStart> CapturedStarts();
void ResetPollingSeam();

} // namespace zark::moduletest

#endif
