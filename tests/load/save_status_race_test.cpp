// save_status at the two moments the load test caught it answering a
// failure for a save that went on to succeed:
//
// - before the save's thread has reported anything: the host's record is
//   then {"finish": false, "success": true, "data": {}} (under load a poll
//   could come first; the host framework now waits for the first report);
// - while the save ends: the port-map library removes "/tmp/pfProgress",
//   which a poll may have seen (stat, size > 0) and then not find when it
//   opens it. Here the removal is put exactly between the check and the
//   open: this executable's fopen (which the module's objects, linked in,
//   call) removes the file first when asked to.
#include "PortForwarding.h"
#include "StatusReportor.h"
#include "hermetic.h"
#include "syslog_capture.h"
#include "webapi.h"

#include <dlfcn.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>
#include <json/json.h>

#include <atomic>
#include <cstdio>
#include <cstring>

namespace {

constexpr const char *kProgressFile = "/tmp/pfProgress";
std::atomic<bool> gRemoveProgressBeforeOpen{false};

} // namespace

// Every fopen of the process comes here first; only the progress file, and
// only while a test asks for it, is removed before the real fopen runs.
extern "C" FILE *fopen(const char *path, const char *mode) {
  using Fopen = FILE *(*)(const char *, const char *);
  static const Fopen real =
      reinterpret_cast<Fopen>(::dlsym(RTLD_NEXT, "fopen"));
  if (gRemoveProgressBeforeOpen.load() && path != nullptr &&
      std::strcmp(path, kProgressFile) == 0) {
    ::unlink(path);
  }
  return real(path, mode);
}

namespace zark::load {
namespace {

Json::Value RunningRecord() {
  Json::Value record(Json::objectValue);
  record["finish"] = false;
  record["success"] = true;
  record["data"]["status"] = "processing";
  record["data"]["percentage"] = 5;
  return record;
}

Json::Value UnreportedRecord(bool finish) {
  Json::Value record(Json::objectValue);
  record["finish"] = finish;
  record["success"] = true;
  record["data"] = Json::Value(Json::objectValue);
  return record;
}

class LoadSaveStatusRace : public testing::Test {
protected:
  void SetUp() override {
    zark::test::ResetFixedPaths();
    zark::test::ClearLogs();
  }
  void TearDown() override { gRemoveProgressBeforeOpen = false; }

  ZARK::APIResponse mResponse;
  PortForwarding mPf{new StatusReportor(1500, "", "", &mResponse, Json::Value(),
                                        false, false)};
};

// The module reads a record without a report as a failure; the host
// framework keeps polls from seeing one while the save's thread has not run
// (its Status waits for the task's first answer, tests/webapi).
TEST_F(LoadSaveStatusRace, RunningRecordWithoutAReportIsAFailure) {
  zark::test::WriteFile(kProgressFile, "add=3/6\n");
  Json::Value out;
  EXPECT_FALSE(mPf.StartPortForwardingStatus(out, UnreportedRecord(false)));
  EXPECT_TRUE(zark::test::HasLogContaining("get status and percentage failed"));
  EXPECT_EQ(1500, mResponse.GetErrorCode());
}

TEST_F(LoadSaveStatusRace, TaskThatEndedWithoutReportingIsStillAFailure) {
  Json::Value out;
  EXPECT_FALSE(mPf.StartPortForwardingStatus(out, UnreportedRecord(true)));
  EXPECT_TRUE(zark::test::HasLogContaining("get status and percentage failed"));
  EXPECT_EQ(1500, mResponse.GetErrorCode());
}

TEST_F(LoadSaveStatusRace, ProgressFileGoneAtTheOpenAnswersTheRecord) {
  zark::test::WriteFile(kProgressFile, "add=3/6\n");
  gRemoveProgressBeforeOpen = true;
  Json::Value out;
  EXPECT_TRUE(mPf.StartPortForwardingStatus(out, RunningRecord()));
  gRemoveProgressBeforeOpen = false;
  EXPECT_NE(0, ::access(kProgressFile, F_OK)) << "the file was not removed";

  Json::Value expected(Json::objectValue);
  expected["status"] = "processing";
  expected["percentage"] = 5;
  EXPECT_EQ(expected, out);
  EXPECT_FALSE(mResponse.IsAnswered()) << "an error was reported";
  EXPECT_FALSE(zark::test::HasLogContaining("get pf apply status failed"));
}

TEST_F(LoadSaveStatusRace, ProgressFileThereIsStillRead) {
  zark::test::WriteFile(kProgressFile, "add=3/6\n");
  Json::Value out;
  EXPECT_TRUE(mPf.StartPortForwardingStatus(out, RunningRecord()));
  EXPECT_EQ("add", out["stage"].asString());
  EXPECT_EQ(75, out["percentage"].asInt());
  EXPECT_FALSE(mResponse.IsAnswered());
}

TEST_F(LoadSaveStatusRace, UnreadableProgressFileIsStillAFailure) {
  // A folder has a size, opens, and gives a read error.
  ASSERT_EQ(0, ::mkdir(kProgressFile, 0755));
  zark::test::WriteFile(std::string(kProgressFile) + "/x", "add=1/2");
  Json::Value out;
  EXPECT_FALSE(mPf.StartPortForwardingStatus(out, RunningRecord()));
  EXPECT_TRUE(zark::test::HasLogContaining("get pf apply status failed"));
  EXPECT_EQ(1500, mResponse.GetErrorCode());
}

} // namespace
} // namespace zark::load
