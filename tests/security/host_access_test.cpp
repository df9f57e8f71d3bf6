// Who may call the module's methods. Every row of the module's own method
// table is called through the host by callers without the right: without a
// session (106), with a session but a missing or wrong X-ZARK-Token (107),
// and as an account outside the group "admin" (105). Each must be refused
// and leave no trace: no file written, no task started, no program run, no
// line logged by the module. As a control, the administrator's same call is
// not refused, and does leave traces, so that the checks can fail.
//
// Twice: through the real zark-webapid executable over HTTP (its files, its
// syslog and its child processes watched from outside), and through the
// host's request handler in this process, where the task registry itself
// can be asked.
#include "db_test_support.h"
#include "hermetic.h"
#include "host_test_support.h"
#include "security_support.h"
#include "syslog_capture.h"
#include "test_network.h"
#include "webapi.h"

#include <dirent.h>
#include <sys/wait.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <set>

namespace zark::security {
namespace {

namespace fs = std::filesystem;

constexpr std::size_t kTableRows = 20;

// Host codes of the refusals (README "Host framework error codes").
constexpr int kCodeNotAllowed = 105;
constexpr int kCodeNoSession = 106;
constexpr int kCodeBadToken = 107;

// A password that only the refused RouterConf set could have stored.
constexpr char kRefusedPassword[] = "refused-call-password-5b1d";

// The parameters of every call: enough for each method to write, start or
// run something if it ran at all (rules to save and apply, a router
// configuration with a login to store, tests to start).
std::string EffectfulParams() {
  const std::string rules =
      R"([{"enable":true,"rule_id":"1","router_protocol":"tcp",)"
      R"("router_port":"8080","ds_port":"80","serviceid":"",)"
      R"("service_name":"web"}])";
  return "&rules=" + FormEncode(rules) + "&task_id_suffix=web" +
         "&auto_save=false" + "&selection=%22%22" +
         "&service_id=" + FormEncode(R"(["web"])") + "&router_brand=Generic" +
         "&router_model=" + FormEncode("UPnP IGD") + "&router_version=generic" +
         "&router_protocol=http" + "&router_port=8080" +
         "&router_account=rtadmin" + "&router_pass=" + kRefusedPassword +
         "&support_upnp=no" + "&support_natpmp=no" + "&task_id=" +
         FormEncode("ZARK.Core.PortForwarding.detect#0123456789abcdef");
}

// The task id of a start answer, or empty.
std::string TaskId(const Json::Value &answer) {
  const Json::Value &data = answer["data"];
  return data.isObject() && data["task_id"].isString()
             ? data["task_id"].asString()
             : std::string();
}

std::string RowName(const MethodRow &row) {
  return row.api + " " + row.method + " v" + std::to_string(row.version);
}

// True when a syslog line (as sent: "<pri>date tag[pid]: text") or a
// captured line was written by the module or its platform libraries, whose
// lines begin with their source file.
bool IsModuleLine(const std::string &text) {
  std::size_t start = text.find("]: ");
  std::string_view message = start == std::string::npos
                                 ? std::string_view(text)
                                 : std::string_view(text).substr(start + 3);
  return message.rfind("src/", 0) == 0 || message.rfind("platform/", 0) == 0;
}

// The child processes of pid, from /proc/<pid>/task/*/children.
std::string ChildrenOf(pid_t pid) {
  std::string children;
  const std::string tasks = "/proc/" + std::to_string(pid) + "/task";
  std::error_code ec;
  for (const auto &task : fs::directory_iterator(tasks, ec)) {
    std::ifstream in(task.path() / "children");
    std::string list;
    std::getline(in, list);
    children += list;
  }
  return children;
}

// A stand-in for the tool the module runs, leaving a mark when it runs.
constexpr char kToolMark[] = "/tmp/zarkportforward.ran";
void InstallMarkingTool() {
  zark::test::WriteFile(
      "/usr/zark/bin/zarkportforward",
      std::string("#!/bin/sh\necho ran >> ") + kToolMark + "\n", 0755);
}

struct Caller {
  const char *what;
  std::optional<std::string> cookie;
  std::optional<std::string> token;
  int code;
};

std::vector<Caller> CallersWithoutTheRight(const HostSession &admin,
                                           const HostSession &viewer) {
  const std::string adminCookie = "id=" + admin.sessionId;
  return {
      {"no session at all", std::nullopt, std::nullopt, kCodeNoSession},
      {"the administrator's token without a session", std::nullopt, admin.token,
       kCodeNoSession},
      {"an unknown session id", "id=0123456789abcdef0123456789abcdef",
       admin.token, kCodeNoSession},
      {"the administrator's session without a token", adminCookie, std::nullopt,
       kCodeBadToken},
      {"the administrator's session with an empty token", adminCookie, "",
       kCodeBadToken},
      {"the administrator's session with another session's token", adminCookie,
       viewer.token, kCodeBadToken},
      {"a logged-in account outside the group admin", "id=" + viewer.sessionId,
       viewer.token, kCodeNotAllowed},
  };
}

class SecurityHostAccess : public testing::Test {
protected:
  void SetUp() override {
    std::optional<zark::testnet::TestNetwork> network =
        zark::testnet::CurrentNetwork();
    ASSERT_TRUE(network.has_value())
        << "run through testnet/run-in-testnet.sh (as CTest does)";
    mGateway = network->lanRouter;
    zark::test::ResetFixedPaths();
    zark::test::InstallShippedRouterDb();
    std::string why;
    mRows = ReadModuleTable(kBuiltModule, why);
    ASSERT_EQ(kTableRows, mRows.size()) << why;
  }

  std::string mGateway;
  std::vector<MethodRow> mRows;
};

TEST_F(SecurityHostAccess, ProcessRefusesEveryMethodToCallersWithoutTheRight) {
  InstallMarkingTool();
  HostProcess host;
  std::string why;
  ASSERT_TRUE(host.Start(why)) << why;
  std::optional<HostSession> admin = host.Login(kAdminAccount);
  std::optional<HostSession> viewer = host.Login(kViewerAccount);
  ASSERT_TRUE(admin && viewer);

  // The host serves exactly the rows of the module's table.
  HostAnswer served = host.Post("/webapi/query.cgi", "",
                                "id=" + admin->sessionId, admin->token);
  std::set<std::string> servedRows;
  for (const std::string &api : served.json["data"].getMemberNames()) {
    const Json::Value &methods = served.json["data"][api]["methods"];
    for (const std::string &method : methods.getMemberNames()) {
      for (const Json::Value &version : methods[method]) {
        servedRows.insert(RowName({api, version.asInt(), method}));
      }
    }
  }
  std::set<std::string> tableRows;
  for (const MethodRow &row : mRows) {
    tableRows.insert(RowName(row));
  }
  EXPECT_EQ(tableRows, servedRows);

  const std::vector<std::string> roots = ModuleWrittenRoots();
  const TreeSnapshot before = SnapshotTrees(roots, {kWorkDir});
  host.Log().Settle();
  const std::size_t logBefore = host.Log().Lines().size();

  const std::vector<Caller> callers = CallersWithoutTheRight(*admin, *viewer);
  for (const MethodRow &row : mRows) {
    for (const Caller &caller : callers) {
      // By POST (as the front end calls) and by GET.
      for (bool post : {true, false}) {
        const std::string fields = RowFields(row) + EffectfulParams();
        HostAnswer answer = post ? host.Post("/webapi/entry.cgi", fields,
                                             caller.cookie, caller.token)
                                 : host.Get("/webapi/entry.cgi", fields,
                                            caller.cookie, caller.token);
        const std::string what =
            RowName(row) + ", " + caller.what + (post ? ", POST" : ", GET");
        EXPECT_EQ(200, answer.httpStatus) << what;
        EXPECT_FALSE(answer.Success()) << what;
        EXPECT_EQ(caller.code, answer.Code()) << what << ": " << answer.body;
        EXPECT_FALSE(answer.json.isMember("data")) << answer.body;
        if (caller.code == kCodeNotAllowed) {
          EXPECT_EQ("admin_only",
                    answer.json["error"]["errors"]["reason"].asString())
              << answer.body;
        }
      }
    }
  }

  // Nothing happened: no file, no program, no module line (a method runs
  // before its answer is sent). That no task was started either is asked of
  // the task registry itself in the in-process test below.
  host.Log().Settle();
  EXPECT_EQ("", DescribeChanges(before, SnapshotTrees(roots, {kWorkDir})));
  EXPECT_FALSE(fs::exists(kToolMark));
  EXPECT_EQ("", ChildrenOf(host.Pid()));
  std::vector<std::string> lines = host.Log().Lines();
  for (std::size_t i = logBefore; i < lines.size(); ++i) {
    EXPECT_FALSE(IsModuleLine(lines[i])) << lines[i];
  }

  // Control: the administrator's same calls reach the module; the table's
  // background methods start tasks, and RouterConf set stores the
  // configuration.
  int tasks = 0;
  for (const MethodRow &row : mRows) {
    HostAnswer answer = host.Call(*admin, RowFields(row) + EffectfulParams());
    EXPECT_TRUE(answer.Success() || (answer.Code() != kCodeNotAllowed &&
                                     answer.Code() != kCodeNoSession &&
                                     answer.Code() != kCodeBadToken))
        << RowName(row) << ": " << answer.body;
    // Not one of the lookup failures either: the host found the method.
    EXPECT_TRUE(answer.Code() < 102 || answer.Code() > 104)
        << RowName(row) << ": " << answer.body;
    if (!TaskId(answer.json).empty()) {
      ++tasks;
    }
  }
  EXPECT_EQ(5, tasks) << "detect, Rules save and test, Rules.Serv test and "
                         "the compatibility test start tasks";
  EXPECT_NE("", DescribeChanges(before, SnapshotTrees(roots, {kWorkDir})));
  EXPECT_NE(
      std::string::npos,
      zark::test::ReadFile("/etc/portforward/routers/" + mGateway + ".conf")
          .find(kRefusedPassword));
  const int status = host.Stop();
  ASSERT_NE(-1, status) << "the host did not stop";
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
}

// The host's request handler in this process, with the real module: here
// the task registry itself shows that no task was started.
class SecurityHostAccessInProcess : public zark::host::test::HostFixture {
protected:
  void SetUp() override {
    std::optional<zark::testnet::TestNetwork> network =
        zark::testnet::CurrentNetwork();
    ASSERT_TRUE(network.has_value())
        << "run through testnet/run-in-testnet.sh (as CTest does)";
    zark::test::ResetFixedPaths();
    zark::test::InstallShippedRouterDb();
    zark::host::test::WriteStandardAccounts();
    std::error_code ec;
    fs::create_directories(kWorkDir, ec);
    mModulePath = kWorkDir + "/ZARK.Core.PortForwarding.so";
    fs::copy_file(kBuiltModule, mModulePath,
                  fs::copy_options::overwrite_existing, ec);
    ASSERT_FALSE(ec) << ec.message();
    ASSERT_TRUE(mModules.LoadModule(mModulePath));
    std::string why;
    mRows = ReadModuleTable(mModulePath, why);
    ASSERT_EQ(kTableRows, mRows.size()) << why;
  }

  void TearDown() override { ZARK::APIPolling::JoinAll(); }

  Json::Value Entry(const std::string &fields,
                    const std::optional<std::string> &cookie,
                    const std::optional<std::string> &token) {
    zark::host::WebRequest request;
    request.endpoint = zark::host::Endpoint::Entry;
    request.isPost = true;
    request.body = fields;
    request.contentType = "application/x-www-form-urlencoded";
    request.clientAddress = mClientAddress;
    if (cookie) {
      request.cookies = *cookie;
    }
    request.token = token;
    return mHandler.Handle(request).body;
  }

  static Json::Value AdminTasks() {
    ZARK::APIPolling polling;
    Json::Value groups(Json::arrayValue);
    groups.append("admin");
    Json::Value result;
    EXPECT_TRUE(polling.List("", groups, result));
    return result["admin"];
  }

  std::string mModulePath;
  std::vector<MethodRow> mRows;
};

TEST_F(SecurityHostAccessInProcess, RefusedCallsStartNoTaskAndRunNoModuleCode) {
  zark::host::test::Browser admin = Login(zark::host::test::kAdmin);
  zark::host::test::Browser viewer = Login(zark::host::test::kViewer);
  const HostSession adminSession{admin.sessionId, admin.token};
  const HostSession viewerSession{viewer.sessionId, viewer.token};
  const std::vector<std::string> roots = ModuleWrittenRoots();
  const TreeSnapshot before = SnapshotTrees(roots, {kWorkDir, "/tmp/host"});
  zark::test::ClearLogs();

  for (const MethodRow &row : mRows) {
    for (const Caller &caller :
         CallersWithoutTheRight(adminSession, viewerSession)) {
      Json::Value answer = Entry(RowFields(row) + EffectfulParams(),
                                 caller.cookie, caller.token);
      EXPECT_EQ(caller.code, answer["error"]["code"].asInt())
          << RowName(row) << ", " << caller.what << ": " << answer;
      EXPECT_EQ(0u, AdminTasks().size()) << RowName(row) << ", " << caller.what;
    }
  }
  for (const zark::test::LogLine &line : zark::test::CapturedLogs()) {
    EXPECT_FALSE(IsModuleLine(line.message)) << line.message;
  }
  EXPECT_EQ("", DescribeChanges(before,
                                SnapshotTrees(roots, {kWorkDir, "/tmp/host"})));

  // Control: the administrator's calls of the background methods start
  // tasks that the registry lists.
  std::set<std::string> started;
  for (const MethodRow &row : mRows) {
    Json::Value answer = Entry(RowFields(row) + EffectfulParams(),
                               "id=" + admin.sessionId, admin.token);
    const int code =
        answer.isMember("error") ? answer["error"]["code"].asInt() : 0;
    EXPECT_TRUE(code != kCodeNotAllowed && code != kCodeNoSession &&
                code != kCodeBadToken)
        << RowName(row) << ": " << answer;
    if (!TaskId(answer).empty()) {
      started.insert(TaskId(answer));
    }
  }
  EXPECT_EQ(5u, started.size());
  std::set<std::string> listed;
  for (const Json::Value &id : AdminTasks()) {
    listed.insert(id.asString());
  }
  // A task may have ended and been swept by a status call of the walk (the
  // compatibility stop sweeps its own); every listed one was started here.
  for (const std::string &id : listed) {
    EXPECT_EQ(1u, started.count(id)) << id;
  }
  EXPECT_FALSE(listed.empty());
  const std::vector<zark::test::LogLine> logged = zark::test::CapturedLogs();
  EXPECT_TRUE(std::any_of(logged.begin(), logged.end(),
                          [](const zark::test::LogLine &line) {
                            return IsModuleLine(line.message);
                          }));
  ZARK::APIPolling polling;
  for (const std::string &id : started) {
    polling.Stop(id, true);
  }
}

} // namespace
} // namespace zark::security
