// The PortForwarding object itself: ownership of its reporter and the error
// code it hands to the entry functions.
#include "ops_test_support.h"

namespace zark::ops {
namespace {

using ::testing::ElementsAre;

class CountingReportor : public StatusReportor {
public:
  explicit CountingReportor(int *deleted)
      : StatusReportor(1500, "", "", nullptr, Json::Value(), false, false),
        mDeleted(deleted) {}
  ~CountingReportor() override { ++*mDeleted; }

private:
  int *mDeleted;
};

TEST(ModuleOpsObject, DestructorDeletesReporterThroughVirtualDestructor) {
  int deleted = 0;
  {
    PortForwarding pf(new CountingReportor(&deleted));
    EXPECT_EQ(0, deleted);
  }
  EXPECT_EQ(1, deleted);
}

TEST(ModuleOpsObject, GetErrorCodeReturnsReportersCode) {
  ZARK::APIResponse response;
  PortForwarding pf(
      new StatusReportor(1500, "", "", &response, Json::Value(), false, false));
  EXPECT_EQ(1500, pf.GetErrorCode());
  pf.GetStatusReportor()->mErrorCode = 1530;
  EXPECT_EQ(1530, pf.GetErrorCode());
}

TEST(ModuleOpsObject, GetErrorCodeWithoutReporterLogsAndAnswers1500) {
  zark::test::ClearLogs();
  PortForwarding pf(nullptr);
  EXPECT_EQ(1500, pf.GetErrorCode());
  EXPECT_THAT(PfLogs(), ElementsAre("status reportor shall not be NULL"));
}

} // namespace
} // namespace zark::ops
