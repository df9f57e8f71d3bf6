// The service forwarding check as the host reaches it: through the module's
// method table, over the service definitions that ship with the system.
#include "ZARK.Core.PortForwarding.h"
#include "firewall_test_files.h"
#include "hermetic.h"
#include "serv_test_env.h"
#include "webapi.h"

#include <gtest/gtest.h>

#include <cstring>
#include <map>
#include <string>

namespace zark::test {
namespace {

ZARK_API_HANDLER CheckEntry() {
  for (const ZARK_API_TABLE *row = GetAPITable(); row->szAPI; ++row) {
    if (std::strcmp(row->szAPI, "ZARK.Core.PortForwarding.Rules.Serv") == 0 &&
        std::strcmp(row->szMethod, "check") == 0) {
      return row->handler;
    }
  }
  return nullptr;
}

// Runs the check entry with the given parameters; the answer's data.
Json::Value Check(ZARK::APIResponse &response,
                  const Json::Value &params = Json::Value(Json::objectValue)) {
  ZARK::APIRequest request(params);
  ZARK_API_HANDLER entry = CheckEntry();
  EXPECT_NE(entry, nullptr);
  if (entry) {
    entry(&request, &response);
  }
  return response.GetData();
}

// service id -> status, from an answer's "service_status".
std::map<std::string, std::string> Statuses(const Json::Value &data) {
  std::map<std::string, std::string> out;
  for (const Json::Value &service : data["service_status"]) {
    out[service["service_id"].asString()] = service["status"].asString();
  }
  return out;
}

class ServHandlerCheckEntry : public ::testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    InstallShippedDefinitions();
  }
};

TEST_F(ServHandlerCheckEntry, WithoutRulesEveryForwardableServiceIsDenied) {
  ZARK::APIResponse response;
  Json::Value data = Check(response);
  ASSERT_TRUE(response.IsSuccess());
  std::map<std::string, std::string> expected = {
      {"ftp", "deny"},    {"openvpn", "deny"}, {"rsync", "deny"},
      {"smb", "unknown"}, {"ssh", "deny"},     {"webadmin", "deny"},
      {"webdav", "deny"}};
  EXPECT_EQ(Statuses(data), expected);
}

TEST_F(ServHandlerCheckEntry, RulesCoveringAServiceMakeItAllowed) {
  SaveRules({Rule("0", true, "22", "22", "tcp"),
             Rule("1", true, "5000-5001", "5000-5001", "tcp")});
  ZARK::APIResponse response;
  Json::Value params(Json::objectValue);
  params["service_id"].append("ssh");
  params["service_id"].append("webadmin");
  params["service_id"].append("rsync");
  Json::Value data = Check(response, params);
  ASSERT_TRUE(response.IsSuccess());
  std::map<std::string, std::string> expected = {
      {"rsync", "deny"}, {"ssh", "allow"}, {"webadmin", "allow"}};
  EXPECT_EQ(Statuses(data), expected);
  EXPECT_EQ(data["service_status"][1]["port_info"]["ssh"], "allow");
}

TEST_F(ServHandlerCheckEntry, AnUnknownServiceIsUnknown) {
  ZARK::APIResponse response;
  Json::Value params(Json::objectValue);
  params["service_id"].append("no_such_service");
  Json::Value data = Check(response, params);
  ASSERT_TRUE(response.IsSuccess());
  ASSERT_EQ(data["service_status"].size(), 1u);
  EXPECT_EQ(data["service_status"][0]["service_id"], "no_such_service");
  EXPECT_EQ(data["service_status"][0]["status"], "unknown");
  EXPECT_FALSE(data["service_status"][0].isMember("port_info"));
}

TEST_F(ServHandlerCheckEntry, AServiceIdThatIsNotAnArrayIsRefused) {
  ZARK::APIResponse response;
  Json::Value params(Json::objectValue);
  params["service_id"] = "ssh";
  Check(response, params);
  EXPECT_EQ(response.GetState(), ZARK::APIResponse::State::Error);
  EXPECT_EQ(response.GetErrorCode(), 9999);
}

} // namespace
} // namespace zark::test
