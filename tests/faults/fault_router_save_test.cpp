// The router's daemon killed, or the router's LAN link cut, while a save
// (the module's Rules save, on the real library) is adding mappings to the
// test network's miniupnpd. The save must end by itself within its bounds
// (the library gives up at the first router request left without an
// answer: 3 s to connect, 5 s of silence), fail with the module's code,
// leave the saved rule configuration as it was, free the port-map lock and
// the running-job mark, remove its progress file; and once the router is
// back, the same save completes and the router holds exactly the set.
#include "fault_support.h"

#include "hermetic.h"
#include "libzarkportmap.h"
#include "syslog_capture.h"
#include "webapi.h"

#include <sys/stat.h>

namespace zark::faults {
namespace {

using zark::integration::Answer;
using zark::integration::Invoke;
using zark::integration::kApiRules;

// The bound of a save that meets a dead or cut-off router: one request's
// connect and reply timeouts, with a wide margin for a loaded machine.
constexpr std::chrono::seconds kSaveEndsWithin{30};

Json::Value FirstRules() {
  Json::Value rules(Json::arrayValue);
  rules.append(Rule("web", "tcp", "18080", "8080"));
  rules.append(Rule("game", "udp", "15000", "5000"));
  return rules;
}

// The first set and 80 single-port rules more: long enough to apply that
// the fault lands among the additions.
Json::Value LargeRules() {
  return Joined(FirstRules(), PortRules("bulk", "tcp", 80, 33000));
}

bool Exists(const char *path) {
  struct stat info {};
  return ::stat(path, &info) == 0;
}

class FaultRouterSave : public FaultTest {
protected:
  void SetUp() override {
    FaultTest::SetUp();
    if (HasFatalFailure()) {
      return;
    }
    ConfigureUpnpRouter();
  }

  // Saves FirstRules, starts saving LargeRules, applies fault once
  // save_status reports mappings being added, and follows the save to its
  // end. Checks what the failed save leaves behind.
  void FaultDuringSave(const std::function<void()> &fault) {
    Json::Value history(Json::arrayValue);
    ASSERT_TRUE(Save(FirstRules(), history)) << history.toStyledString();
    zark::test::ClearLogs();

    const std::string taskId = StartSave(LargeRules());
    ASSERT_FALSE(taskId.empty());
    Json::Value params(Json::objectValue);
    params["task_id"] = taskId;
    history = Json::Value(Json::arrayValue);
    bool adding = WaitUntil(
        [&] {
          Answer status = Invoke(kApiRules, "save_status", params);
          Note(history, status.data);
          return status.success && status.data["stage"].asString() == "add" &&
                 status.data["percentage"].asInt() > 50;
        },
        std::chrono::seconds(30), std::chrono::milliseconds(2));
    ASSERT_TRUE(adding) << "save_status never reported mappings being added\n"
                        << history.toStyledString();

    fault();
    ASSERT_FALSE(HasFatalFailure());

    bool ended = false;
    Answer last = PollStatus(
        kApiRules, "save_status", taskId,
        [](const Answer &answer) {
          return !answer.success ||
                 answer.data["status"].asString() == "success";
        },
        kSaveEndsWithin, history, ended);
    ASSERT_TRUE(ended) << "the save did not end within "
                       << kSaveEndsWithin.count() << " s\n"
                       << history.toStyledString();
    ZARK::APIPolling::JoinAll();
    EXPECT_FALSE(last.success) << history.toStyledString();
    EXPECT_EQ(kModuleDefaultError, last.errorCode);
    // The library logged why.
    EXPECT_TRUE(zark::test::HasLogContaining(
        "applying rules to the router at " + mNet.lanRouter + ": "))
        << ::testing::PrintToString(zark::test::CapturedMessages());

    // The router failed, not the rules: the set is kept for the next save,
    // repair or keeper round; and the failed save holds nothing any more.
    std::string readWhy;
    std::optional<Json::Value> kept =
        ReadRuleConf(ZARK_PORTMAP_RULE_CONF, readWhy);
    ASSERT_TRUE(kept.has_value()) << readWhy;
    EXPECT_EQ(LargeRules(), *kept);
    std::string why;
    EXPECT_TRUE(LockFree(ZARK_PORTMAP_LOCK_FILE, why)) << why;
    ZARK_LIBZARKPORTMAP_TASK task{-1};
    EXPECT_EQ(0, KLibGetLibZarkPortMapRunningTask(&task));
    EXPECT_EQ(ZARK_PORTMAP_TASK_NONE, task.task);
    EXPECT_FALSE(Exists(ZARK_PORTMAP_APPLY_PROGRESS));
  }

  // The same save once the router is back: it succeeds, and the router and
  // the saved rule configuration hold exactly the set.
  void SaveAgainCompletes() {
    Json::Value history(Json::arrayValue);
    ASSERT_TRUE(Save(LargeRules(), history)) << history.toStyledString();
    EXPECT_EQ(MappingsOf(LargeRules()), RouterMappings());
    std::string why;
    std::optional<Json::Value> saved =
        ReadRuleConf(ZARK_PORTMAP_RULE_CONF, why);
    ASSERT_TRUE(saved.has_value()) << why;
    EXPECT_EQ(LargeRules(), *saved);
  }
};

TEST_F(FaultRouterSave, DaemonKilledEndsTheSaveAndTheNextSaveCompletesIt) {
  FaultDuringSave([this] { KillRouter(); });
  if (HasFatalFailure()) {
    return;
  }
  // A crashed daemon restarted with the lease file it had.
  RestartRouter(true);
  ASSERT_FALSE(HasFatalFailure());
  SaveAgainCompletes();
}

TEST_F(FaultRouterSave, LanCutEndsTheSaveAndTheNextSaveCompletesIt) {
  FaultDuringSave([this] { CutLan(); });
  if (HasFatalFailure()) {
    return;
  }
  RestoreLan();
  ASSERT_FALSE(HasFatalFailure());
  SaveAgainCompletes();
}

} // namespace
} // namespace zark::faults
