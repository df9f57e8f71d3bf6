// The host killed with SIGKILL in the middle of a save. The real
// zark-webapid of this build serves the build's module in the server
// namespace; over HTTP an administrator saves a first rule set, then a
// second, larger one, and the host is killed while save_status reports the
// second being applied to the test network's miniupnpd. Nothing of the
// killed save may be left half done where it matters: the saved rule
// configuration is the old set or the new one, whole; the port-map lock is
// free; and each repair path (a restarted host saving again, or
// "zarkportforward renew") leaves the router holding exactly the saved set.
#include "fault_support.h"
#include "host_process.h"

#include "libzarkportmap.h"

namespace zark::faults {
namespace {

constexpr char kAdminUser[] = "admin";
constexpr char kAdminPassword[] = "Fault-t3st secret";

// The first set: three rules, one of them a range of ten ports.
Json::Value OldRules() {
  Json::Value rules(Json::arrayValue);
  rules.append(Rule("web", "tcp", "18080", "8080"));
  rules.append(Rule("game", "udp", "15000", "5000"));
  rules.append(Rule("range", "tcp", "20000-20009", "20000-20009"));
  return rules;
}

// The second keeps the first rule, drops the two others and adds 120
// single-port rules: applying it deletes 11 mappings and adds 120, which
// takes the test router a second or two.
Json::Value NewRules() {
  Json::Value rules(Json::arrayValue);
  rules.append(Rule("web", "tcp", "18080", "8080"));
  return Joined(rules, PortRules("bulk", "tcp", 120, 32000));
}

std::string Compact(const Json::Value &value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  return Json::writeString(builder, value);
}

class FaultHostKill : public FaultTest {
protected:
  void SetUp() override {
    FaultTest::SetUp();
    if (HasFatalFailure()) {
      return;
    }
    ConfigureUpnpRouter();
    std::string why;
    ASSERT_TRUE(CreateHostAccount(kAdminUser, kAdminPassword, why)) << why;
    StartHost();
  }

  void StartHost() {
    std::string why;
    ASSERT_TRUE(mHost.Start(why)) << why;
    ASSERT_TRUE(mHost.Login(kAdminUser, kAdminPassword, why)) << why;
  }

  // Rules save over HTTP: the task id, or empty (with a failure).
  std::string StartHttpSave(const Json::Value &rules) {
    Json::Value started = mHost.Call(zark::integration::kApiRules, "save",
                                     {{"rules", Compact(rules)}});
    EXPECT_TRUE(started["success"].asBool()) << started.toStyledString();
    const std::string taskId = started["data"]["task_id"].asString();
    EXPECT_FALSE(taskId.empty()) << started.toStyledString();
    return taskId;
  }

  Json::Value SaveStatus(const std::string &taskId) {
    return mHost.Call(zark::integration::kApiRules, "save_status",
                      {{"task_id", taskId}});
  }

  // Saves over HTTP and follows save_status until it ends (at most 60 s):
  // true when the save succeeded. history gets every answer.
  bool HttpSave(const Json::Value &rules, Json::Value &history) {
    const std::string taskId = StartHttpSave(rules);
    if (taskId.empty()) {
      return false;
    }
    // A save polled before its task thread reported anything answers an
    // error (1500, as a failed save does): its record has no status yet.
    // The front end therefore polls first after 500 ms; here an error
    // counts as the end once the task was seen under way, or after that
    // first-poll delay.
    const auto firstPoll =
        std::chrono::steady_clock::now() + std::chrono::milliseconds(500);
    bool underWay = false;
    Json::Value last;
    bool ended = WaitUntil(
        [&] {
          last = SaveStatus(taskId);
          Note(history, last);
          if (last["success"].asBool()) {
            underWay = true;
            return last["data"]["status"].asString() == "success";
          }
          return underWay || std::chrono::steady_clock::now() >= firstPoll;
        },
        std::chrono::seconds(60));
    EXPECT_TRUE(ended) << "save_status did not end within 60 s\n"
                       << history.toStyledString();
    return ended && last["success"].asBool();
  }

  // Saves OldRules, starts saving NewRules and SIGKILLs the host as soon as
  // save_status reports the new set's mappings being added. Then the files
  // and locks the killed save leaves behind are checked; the rule set the
  // rule configuration holds is returned (null after a fatal failure).
  Json::Value KillDuringSave() {
    Json::Value history(Json::arrayValue);
    EXPECT_TRUE(HttpSave(OldRules(), history)) << history.toStyledString();
    EXPECT_EQ(MappingsOf(OldRules()), RouterMappings());
    if (HasFailure()) {
      return Json::Value();
    }

    const std::string taskId = StartHttpSave(NewRules());
    history = Json::Value(Json::arrayValue);
    bool adding = WaitUntil(
        [&] {
          Json::Value status = SaveStatus(taskId);
          Note(history, status);
          // "add" past 50 %: mappings of the new set are being added.
          return status["data"]["stage"].asString() == "add" &&
                 status["data"]["percentage"].asInt() > 50;
        },
        std::chrono::seconds(30), std::chrono::milliseconds(2));
    EXPECT_TRUE(adding) << "save_status never reported the add stage\n"
                        << history.toStyledString();
    mHost.Kill();
    if (!adding) {
      return Json::Value();
    }
    // The kill came after the router was touched: past 50 % of "add", at
    // least three mappings only the new set has are on the router.
    Mappings onlyNew;
    for (const Mapping &mapping : MappingsOf(NewRules())) {
      if (MappingsOf(OldRules()).count(mapping) == 0) {
        onlyNew.insert(mapping);
      }
    }
    int added = 0;
    for (const Mapping &mapping : RouterMappings()) {
      added += static_cast<int>(onlyNew.count(mapping));
    }
    EXPECT_GE(added, 3);

    // The rule configuration is one whole set or the other.
    std::string why;
    std::optional<Json::Value> saved =
        ReadRuleConf(ZARK_PORTMAP_RULE_CONF, why);
    EXPECT_TRUE(saved.has_value()) << why;
    if (!saved) {
      return Json::Value();
    }
    EXPECT_TRUE(*saved == OldRules() || *saved == NewRules())
        << saved->toStyledString();
    // Nobody holds the port-map lock or the running-job mark any more.
    EXPECT_TRUE(LockFree(ZARK_PORTMAP_LOCK_FILE, why)) << why;
    ZARK_LIBZARKPORTMAP_TASK task{-1};
    EXPECT_EQ(0, KLibGetLibZarkPortMapRunningTask(&task));
    EXPECT_EQ(ZARK_PORTMAP_TASK_NONE, task.task);
    return *saved;
  }

  HostProcess mHost;
};

TEST_F(FaultHostKill, RestartedHostSavesAgainAndTheRouterHoldsTheSet) {
  Json::Value saved = KillDuringSave();
  if (HasFatalFailure() || saved.isNull()) {
    return;
  }
  // A new host, a new session, the same new set saved again: the lock is
  // free, and the save finishes what the killed one left.
  StartHost();
  Json::Value history(Json::arrayValue);
  ASSERT_TRUE(HttpSave(NewRules(), history)) << history.toStyledString();
  EXPECT_EQ(MappingsOf(NewRules()), RouterMappings());
  std::string why;
  std::optional<Json::Value> rules = ReadRuleConf(ZARK_PORTMAP_RULE_CONF, why);
  ASSERT_TRUE(rules.has_value()) << why;
  EXPECT_EQ(NewRules(), *rules);
  EXPECT_TRUE(LockFree(ZARK_PORTMAP_LOCK_FILE, why)) << why;
}

TEST_F(FaultHostKill, RenewPutsTheRouterBackToTheSavedRules) {
  Json::Value saved = KillDuringSave();
  if (HasFatalFailure() || saved.isNull()) {
    return;
  }
  // Without a host: the tool re-applies the saved rule configuration,
  // deleting what the killed save added and putting back what it deleted.
  std::string output;
  ASSERT_EQ(0, zark::testnet::RunTool({ZARK_PORTFORWARD_TOOL_PATH, "renew"},
                                      output, std::chrono::seconds(60)))
      << output;
  EXPECT_EQ(MappingsOf(saved), RouterMappings());
  std::string why;
  EXPECT_TRUE(LockFree(ZARK_PORTMAP_LOCK_FILE, why)) << why;
}

} // namespace
} // namespace zark::faults
