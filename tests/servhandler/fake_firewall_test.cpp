// RouterRuleServHandler over the fake firewall: what real service
// definition files cannot produce (a failing section enumeration, section
// ports outside the port space) and how the handler owns its table.
#include "RouterRuleServHandler.h"
#include "fake_firewall.h"
#include "hermetic.h"
#include "serv_test_env.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <stdexcept>

namespace {

using namespace zark::test;
using zark::fake::FakeFirewall;

Json::Value Parse(const std::string &text) {
  Json::Value value;
  Json::Reader reader;
  EXPECT_TRUE(reader.parse(text, value)) << text;
  return value;
}

template <typename F> std::string OutOfRangeText(F f) {
  try {
    f();
  } catch (const std::out_of_range &e) {
    return e.what();
  }
  return "no exception";
}

class ServHandlerFakeFirewall : public ::testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearLogs();
    zark::fake::ResetFakeFirewall();
    WriteFile(ZARK_FW_SERVICE_MAPPING_TABLE, "# none\n");
    // A system service whose one section runs past the port space.
    FakeFirewall().sections = {
        {"big", 1, ZARK_FW_PROTO_TCP, true, {"65530-65540"}},
        {"web", 1, ZARK_FW_PROTO_TCP, true, {"80"}}};
    FakeFirewall().systemServices = {"big", "web"};
    FakeFirewall().serviceSections = {{"big", {"big"}}, {"web", {"web"}}};
  }
};

TEST_F(ServHandlerFakeFirewall, HandlerFreesItsTableOnceWhenItEnds) {
  { RouterRuleServHandler unused; }
  EXPECT_EQ(FakeFirewall().tablesFreed, 0);
  {
    RouterRuleServHandler handler;
    ASSERT_EQ(handler.FwSectionEnum(), 0);
    EXPECT_EQ(FakeFirewall().tablesFreed, 0);
    ASSERT_EQ(handler.FwSectionEnum(), 0);
    EXPECT_EQ(FakeFirewall().tablesFreed, 1);
  }
  EXPECT_EQ(FakeFirewall().tablesBuilt, 2);
  EXPECT_EQ(FakeFirewall().tablesFreed, 2);
}

TEST_F(ServHandlerFakeFirewall, FailedEnumerationLogsTheErrorState) {
  FakeFirewall().fwServiceEnumResult = -1;
  {
    RouterRuleServHandler handler;
    EXPECT_EQ(handler.FwSectionEnum(), -1);
  }
  EXPECT_TRUE(HasServLog(R"(Failed to enum firewall section, )"
                         R"(\[0x0400 tests/fakes/fake_firewall\.cpp:\d+\])"));
  // The table handed out with the failure is freed all the same.
  EXPECT_EQ(FakeFirewall().tablesFreed, 1);
}

TEST_F(ServHandlerFakeFirewall, SectionPortsPastTheEndFailTheWholePolicy) {
  RouterRuleServHandler handler;
  RouterRuleConfWriter writer;
  std::string what = OutOfRangeText([&] {
    handler.SetServPfRules(Parse(R"({"add": ["web", "big"]})"), writer);
  });
  EXPECT_EQ(what.rfind("bitset::set", 0), 0u) << what;
  EXPECT_TRUE(writer.Rules().empty());
}

TEST_F(ServHandlerFakeFirewall, SectionRangePastTheEndIsDenyUntilAllIsCovered) {
  {
    RouterRuleServHandler handler;
    Json::Value out(Json::arrayValue);
    EXPECT_EQ(handler.GetServPfStatus(Parse(R"(["big"])"), out), 0);
    EXPECT_EQ(out, Parse(R"([{"service_id": "big", "status": "deny",
                              "port_info": {"big": "deny"}}])"));
  }
  // Once every port up to 65535 is forwarded the check runs off the map.
  SaveRules({Rule("0", true, "65530-65535", "65530-65535", "tcp")});
  RouterRuleServHandler handler;
  Json::Value out(Json::arrayValue);
  std::string what = OutOfRangeText(
      [&] { handler.GetServPfStatus(Parse(R"(["big"])"), out); });
  EXPECT_EQ(what.rfind("bitset::test", 0), 0u) << what;
}

TEST_F(ServHandlerFakeFirewall,
       SystemServiceWhoseSectionsCannotBeReadIsUnknown) {
  FakeFirewall().servicecfgInfoGetResult = -1;
  RouterRuleServHandler handler;
  Json::Value out(Json::arrayValue);
  EXPECT_EQ(handler.GetServPfStatus(Parse(R"(["web"])"), out), 0);
  EXPECT_EQ(out, Parse(R"([{"service_id": "web", "status": "unknown"}])"));
}

TEST_F(ServHandlerFakeFirewall, EveryServiceCheckEnumeratesServicesTwice) {
  RouterRuleServHandler handler;
  Json::Value out(Json::arrayValue);
  EXPECT_EQ(handler.GetServPfStatus(Json::Value(Json::arrayValue), out), 0);
  EXPECT_EQ(FakeFirewall().serviceEnumCalls, 2);
  ASSERT_EQ(out.size(), 2u);
  EXPECT_EQ(out[0]["service_id"], "big");
  EXPECT_EQ(out[1]["service_id"], "web");
}

TEST_F(ServHandlerFakeFirewall, FailedServiceEnumerationEndsTheCheck) {
  FakeFirewall().serviceEnumResult = -1;
  RouterRuleServHandler handler;
  Json::Value out(Json::arrayValue);
  EXPECT_EQ(handler.GetServPfStatus(Parse(R"(["web"])"), out), 0);
  EXPECT_EQ(out, Json::Value(Json::arrayValue));
  EXPECT_TRUE(HasServLog(R"(Failed to enum service, )"
                         R"(\[0x0400 tests/fakes/fake_firewall\.cpp:\d+\])"));
}

} // namespace
