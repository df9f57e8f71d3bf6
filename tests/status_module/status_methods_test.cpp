// The status module's methods through the host over HTTP: what each answers
// from the port-map library (the fake), the lock taken around every router
// conversation, the errors in words, and the host's refusals of callers
// that are not logged-in administrators.
#include "fake_status_host.h"

#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <cstring>

namespace zark::status::test {
namespace {

using namespace std::chrono_literals;
using zark::fake::CountCalls;
using zark::fake::Fake;
using zark::fake::MakeMapping;

// The library's failure record of a repair that met a conflict.
const char kConflictStatus[] =
    R"json({"gateway": "192.168.1.1", "protocol": "upnp",
        "external_address": "203.0.113.7",
        "last_job": {"kind": "repair", "ended": 1764000000, "ok": false,
                     "repaired": 0, "added": 0, "deleted": 0,
                     "failure": {"code": "conflict", "kind": 2,
                                 "reason": "TCP 8080 is held by another mapping (\"NAS web\", 192.168.1.20)"}},
        "rules": [{"rule_id": "1", "protocol": "tcp", "external_port": 8080,
                   "internal_port": 80, "state": "refused",
                   "code": "conflict",
                   "reason": "TCP 8080 is held by another mapping",
                   "verified": 1764000000},
                  {"rule_id": "2", "protocol": "udp", "external_port": 5353,
                   "internal_port": 5353, "state": "on_router", "code": "",
                   "reason": "", "verified": 1764000001}]})json";

// Every method of the module, with parameters that it would accept.
struct MethodCase {
  const char *method;
  const char *extra;
};
const MethodCase kMethods[] = {
    {"router_mappings", ""},
    {"delete_mapping", "&protocol=TCP&external_port=8080"},
    {"rule_status", ""},
    {"repair", ""},
    {"repair_status",
     "&task_id=ZARK.Core.PortForwarding.Status.repair%230000000000000000"},
    {"keeper_status", ""},
};

// The library calls a method makes (none of them may run for a refused
// caller).
size_t LibraryCalls() {
  return CountCalls("KLibZarkPortMapLock") +
         CountCalls("KLibListRouterMappings") +
         CountCalls("KLibDeleteOurMapping") +
         CountCalls("KLibGetPortMapStatus") +
         CountCalls("KLibRepairSavedRules");
}

class StatusMethods : public FakeStatusHost {
protected:
  void SetUp() override {
    FakeStatusHost::SetUp();
    // The keeper waits out its interval after its first round, so that
    // only the method under test talks to the fake.
    StartHost(3600);
    ASSERT_TRUE(WaitForCalls("KLibKeepRouter", 1, 10s));
    // The first round's lock and unlock are behind us.
    ASSERT_TRUE(WaitForCalls("KLibZarkPortMapUnLock", 1, 10s));
  }

  size_t Locks() { return CountCalls("KLibZarkPortMapLock"); }
  size_t Unlocks() { return CountCalls("KLibZarkPortMapUnLock"); }
};

TEST_F(StatusMethods, RouterMappingsAnswersTheLiveTableWithOursMarked) {
  Fake().routerMappings = {MakeMapping("TCP", 8080, "192.168.1.10", 80,
                                       "web (rule 1)", 3600, true, "1"),
                           MakeMapping("UDP", 5353, "192.168.1.20", 5353,
                                       "another device", 0, false)};
  const size_t locks = Locks();
  Json::Value answer = Call("router_mappings");
  ASSERT_TRUE(answer["success"].asBool()) << answer;
  const Json::Value &data = answer["data"];
  EXPECT_EQ(data["gateway"], "192.168.1.1");
  EXPECT_EQ(data["router_protocol"], "upnp");
  EXPECT_EQ(data["location"], "http://192.168.1.1:5000/rootDesc.xml");
  EXPECT_FALSE(data["from_record"].asBool());
  ASSERT_EQ(data["mappings"].size(), 2u) << data;
  const Json::Value &ours = data["mappings"][0];
  EXPECT_EQ(ours["protocol"], "TCP");
  EXPECT_EQ(ours["external_port"], 8080);
  EXPECT_EQ(ours["internal_client"], "192.168.1.10");
  EXPECT_EQ(ours["internal_port"], 80);
  EXPECT_EQ(ours["description"], "web (rule 1)");
  EXPECT_EQ(ours["lease_seconds_left"], 3600);
  EXPECT_FALSE(ours["permanent"].asBool());
  EXPECT_TRUE(ours["ours"].asBool());
  EXPECT_EQ(ours["rule_id"], "1");
  EXPECT_TRUE(ours.isMember("enabled"));
  const Json::Value &other = data["mappings"][1];
  EXPECT_FALSE(other["ours"].asBool());
  EXPECT_TRUE(other["permanent"].asBool());
  EXPECT_EQ(other["description"], "another device");
  // Listed under the lock, which was given back.
  EXPECT_EQ(Locks(), locks + 1);
  EXPECT_EQ(Unlocks(), Locks());
  EXPECT_EQ(CountCalls("KLibFreeRouterMappings"), 1u);
}

TEST_F(StatusMethods, RouterMappingsSaysInWordsWhenTheRouterFails) {
  Fake().KLibListRouterMappings = [](const char *, ZARK_ROUTER_MAPPINGS *out,
                                     ZARK_LIBZARKPORTMAP_ERR *err) {
    std::strcpy(out->message, "the router did not answer within 5 seconds");
    err->err = ZARK_PORTMAP_ERR_ROUTER;
    return -1;
  };
  Json::Value answer = Call("router_mappings");
  EXPECT_EQ(Code(answer), 1604);
  EXPECT_EQ(answer["error"]["errors"]["reason"],
            "the router did not answer within 5 seconds");
  EXPECT_EQ(Unlocks(), Locks());
}

TEST_F(StatusMethods, RouterMappingsWithoutGatewayIs1603) {
  Fake().KLibGetGatewayIP = [](char *, int) { return -1; };
  Json::Value answer = Call("router_mappings");
  EXPECT_EQ(Code(answer), 1603);
  EXPECT_NE(answer["error"]["errors"]["reason"].asString().find("gateway"),
            std::string::npos);
  EXPECT_EQ(CountCalls("KLibListRouterMappings"), 0u);
}

TEST_F(StatusMethods, EveryRouterMethodAnswersBusyLockInWords) {
  Fake().KLibZarkPortMapLock = [] { return -1; };
  for (const char *method :
       {"router_mappings", "rule_status", "delete_mapping"}) {
    Json::Value answer = Call(method, std::strcmp(method, "delete_mapping") == 0
                                          ? "&protocol=TCP&external_port=8080"
                                          : "");
    EXPECT_EQ(Code(answer), 1602) << method;
    EXPECT_NE(answer["error"]["errors"]["reason"].asString().find(
                  "Another job is talking to the router"),
              std::string::npos)
        << method << ": " << answer;
  }
  // The repair task ends with the same error.
  Json::Value start = Call("repair");
  ASSERT_TRUE(start["success"].asBool()) << start;
  const std::string id = start["data"]["task_id"].asString();
  Json::Value status = PollUntil(
      "repair_status", "&task_id=" + zark::host::test::FormEncode(id),
      [](const Json::Value &a) { return !a["success"].asBool(); }, 20s);
  EXPECT_EQ(Code(status), 1602);
  EXPECT_EQ(CountCalls("KLibListRouterMappings"), 0u);
  EXPECT_EQ(CountCalls("KLibGetPortMapStatus"), 0u);
  EXPECT_EQ(CountCalls("KLibDeleteOurMapping"), 0u);
  EXPECT_EQ(CountCalls("KLibRepairSavedRules"), 0u);
  // A lock that was not taken is not given back.
  EXPECT_EQ(Unlocks(), 1u);
}

TEST_F(StatusMethods, DeleteMappingDeletesOursUnderTheLock) {
  Json::Value answer =
      Call("delete_mapping", "&protocol=%22udp%22&external_port=5353");
  ASSERT_TRUE(answer["success"].asBool()) << answer;
  EXPECT_EQ(answer["data"]["protocol"], "UDP");
  EXPECT_EQ(answer["data"]["external_port"], 5353);
  EXPECT_TRUE(answer["data"]["deleted"].asBool());
  bool seen = false;
  for (const auto &call : zark::fake::Calls()) {
    if (call.name == "KLibDeleteOurMapping") {
      seen = true;
      EXPECT_EQ(call.args,
                (std::vector<std::string>{"192.168.1.1", "UDP", "5353"}));
    }
  }
  EXPECT_TRUE(seen);
  EXPECT_EQ(Unlocks(), Locks());
}

TEST_F(StatusMethods, DeleteMappingRefusesAnotherDevicesMapping) {
  Fake().KLibDeleteOurMapping = [](const char *, const char *, uint16_t,
                                   char *message, size_t size,
                                   ZARK_LIBZARKPORTMAP_ERR *err) {
    std::snprintf(message, size,
                  "TCP 8080 was not made by this server (\"NAS web\")");
    err->err = ZARK_PORTMAP_ERR_BAD_PARAMETER;
    return -1;
  };
  Json::Value answer =
      Call("delete_mapping", "&protocol=TCP&external_port=8080");
  EXPECT_EQ(Code(answer), 1605);
  EXPECT_EQ(answer["error"]["errors"]["reason"],
            "TCP 8080 was not made by this server (\"NAS web\")");
  EXPECT_EQ(answer["error"]["errors"]["external_port"], 8080);
}

TEST_F(StatusMethods, DeleteMappingChecksItsParametersFirst) {
  const struct {
    const char *extra;
    const char *field;
  } cases[] = {
      {"&external_port=8080", "protocol"},
      {"&protocol=ICMP&external_port=8080", "protocol"},
      {"&protocol=TCP", "external_port"},
      {"&protocol=TCP&external_port=0", "external_port"},
      {"&protocol=TCP&external_port=65536", "external_port"},
      {"&protocol=TCP&external_port=%228080%22", "external_port"},
  };
  for (const auto &c : cases) {
    Json::Value answer = Call("delete_mapping", c.extra);
    EXPECT_EQ(Code(answer), 1601) << c.extra;
    EXPECT_EQ(answer["error"]["errors"]["field"], c.field) << c.extra;
  }
  EXPECT_EQ(CountCalls("KLibDeleteOurMapping"), 0u);
}

TEST_F(StatusMethods, RuleStatusPassesTheLibrarysTruthAndTheLastFailure) {
  Fake().portMapStatus = kConflictStatus;
  Json::Value answer = Call("rule_status");
  ASSERT_TRUE(answer["success"].asBool()) << answer;
  const Json::Value &data = answer["data"];
  EXPECT_EQ(data["external_address"], "203.0.113.7");
  EXPECT_EQ(data["protocol"], "upnp");
  ASSERT_EQ(data["rules"].size(), 2u);
  EXPECT_EQ(data["rules"][0]["state"], "refused");
  EXPECT_EQ(data["rules"][0]["code"], "conflict");
  EXPECT_EQ(data["rules"][1]["state"], "on_router");
  EXPECT_EQ(data["rules"][1]["verified"], 1764000001);
  EXPECT_EQ(data["last_job"]["kind"], "repair");
  EXPECT_EQ(data["last_failure"]["code"], "conflict");
  EXPECT_EQ(data["last_failure"]["kind"], 2);
  EXPECT_NE(data["last_failure"]["reason"].asString().find("NAS web"),
            std::string::npos);
  EXPECT_EQ(CountCalls("KLibFreeText"), 1u);
  EXPECT_EQ(Unlocks(), Locks());
}

TEST_F(StatusMethods, RuleStatusWithoutAnyJobHasNoLastFailure) {
  Json::Value answer = Call("rule_status");
  ASSERT_TRUE(answer["success"].asBool()) << answer;
  EXPECT_TRUE(answer["data"]["last_job"].isNull());
  EXPECT_TRUE(answer["data"]["last_failure"].isNull());
}

TEST_F(StatusMethods, RuleStatusCountsAFailureOfKindNoneAsNoFailure) {
  Fake().portMapStatus =
      R"json({"protocol": "upnp", "rules": [],
              "last_job": {"kind": "save", "ended": 1764000000, "ok": true,
                           "failure": {"code": "", "kind": 0,
                                       "reason": ""}}})json";
  Json::Value answer = Call("rule_status");
  ASSERT_TRUE(answer["success"].asBool()) << answer;
  EXPECT_EQ(answer["data"]["last_job"]["kind"], "save");
  EXPECT_TRUE(answer["data"]["last_failure"].isNull()) << answer;
}

TEST_F(StatusMethods, RuleStatusRefusesTextThatIsNotJson) {
  Fake().portMapStatus = "{\"rules\": [";
  Json::Value answer = Call("rule_status");
  EXPECT_EQ(Code(answer), 1606);
  EXPECT_TRUE(zark::test::HasLogContaining("gave no JSON object"));
}

TEST_F(StatusMethods, RuleStatusSaysWhenTheLibraryFails) {
  Fake().KLibGetPortMapStatus = [](const char *, char **,
                                   ZARK_LIBZARKPORTMAP_ERR *err) {
    err->err = ZARK_PORTMAP_ERR_NOT_IMPLEMENTED;
    return -1;
  };
  Json::Value answer = Call("rule_status");
  EXPECT_EQ(Code(answer), 1606);
  EXPECT_EQ(answer["error"]["errors"]["reason"],
            "This operation is not built into the port-map library yet.");
}

TEST_F(StatusMethods, RepairRunsAsATaskWithProgressAndSummary) {
  Fake().repairRestored = 3;
  Json::Value start = Call("repair");
  ASSERT_TRUE(start["success"].asBool()) << start;
  const std::string id = start["data"]["task_id"].asString();
  EXPECT_EQ(id.rfind("ZARK.Core.PortForwarding.Status.repair#", 0), 0u) << id;
  const std::string extra = "&task_id=" + zark::host::test::FormEncode(id);
  Json::Value status = PollUntil(
      "repair_status", extra,
      [](const Json::Value &a) {
        return !a["success"].asBool() || a["data"]["finish"].asBool();
      },
      20s);
  ASSERT_TRUE(status["success"].asBool()) << status;
  EXPECT_TRUE(status["data"]["finish"].asBool());
  EXPECT_EQ(status["data"]["percentage"], 100);
  EXPECT_EQ(status["data"]["repaired"], 3);
  EXPECT_EQ(status["data"]["summary"]["added"], 3);
  EXPECT_EQ(CountCalls("KLibRepairSavedRules"), 1u);
  EXPECT_EQ(Unlocks(), Locks());
  // The poll that saw it finished dropped the record.
  EXPECT_EQ(Code(Call("repair_status", extra)), 1607);
}

TEST_F(StatusMethods, RepairFailureCarriesTheLibrarysReasonAndCode) {
  Fake().portMapStatus = kConflictStatus;
  Fake().KLibRepairSavedRules = [](const char *,
                                   ZARK_PORTMAP_APPLY_SUMMARY *summary,
                                   ZARK_ROUTER_SAVE_RULE_RESULT *result,
                                   ZARK_SAVE_RULE_PROGRESS_CB, void *) {
    summary->failed = 1;
    result->errType = ZARK_PORTMAP_ERR_ROUTER;
    return -1;
  };
  Json::Value start = Call("repair");
  ASSERT_TRUE(start["success"].asBool()) << start;
  Json::Value status = PollUntil(
      "repair_status",
      "&task_id=" +
          zark::host::test::FormEncode(start["data"]["task_id"].asString()),
      [](const Json::Value &a) { return !a["success"].asBool(); }, 20s);
  EXPECT_EQ(Code(status), 1604);
  const Json::Value &errors = status["error"]["errors"];
  EXPECT_NE(errors["reason"].asString().find("held by another mapping"),
            std::string::npos)
      << errors;
  EXPECT_EQ(errors["failure"]["code"], "conflict");
  EXPECT_EQ(errors["summary"]["failed"], 1);
  EXPECT_EQ(errors["err_type"], ZARK_PORTMAP_ERR_ROUTER);
}

TEST_F(StatusMethods, RepairStatusRefusesIdsOfOtherTasks) {
  Json::Value answer = Call(
      "repair_status", "&task_id=ZARK.Core.PortForwarding.detect%23000000");
  EXPECT_EQ(Code(answer), 1601);
  EXPECT_EQ(answer["error"]["errors"]["field"], "task_id");
  EXPECT_EQ(Code(Call("repair_status")), 1601);
}

TEST_F(StatusMethods, KeeperStatusTellsTheKeepersRounds) {
  Json::Value answer = Call("keeper_status");
  ASSERT_TRUE(answer["success"].asBool()) << answer;
  EXPECT_TRUE(answer["data"]["running"].asBool());
  EXPECT_EQ(answer["data"]["check_interval"], 3600);
  EXPECT_GE(answer["data"]["rounds"].asUInt64(), 1u);
  EXPECT_EQ(answer["data"]["last_round"]["outcome"], "ok");
  EXPECT_GT(answer["data"]["next_round_in"].asInt64(), 3000);
}

// The host's refusals, for every method of the module.
class StatusRefusals : public StatusMethods,
                       public ::testing::WithParamInterface<MethodCase> {
protected:
  std::string Fields() const {
    return std::string("api=") + kApi +
           "&version=1&method=" + GetParam().method + GetParam().extra;
  }
};

TEST_P(StatusRefusals, AdministratorIsServed) {
  Json::Value answer = Entry(Fields(), &mAdmin);
  // repair_status of an unknown task answers the module's 1607: served.
  if (std::strcmp(GetParam().method, "repair_status") == 0) {
    EXPECT_EQ(Code(answer), 1607) << answer;
  } else {
    EXPECT_TRUE(answer["success"].asBool()) << answer;
  }
}

TEST_P(StatusRefusals, NoSessionIs106) {
  const size_t before = LibraryCalls();
  EXPECT_EQ(Code(Entry(Fields())), 106);
  EXPECT_EQ(LibraryCalls(), before);
}

TEST_P(StatusRefusals, WrongTokenIs107) {
  Session forged = mAdmin;
  forged.token = std::string(32, '0');
  const size_t before = LibraryCalls();
  EXPECT_EQ(Code(Entry(Fields(), &forged)), 107);
  EXPECT_EQ(LibraryCalls(), before);
}

TEST_P(StatusRefusals, NonAdministratorIs105) {
  Session viewer = Login(zark::host::test::kViewer);
  const size_t before = LibraryCalls();
  Json::Value answer = Entry(Fields(), &viewer);
  EXPECT_EQ(Code(answer), 105);
  EXPECT_EQ(answer["error"]["errors"]["reason"], "admin_only");
  EXPECT_EQ(LibraryCalls(), before);
}

INSTANTIATE_TEST_SUITE_P(Status, StatusRefusals, ::testing::ValuesIn(kMethods),
                         [](const ::testing::TestParamInfo<MethodCase> &info) {
                           std::string name = info.param.method;
                           name.erase(
                               std::remove(name.begin(), name.end(), '_'),
                               name.end());
                           return name;
                         });

} // namespace
} // namespace zark::status::test
