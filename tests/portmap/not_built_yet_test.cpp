// The calls of the port-map library that are not built yet fail loudly:
// each returns failure, marks the error record where it takes one, and
// logs "<function>: not built yet".
#include "libzarkportmap.h"
#include "zarknet.h"

#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <syslog.h>

#include <functional>
#include <ostream>
#include <string>

namespace {

using zark::test::ClearLogs;
using zark::test::HasLog;

struct Call {
  const char *name;
  std::function<int(ZARK_LIBZARKPORTMAP_ERR *)> run;
  bool takesErr;
};

// Names the call in test listings instead of dumping its bytes.
void PrintTo(const Call &call, std::ostream *os) {
  *os << call.name;
}

class PortMapNotBuiltYet : public testing::TestWithParam<Call> {};

TEST_P(PortMapNotBuiltYet, FailsAndSaysSo) {
  const Call &call = GetParam();
  ClearLogs();
  ZARK_LIBZARKPORTMAP_ERR err{ZARK_PORTMAP_ERR_NONE};
  EXPECT_EQ(-1, call.run(&err));
  EXPECT_TRUE(HasLog(LOG_ERR, std::string(call.name) + ": not built yet"))
      << call.name;
  EXPECT_EQ(call.takesErr ? ZARK_PORTMAP_ERR_NOT_IMPLEMENTED
                          : ZARK_PORTMAP_ERR_NONE,
            err.err);
}

std::vector<Call> Calls() {
  static ZARK_ROUTER_RULE rule{};
  static ZARK_ROUTER_DETECT_RESULT detect{};
  static ZARK_ROUTER_TEST_COMPATIBILITY_RESULT compat{};
  static ZARK_ROUTER_RECORD record{};
  return {
      {"KLibTestRulesInit",
       [](ZARK_LIBZARKPORTMAP_ERR *) { return KLibTestRulesInit(); }, false},
      {"KLibTestRules",
       [](ZARK_LIBZARKPORTMAP_ERR *err) {
         return KLibTestRules(1, &rule, err, false);
       },
       true},
      {"KLibDetectRouter",
       [](ZARK_LIBZARKPORTMAP_ERR *) {
         return KLibDetectRouter(&detect, nullptr, nullptr, false);
       },
       false},
      {"KLibGetRouterDetectResult",
       [](ZARK_LIBZARKPORTMAP_ERR *) {
         return KLibGetRouterDetectResult(&detect);
       },
       false},
      {"KLibTestUpnpCompatibility",
       [](ZARK_LIBZARKPORTMAP_ERR *) {
         return KLibTestUpnpCompatibility(16, &compat, nullptr, nullptr, false);
       },
       false},
      {"KLibWriteRecordIntoUpnpDB",
       [](ZARK_LIBZARKPORTMAP_ERR *) {
         return KLibWriteRecordIntoUpnpDB(&record);
       },
       false},
      {"KLibStopTestUpnpCompatibility",
       [](ZARK_LIBZARKPORTMAP_ERR *) {
         return KLibStopTestUpnpCompatibility();
       },
       false},
      {"KLibUploadTestUpnpCompatibilityFailResult",
       [](ZARK_LIBZARKPORTMAP_ERR *) {
         return KLibUploadTestUpnpCompatibilityFailResult();
       },
       false},
      // No external address is "0"; map it to the common failure value.
      {"ZARKIGetExternalIP",
       [](ZARK_LIBZARKPORTMAP_ERR *) {
         return ZARKIGetExternalIP() == 0 ? -1 : 0;
       },
       false},
  };
}

INSTANTIATE_TEST_SUITE_P(Calls, PortMapNotBuiltYet, testing::ValuesIn(Calls()),
                         [](const testing::TestParamInfo<Call> &info) {
                           return std::string(info.param.name);
                         });

TEST(PortMapNotBuiltYetErr, NullErrorRecordIsFine) {
  ClearLogs();
  EXPECT_EQ(-1, KLibTestRules(0, nullptr, nullptr, false));
  EXPECT_TRUE(HasLog(LOG_ERR, "KLibTestRules: not built yet"));
}

} // namespace
