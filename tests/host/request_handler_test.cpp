// The request handler without sockets, logged in as an administrator:
// fields to parameters, lookups, the module's answers passed through, the
// host's own codes, bounds, and a background task polled to its end.
#include "host_test_support.h"
#include "syslog_capture.h"

#include <syslog.h>

#include <gtest/gtest.h>

#include <chrono>
#include <thread>

namespace zark::host {
namespace {

using test::Browser;
using test::FormEncode;

class HostHandler : public test::HostFixture {
protected:
  void SetUp() override {
    HostFixture::SetUp();
    if (!HasFatalFailure()) {
      mAdmin = Login(test::kAdmin);
    }
  }
  Json::Value Call(const std::string &fields) {
    return HostFixture::Call(mAdmin, fields);
  }
  static int Code(const Json::Value &answer) {
    EXPECT_FALSE(answer["success"].asBool()) << answer;
    return answer["error"]["code"].asInt();
  }

  Browser mAdmin;
};

TEST_F(HostHandler, ParametersArriveAsJsonOrPlainStrings) {
  Json::Value answer = Call(
      "api=Test.Echo&version=1&method=echo&rules=" +
      FormEncode("[{\"enable\":true,\"router_port\":\"80\"}]") +
      "&name=plain+text&count=5&flag=true&task_id=" +
      FormEncode("Test.Task.count#00ff") + "&quoted=" + FormEncode("\"7\""));
  ASSERT_TRUE(answer["success"].asBool()) << answer;
  const Json::Value &params = answer["data"]["params"];
  EXPECT_EQ(params.size(), 6u);
  EXPECT_TRUE(params["rules"][0]["enable"].asBool());
  EXPECT_EQ(params["rules"][0]["router_port"], Json::Value("80"));
  EXPECT_EQ(params["name"], Json::Value("plain text"));
  EXPECT_EQ(params["count"], Json::Value(5));
  EXPECT_EQ(params["flag"], Json::Value(true));
  EXPECT_EQ(params["task_id"], Json::Value("Test.Task.count#00ff"));
  EXPECT_EQ(params["quoted"], Json::Value("7"));
  EXPECT_EQ(answer["data"]["user"].asString(), "admin");
}

TEST_F(HostHandler, GetCarriesTheCallInItsQuery) {
  WebAnswer answer =
      Get(Endpoint::Entry, "api=Test.Echo&version=2&method=echo&x=1", &mAdmin);
  EXPECT_EQ(answer.httpStatus, 200);
  ASSERT_TRUE(answer.body["success"].asBool()) << answer.body;
  EXPECT_EQ(answer.body["data"]["version"].asInt(), 2);
  EXPECT_EQ(answer.body["data"]["params"]["x"].asInt(), 1);
}

TEST_F(HostHandler, PostTakesFieldsFromQueryAndBody) {
  WebRequest request;
  request.endpoint = Endpoint::Entry;
  request.isPost = true;
  request.query = "api=Test.Echo&version=1";
  request.body = "method=echo&y=2";
  request.contentType = "application/x-www-form-urlencoded; charset=UTF-8";
  std::string cookies = mAdmin.cookie;
  request.cookies = cookies;
  request.token = mAdmin.token;
  WebAnswer answer = mHandler.Handle(request);
  ASSERT_TRUE(answer.body["success"].asBool()) << answer.body;
  EXPECT_EQ(answer.body["data"]["params"]["y"].asInt(), 2);

  request.body = "method=echo&api=Test.Echo";
  answer = mHandler.Handle(request);
  EXPECT_EQ(Code(answer.body), 101);
  EXPECT_EQ(answer.body["error"]["errors"]["field"].asString(), "api");
  EXPECT_EQ(answer.body["error"]["errors"]["reason"].asString(), "repeated");
}

TEST_F(HostHandler, MissingFieldsAre101NamingTheField) {
  struct Case {
    const char *fields;
    const char *field;
  } cases[] = {
      {"version=1&method=echo", "api"},
      {"api=Test.Echo&method=echo", "version"},
      {"api=Test.Echo&version=1", "method"},
      {"api=Test.Echo&version=v1&method=echo", "version"},
      {"api=&version=1&method=echo", "api"},
  };
  for (const Case &c : cases) {
    Json::Value answer = Call(c.fields);
    EXPECT_EQ(Code(answer), 101) << c.fields;
    EXPECT_EQ(answer["error"]["errors"]["field"].asString(), c.field);
  }
}

TEST_F(HostHandler, UnknownApiMethodAndVersionHaveTheirCodes) {
  Json::Value noApi = Call("api=Test.Nope&version=1&method=echo");
  EXPECT_EQ(Code(noApi), 102);
  EXPECT_FALSE(noApi["error"].isMember("errors"));
  EXPECT_EQ(Code(Call("api=Test.Echo&version=1&method=nope")), 103);
  EXPECT_EQ(Code(Call("api=Test.Echo&version=3&method=echo")), 104);
  EXPECT_EQ(Code(Call("api=Test.Echo&version=2&method=empty")), 104);
}

TEST_F(HostHandler, ModuleErrorsPassThroughUnchanged) {
  Json::Value fail = Call("api=Test.Echo&version=1&method=fail");
  EXPECT_EQ(Code(fail), 1521);
  EXPECT_EQ(fail["error"]["errors"]["sec"].asString(), "rule");
  EXPECT_EQ(fail["error"]["errors"]["append"].asString(), "70000");
  Json::Value bare = Call("api=Test.Echo&version=1&method=fail_bare");
  EXPECT_EQ(Code(bare), 1500);
  EXPECT_FALSE(bare["error"].isMember("errors"));
}

TEST_F(HostHandler, SuccessWithoutDataHasNoDataMember) {
  Json::Value answer = Call("api=Test.Echo&version=1&method=empty");
  EXPECT_TRUE(answer["success"].asBool());
  EXPECT_FALSE(answer.isMember("data"));
  EXPECT_FALSE(answer.isMember("error"));
}

TEST_F(HostHandler, MethodThatSetsNothingIs109) {
  zark::test::ClearLogs();
  EXPECT_EQ(Code(Call("api=Test.Echo&version=1&method=silent")), 109);
  EXPECT_TRUE(
      test::HasLogFrom(LOG_WARNING, "host/request_handler.cpp",
                       "Test.Echo silent version 1 of module " +
                           (std::filesystem::path("/tmp/host-modules/fixture") /
                            "good_module.so")
                               .string() +
                           " set no answer"));
}

TEST_F(HostHandler, ThrowingMethodIs100AndTheHostGoesOn) {
  zark::test::ClearLogs();
  EXPECT_EQ(Code(Call("api=Test.Echo&version=1&method=throw")), 100);
  EXPECT_TRUE(test::HasLogFrom(LOG_ERR, "host/request_handler.cpp",
                               "Test.Echo throw version 1 of module "
                               "/tmp/host-modules/fixture/good_module.so "
                               "threw: bitset::set"));
  EXPECT_EQ(Code(Call("api=Test.Echo&version=1&method=throw_int")), 100);
  EXPECT_TRUE(test::HasLogFrom(LOG_ERR, "host/request_handler.cpp",
                               "threw a non-standard exception"));
  EXPECT_TRUE(Call("api=Test.Echo&version=1&method=echo")["success"].asBool());
}

TEST_F(HostHandler, BackgroundTaskIsPolledToItsEnd) {
  Json::Value start = Call("api=Test.Task&version=1&method=start&steps=4");
  ASSERT_TRUE(start["success"].asBool()) << start;
  ASSERT_EQ(start["data"].size(), 1u);
  const std::string id = start["data"]["task_id"].asString();
  EXPECT_EQ(id.rfind("Test.Task.count#", 0), 0u) << id;

  Json::Value record;
  const auto deadline =
      std::chrono::steady_clock::now() + std::chrono::seconds(30);
  for (int poll = 0; poll < 3000; ++poll) {
    Json::Value status =
        Call("api=Test.Task&version=1&method=status&task_id=" + FormEncode(id));
    ASSERT_TRUE(status["success"].asBool()) << status;
    record = status["data"];
    if (record["finish"].asBool() ||
        std::chrono::steady_clock::now() > deadline) {
      break;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  ASSERT_TRUE(record["finish"].asBool()) << record;
  EXPECT_TRUE(record["success"].asBool());
  EXPECT_EQ(record["data"]["step"].asInt(), 4);
  EXPECT_TRUE(record["data"]["done"].asBool());
  // The poll that saw it finished removed it.
  EXPECT_EQ(Code(Call("api=Test.Task&version=1&method=status&task_id=" +
                      FormEncode(id))),
            1500);
}

TEST_F(HostHandler, QueryListsWhatIsServed) {
  WebAnswer answer = Get(Endpoint::Query, "", &mAdmin);
  ASSERT_TRUE(answer.body["success"].asBool());
  const Json::Value &data = answer.body["data"];
  EXPECT_EQ(data.size(), 2u);
  EXPECT_EQ(data["Test.Echo"]["module"].asString(), "good_module.so");
  EXPECT_EQ(data["Test.Echo"]["methods"]["echo"].size(), 2u);
  EXPECT_EQ(data["Test.Task"]["methods"]["status"][0].asInt(), 1);
}

TEST_F(HostHandler, BodyBeyondTheBoundIs108With413) {
  std::string body =
      "api=Test.Echo&version=1&method=echo&big=" + std::string(64 * 1024, 'x');
  WebAnswer answer = Post(Endpoint::Entry, body, &mAdmin);
  EXPECT_EQ(answer.httpStatus, 413);
  EXPECT_EQ(Code(answer.body), 108);
  EXPECT_EQ(answer.body["error"]["errors"]["limit"].asString(), "body");
  std::string fits = "api=Test.Echo&version=1&method=echo&big=";
  fits += std::string(64 * 1024 - fits.size(), 'x');
  EXPECT_TRUE(Post(Endpoint::Entry, fits, &mAdmin).body["success"].asBool());
}

TEST_F(HostHandler, TooManyParametersIs108) {
  std::string fields = "api=Test.Echo&version=1&method=echo";
  for (int i = 0; i < 64; ++i) {
    fields += "&p" + std::to_string(i) + "=1";
  }
  EXPECT_TRUE(Call(fields)["success"].asBool());
  Json::Value answer = Call(fields + "&p64=1");
  EXPECT_EQ(Code(answer), 108);
  EXPECT_EQ(answer["error"]["errors"]["limit"].asString(), "parameters");
}

TEST_F(HostHandler, HeadersBeyondTheBoundAre108With431) {
  WebRequest request;
  request.endpoint = Endpoint::Entry;
  request.query = "api=Test.Echo&version=1&method=echo";
  request.headerBytes = 16 * 1024 + 1;
  WebAnswer answer = mHandler.Handle(request);
  EXPECT_EQ(answer.httpStatus, 431);
  EXPECT_EQ(Code(answer.body), 108);
  EXPECT_EQ(answer.body["error"]["errors"]["limit"].asString(), "headers");
}

TEST_F(HostHandler, BrokenFormIs101) {
  Json::Value answer = Call("api=Test.Echo&version=1&method=echo&x=%zz");
  EXPECT_EQ(Code(answer), 101);
  EXPECT_EQ(answer["error"]["errors"]["reason"].asString(), "form_encoding");
}

TEST_F(HostHandler, BodyOfAnotherTypeIs101) {
  WebAnswer answer =
      Post(Endpoint::Entry, "{\"api\":\"Test.Echo\",\"version\":1}", &mAdmin,
           "application/json");
  EXPECT_EQ(Code(answer.body), 101);
  EXPECT_EQ(answer.body["error"]["errors"]["field"].asString(), "Content-Type");
}

TEST(HostCookies, FindsTheNamedCookie) {
  EXPECT_EQ(FindCookie("id=abc", "id"), "abc");
  EXPECT_EQ(FindCookie("theme=dark; id=abc; x=1", "id"), "abc");
  EXPECT_EQ(FindCookie("  id = abc ;", "id"), "abc");
  EXPECT_EQ(FindCookie("sid=abc; idx=1", "id"), "");
  EXPECT_EQ(FindCookie("id=first; id=second", "id"), "first");
  EXPECT_EQ(FindCookie("", "id"), "");
  EXPECT_EQ(FindCookie("id", "id"), "");
}

} // namespace
} // namespace zark::host
