// A full disk under /etc/portforward: inside the private mount namespace a
// 64 KiB tmpfs lies over the folder, a first save succeeds, the rest of the
// tmpfs is filled, and a save of another set fails with the module's code
// while the saved rule configuration stays exactly as it was, no temporary
// file is left beside it, and the port-map lock is free. Once there is room
// again the same save succeeds. Once with a set that changes the router
// (the save cannot record what it is about to do, so it stops before
// touching the router), once with a set that only adds a disabled rule
// (nothing to change on the router: the rule configuration itself cannot be
// written).
#include "fault_support.h"

#include "hermetic.h"
#include "libzarkportmap.h"
#include "syslog_capture.h"
#include "webapi.h"

#include <fcntl.h>
#include <sys/mount.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <vector>

namespace zark::faults {
namespace {

namespace fs = std::filesystem;

constexpr char kFiller[] = ZARK_PORTMAP_CONF_DIR "/filler";

Json::Value OldRules() {
  Json::Value rules(Json::arrayValue);
  rules.append(Rule("web", "tcp", "18080", "8080"));
  rules.append(Rule("range", "tcp", "20000-20004", "20000-20004"));
  return rules;
}

// The files of the folder, but the filler.
std::vector<std::string> FolderFiles() {
  std::vector<std::string> names;
  for (const fs::directory_entry &entry :
       fs::directory_iterator(ZARK_PORTMAP_CONF_DIR)) {
    if (entry.path() != kFiller) {
      names.push_back(entry.path().filename().string());
    }
  }
  std::sort(names.begin(), names.end());
  return names;
}

class FaultDiskFull : public FaultTest {
protected:
  void SetUp() override {
    FaultTest::SetUp();
    if (HasFatalFailure()) {
      return;
    }
    // The private mount namespace keeps this mount off the machine; it
    // ends with the test process.
    fs::create_directories(ZARK_PORTMAP_CONF_DIR);
    ASSERT_EQ(0, ::mount("zark-faults", ZARK_PORTMAP_CONF_DIR, "tmpfs", 0,
                         "size=64k,mode=0755"))
        << std::strerror(errno);
    ConfigureUpnpRouter();
    ASSERT_FALSE(HasFatalFailure());
    Json::Value history(Json::arrayValue);
    ASSERT_TRUE(Save(OldRules(), history)) << history.toStyledString();
    ASSERT_EQ(MappingsOf(OldRules()), RouterMappings());
    mSaved = zark::test::ReadFile(ZARK_PORTMAP_RULE_CONF);
    ASSERT_FALSE(mSaved.empty());
  }

  // Writes the filler until the tmpfs has no byte left.
  static void FillTheDisk() {
    int fd = ::open(kFiller, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    ASSERT_GE(fd, 0) << std::strerror(errno);
    const std::vector<char> block(4096, 'x');
    ssize_t written = 0;
    // Bounded: the tmpfs holds 64 KiB.
    for (int i = 0; i < 1000; ++i) {
      written = ::write(fd, block.data(), block.size());
      if (written <= 0) {
        break;
      }
    }
    const int error = errno;
    ::close(fd);
    ASSERT_LT(written, 0);
    ASSERT_EQ(ENOSPC, error) << std::strerror(error);
  }

  // Fills the disk, saves rules and expects the save to fail leaving the
  // saved rules, the folder and the router as they were; then makes room
  // and expects the same save to succeed.
  void SaveFailsOnTheFullDiskThenSucceeds(const Json::Value &rules,
                                          const std::string &failure) {
    const std::vector<std::string> before = FolderFiles();
    FillTheDisk();
    ASSERT_FALSE(HasFatalFailure());
    zark::test::ClearLogs();

    Json::Value history(Json::arrayValue);
    const std::string taskId = StartSave(rules);
    ASSERT_FALSE(taskId.empty());
    zark::integration::Answer last =
        FinishSave(taskId, std::chrono::seconds(30), history);
    ZARK::APIPolling::JoinAll();
    ASSERT_TRUE(last.answered) << history.toStyledString();
    EXPECT_FALSE(last.success) << history.toStyledString();
    EXPECT_EQ(kModuleDefaultError, last.errorCode);
    // The library logged the failed write with its errno, and what failed.
    EXPECT_TRUE(zark::test::HasLogContaining("No space left on device"))
        << ::testing::PrintToString(zark::test::CapturedMessages());
    EXPECT_TRUE(zark::test::HasLogContaining(failure))
        << ::testing::PrintToString(zark::test::CapturedMessages());

    EXPECT_EQ(mSaved, zark::test::ReadFile(ZARK_PORTMAP_RULE_CONF));
    EXPECT_EQ(before, FolderFiles());
    EXPECT_EQ(MappingsOf(OldRules()), RouterMappings());
    std::string why;
    EXPECT_TRUE(LockFree(ZARK_PORTMAP_LOCK_FILE, why)) << why;
    ZARK_LIBZARKPORTMAP_TASK task{-1};
    EXPECT_EQ(0, KLibGetLibZarkPortMapRunningTask(&task));
    EXPECT_EQ(ZARK_PORTMAP_TASK_NONE, task.task);

    // Room again: the same save goes through.
    ASSERT_EQ(0, ::unlink(kFiller)) << std::strerror(errno);
    history = Json::Value(Json::arrayValue);
    ASSERT_TRUE(Save(rules, history)) << history.toStyledString();
    std::optional<Json::Value> saved =
        ReadRuleConf(ZARK_PORTMAP_RULE_CONF, why);
    ASSERT_TRUE(saved.has_value()) << why;
    EXPECT_EQ(rules, *saved);
    EXPECT_EQ(MappingsOf(rules), RouterMappings());
  }

  std::string mSaved;
};

TEST_F(FaultDiskFull, SaveThatChangesTheRouterFailsAndKeepsTheOldRules) {
  Json::Value rules = OldRules();
  rules.append(Rule("game", "udp", "15000", "5000"));
  // The rules are stored before the router is touched: the full disk stops
  // the save there, and the router keeps the old mappings.
  SaveFailsOnTheFullDiskThenSucceeds(rules, ZARK_PORTMAP_RULE_CONF
                                     " cannot be written");
}

TEST_F(FaultDiskFull, SaveThatOnlyRewritesTheRulesFailsAndKeepsThem) {
  Json::Value rules = OldRules();
  Json::Value disabled = Rule("later", "tcp", "18443", "443");
  disabled["enable"] = false;
  rules.append(disabled);
  SaveFailsOnTheFullDiskThenSucceeds(rules, ZARK_PORTMAP_RULE_CONF
                                     " cannot be written");
}

} // namespace
} // namespace zark::faults
