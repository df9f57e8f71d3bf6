// The host under load: zark-webapid of this build with the real module
// ZARK.Core.PortForwarding.so, on 127.0.0.1 in the server namespace of a
// test network whose router runs miniupnpd, and 20 clients at once, each
// logged in with a session of its own. For ZARK_LOAD_SECONDS (15 by
// default):
//
//   10 savers   each saves its own rule set (Rules save) again and again,
//               following every save with save_status until it ends
//   10 pollers  read the saved rules (Rules load), poll save_status of the
//               savers' tasks, and ask get_current_process
//
// Pollers follow the newest saves, from the moment they are started (a
// save's thread may not have reported anything yet: it must answer
// "processing", not a failure). Whoever polls a finished task first removes
// its record (the module's sweep), so a saver may find its task gone after
// a poller saw its end: a task counts as ended when anyone got its end
// answer.
//
// Checked: every request is answered (each within kRequestBound), the host
// keeps running and stops cleanly afterwards, every started save ends
// (within kTaskEndBound) and none fails, every load answers exactly one
// client's set (or, before the first save, none), and at the end the
// saved rules (Rules load and /etc/portforward/rule.conf) are exactly one
// client's set, and the router holds exactly that set's mappings. One
// summary line goes to standard output for the figures script:
//   load: 20 clients, 15 s, 252 saves started, 252 ended, 16002 requests,
//   0 errors
// and a second one with the slowest answer and whose set was saved last.
#include "api_client.h"
#include "db_test_support.h"
#include "hermetic.h"
#include "host_syslog.h"
#include "libzarkportmap.h"
#include "test_network.h"
#include "webapid_process.h"

#include <gtest/gtest.h>

#include <sys/wait.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <latch>
#include <map>
#include <mutex>
#include <optional>
#include <random>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

namespace zark::load {
namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;
using zark::testnet::TestNetwork;
using zark::testnet::UpnpMapping;

constexpr int kClients = 20;
constexpr int kSavers = 10; // the other clients poll
constexpr int kDefaultSeconds = 15;
// Every request must be answered within this. The host answers status
// polls and loads at once and starts a save on a task thread, so only a
// host that hangs comes near it.
constexpr auto kRequestBound = std::chrono::seconds(20);
// Every started save must end within this: saves wait for each other on the
// port-map lock (at most 30 s each), and one save here takes a fraction of
// a second.
constexpr auto kTaskEndBound = std::chrono::seconds(120);
constexpr auto kStatusInterval = 50ms; // a saver's polls of its own task
constexpr auto kPollerPause = 10ms;    // between a poller's requests
constexpr const char *kApiBase = "ZARK.Core.PortForwarding";
constexpr const char *kApiRules = "ZARK.Core.PortForwarding.Rules";
constexpr const char *kAccount = "admin";
constexpr const char *kPassword = "L0ad-test-Adm1n";
constexpr const char *kRuleConf = "/etc/portforward/rule.conf";
// The module's default code, answered alone (without error data) when the
// task named by a status poll is not held: its record was removed.
constexpr int kCodeNoSuchTask = 1500;

// ---------------------------------------------------------------------------
// The rule sets: saver s owns router ports 41000 + 10 s ... + 9 and local
// ports 8000 + 10 s ..., so no two sets share a port or a rule id.

Json::Value Rule(const std::string &id, bool enable,
                 const std::string &protocol, const std::string &routerPort,
                 const std::string &dsPort) {
  Json::Value rule(Json::objectValue);
  rule["rule_id"] = id;
  rule["enable"] = enable;
  rule["router_protocol"] = protocol;
  rule["router_port"] = routerPort;
  rule["ds_port"] = dsPort;
  rule["serviceid"] = "";
  rule["service_name"] = "";
  return rule;
}

int RouterBase(int saver) {
  return 41000 + 10 * saver;
}
int LocalBase(int saver) {
  return 8000 + 10 * saver;
}
std::string RuleId(int saver, const char *what) {
  return "load" + std::to_string(saver) + "-" + what;
}

// A TCP rule, a UDP rule, a TCP range of two ports and a disabled rule
// (saved as written, mapped nowhere).
Json::Value RuleSet(int saver) {
  const int router = RouterBase(saver);
  const int local = LocalBase(saver);
  auto port = [](int number) { return std::to_string(number); };
  Json::Value rules(Json::arrayValue);
  rules.append(
      Rule(RuleId(saver, "tcp"), true, "tcp", port(router), port(local)));
  rules.append(Rule(RuleId(saver, "udp"), true, "udp", port(router + 1),
                    port(local + 1)));
  rules.append(Rule(RuleId(saver, "range"), true, "tcp",
                    port(router + 2) + "-" + port(router + 3),
                    port(local + 2) + "-" + port(local + 3)));
  rules.append(Rule(RuleId(saver, "off"), false, "tcp", port(router + 5),
                    port(local + 5)));
  return rules;
}

// protocol, router port, local port, description
using Mapping = std::tuple<std::string, int, int, std::string>;

std::set<Mapping> RouterMappingsOf(int saver) {
  const int router = RouterBase(saver);
  const int local = LocalBase(saver);
  auto described = [saver](const char *what) {
    return "zarkportforward " + RuleId(saver, what);
  };
  return {{"TCP", router, local, described("tcp")},
          {"UDP", router + 1, local + 1, described("udp")},
          {"TCP", router + 2, local + 2, described("range")},
          {"TCP", router + 3, local + 3, described("range")}};
}

// The saver whose set rules is, or nothing.
std::optional<int> SaverOfSet(const Json::Value &rules) {
  for (int saver = 0; saver < kSavers; ++saver) {
    if (rules == RuleSet(saver)) {
      return saver;
    }
  }
  return std::nullopt;
}

// ---------------------------------------------------------------------------
// Shared records of the run.

enum class StatusKind { kRunning, kSucceeded, kFailed, kGone, kMalformed };

// A save_status answer: running ({"status": "processing", "percentage":
// 0..100}), ended well ({"status": "success", "percentage": 100}), ended in
// error (a code with the task's error data), or gone (1500 alone).
StatusKind ClassifyStatus(const ApiAnswer &answer) {
  if (answer.success) {
    const Json::Value &status = answer.data["status"];
    const Json::Value &percentage = answer.data["percentage"];
    if (!status.isString() || !percentage.isInt() || percentage.asInt() < 0 ||
        percentage.asInt() > 100) {
      return StatusKind::kMalformed;
    }
    if (status.asString() == "processing") {
      return StatusKind::kRunning;
    }
    if (status.asString() == "success" && percentage.asInt() == 100) {
      return StatusKind::kSucceeded;
    }
    return StatusKind::kMalformed;
  }
  if (answer.hasErrors) {
    return StatusKind::kFailed;
  }
  return answer.code == kCodeNoSuchTask ? StatusKind::kGone
                                        : StatusKind::kMalformed;
}

// Everything that went wrong, in the order seen.
class Problems {
public:
  void Add(const std::string &what) {
    std::lock_guard lock(mMutex);
    ++mCount;
    if (mFirst.size() < 30) {
      mFirst.push_back(what);
    }
  }
  int Count() const {
    std::lock_guard lock(mMutex);
    return mCount;
  }
  std::string Text() const {
    std::lock_guard lock(mMutex);
    std::string text;
    for (const std::string &line : mFirst) {
      text += "  " + line + "\n";
    }
    return text;
  }

private:
  mutable std::mutex mMutex;
  int mCount = 0;
  std::vector<std::string> mFirst;
};

// The save tasks started, and who saw each one end and how.
class TaskBook {
public:
  struct Entry {
    int saver = -1;
    bool ended = false;
    bool succeeded = false;
    Clock::time_point endSeen;
  };

  void Started(const std::string &id, int saver) {
    std::lock_guard lock(mMutex);
    mTasks[id].saver = saver;
    mOrder.push_back(id);
  }

  // The first end answer seen for the task, by its saver or a poller.
  void Ended(const std::string &id, bool succeeded) {
    std::lock_guard lock(mMutex);
    Entry &entry = mTasks[id];
    if (!entry.ended) {
      entry.ended = true;
      entry.succeeded = succeeded;
      entry.endSeen = Clock::now();
    }
  }

  // One of the last few tasks started, preferring one not seen ending.
  std::optional<std::string> Pick(std::mt19937 &random) {
    std::lock_guard lock(mMutex);
    if (mOrder.empty()) {
      return std::nullopt;
    }
    const std::size_t window = std::min<std::size_t>(mOrder.size(), kSavers);
    std::uniform_int_distribution<std::size_t> pick(0, window - 1);
    for (int attempt = 0; attempt < 4; ++attempt) {
      const std::string &id = mOrder[mOrder.size() - 1 - pick(random)];
      if (!mTasks[id].ended) {
        return id;
      }
    }
    return mOrder.back();
  }

  std::map<std::string, Entry> Snapshot() const {
    std::lock_guard lock(mMutex);
    return mTasks;
  }

private:
  mutable std::mutex mMutex;
  std::map<std::string, Entry> mTasks;
  std::vector<std::string> mOrder; // in start order
};

struct RunShared {
  int port = 0;
  Clock::time_point stopAt;
  TaskBook tasks;
  Problems problems;
  std::atomic<long> requests{0};
  std::atomic<long> savesStarted{0};
  std::atomic<long long> slowestMicros{0};
};

// One call, counted, with transport failures and slow answers reported.
ApiAnswer CountedCall(RunShared &run, ApiClient &client, const char *who,
                      const std::string &api, const std::string &method,
                      const Json::Value &params) {
  ApiAnswer answer = client.Call(api, method, params);
  ++run.requests;
  long long micros = answer.latency.count();
  long long slowest = run.slowestMicros.load();
  while (micros > slowest &&
         !run.slowestMicros.compare_exchange_weak(slowest, micros)) {
  }
  if (!answer.answered) {
    run.problems.Add(std::string(who) + ": " + method +
                     " not answered: " + answer.failure);
  }
  return answer;
}

Json::Value TaskParams(const std::string &taskId) {
  Json::Value params(Json::objectValue);
  params["task_id"] = taskId;
  return params;
}

// A saver: saves its set, follows the task to its end, again until stopAt.
void RunSaver(RunShared &run, int saver) {
  const std::string who = "saver " + std::to_string(saver);
  ApiClient client(run.port, kRequestBound);
  std::string why;
  ++run.requests;
  if (!client.Login(kAccount, kPassword, why)) {
    run.problems.Add(who + ": login failed: " + why);
    return;
  }
  Json::Value params(Json::objectValue);
  params["rules"] = RuleSet(saver);
  while (Clock::now() < run.stopAt) {
    ApiAnswer start =
        CountedCall(run, client, who.c_str(), kApiRules, "save", params);
    if (!start.answered) {
      return; // the host no longer answers; reported
    }
    if (!start.success || !start.data["task_id"].isString()) {
      run.problems.Add(who + ": save not started: " + start.body);
      return;
    }
    const std::string taskId = start.data["task_id"].asString();
    run.tasks.Started(taskId, saver);
    ++run.savesStarted;

    const Clock::time_point giveUp = Clock::now() + kTaskEndBound;
    bool over = false;
    while (!over) {
      if (Clock::now() >= giveUp) {
        run.problems.Add(who + ": save " + taskId + " did not end within " +
                         std::to_string(kTaskEndBound.count()) + " s");
        return;
      }
      ApiAnswer status = CountedCall(run, client, who.c_str(), kApiRules,
                                     "save_status", TaskParams(taskId));
      if (!status.answered) {
        return;
      }
      switch (ClassifyStatus(status)) {
      case StatusKind::kRunning:
        std::this_thread::sleep_for(kStatusInterval);
        break;
      case StatusKind::kSucceeded:
        run.tasks.Ended(taskId, true);
        over = true;
        break;
      case StatusKind::kFailed:
        run.tasks.Ended(taskId, false);
        run.problems.Add(who + ": save " + taskId + " failed: " + status.body);
        over = true;
        break;
      case StatusKind::kGone:
        // A poller saw the end first and removed the record; the final
        // check makes sure that someone did see it.
        over = true;
        break;
      case StatusKind::kMalformed:
        run.problems.Add(who + ": save_status answered " + status.body);
        return;
      }
    }
  }
}

// A poller: load, save_status of a saver's task, get_current_process.
void RunPoller(RunShared &run, int poller) {
  const std::string who = "poller " + std::to_string(poller);
  ApiClient client(run.port, kRequestBound);
  std::string why;
  ++run.requests;
  if (!client.Login(kAccount, kPassword, why)) {
    run.problems.Add(who + ": login failed: " + why);
    return;
  }
  std::mt19937 random(static_cast<unsigned>(poller) * 7919u + 1u);
  const Json::Value none(Json::objectValue);
  for (int round = 0; Clock::now() < run.stopAt; ++round) {
    ApiAnswer load =
        CountedCall(run, client, who.c_str(), kApiRules, "load", none);
    if (!load.answered) {
      return;
    }
    // The file is replaced whole: a reader sees one set, never a mixture.
    if (!load.success || !load.data.isArray() ||
        (load.data.size() != 0 && !SaverOfSet(load.data))) {
      run.problems.Add(who + ": load answered " + load.body);
    }
    std::this_thread::sleep_for(kPollerPause);

    if (std::optional<std::string> taskId = run.tasks.Pick(random)) {
      ApiAnswer status = CountedCall(run, client, who.c_str(), kApiRules,
                                     "save_status", TaskParams(*taskId));
      if (!status.answered) {
        return;
      }
      switch (ClassifyStatus(status)) {
      case StatusKind::kRunning:
      case StatusKind::kGone:
        break;
      case StatusKind::kSucceeded:
        run.tasks.Ended(*taskId, true);
        break;
      case StatusKind::kFailed:
        run.tasks.Ended(*taskId, false);
        run.problems.Add(who + ": save " + *taskId + " failed: " + status.body);
        break;
      case StatusKind::kMalformed:
        run.problems.Add(who + ": save_status answered " + status.body);
        break;
      }
      std::this_thread::sleep_for(kPollerPause);
    }

    if (round % 4 == 0) {
      ApiAnswer process = CountedCall(run, client, who.c_str(), kApiBase,
                                      "get_current_process", none);
      if (!process.answered) {
        return;
      }
      const Json::Value &name = process.data["process"];
      if (!process.success || !name.isString() ||
          (name.asString() != "none" && name.asString() != "portforwarding")) {
        run.problems.Add(who + ": get_current_process answered " +
                         process.body);
      }
      std::this_thread::sleep_for(kPollerPause);
    }
  }
}

// ZARK_LOAD_SECONDS, or the default; 0 when it is set but not a number of
// seconds from 1 to 86400.
int RunSeconds() {
  const char *text = std::getenv("ZARK_LOAD_SECONDS");
  if (text == nullptr || *text == '\0') {
    return kDefaultSeconds;
  }
  char *end = nullptr;
  long seconds = std::strtol(text, &end, 10);
  if (*end != '\0' || seconds < 1 || seconds > 86400) {
    return 0;
  }
  return static_cast<int>(seconds);
}

class LoadHost : public testing::Test {
protected:
  void SetUp() override {
    std::optional<TestNetwork> network = zark::testnet::CurrentNetwork();
    ASSERT_TRUE(network.has_value())
        << "run through testnet/run-in-testnet.sh (as CTest does)";
    mNet = *network;
    zark::test::ResetFixedPaths();
    zark::test::InstallShippedRouterDb();
    ConfigureUpnpRouter();
    std::string why;
    ASSERT_TRUE(mSyslog.Start(why)) << why;
    mHost = std::make_unique<WebapidProcess>(
        HostSetup{ZARK_WEBAPID_PATH, ZARK_MODULE_PATH, "/tmp/load-host",
                  kAccount, kPassword, 0});
    ASSERT_TRUE(mHost->Start(30s, why)) << why;
  }

  void TearDown() override {
    if (mHost != nullptr) {
      mHost->Stop(30s);
    }
    if (HasFailure()) {
      PrintHostLog();
    }
  }

  // Each distinct message of the host's syslog once, with how often it came,
  // in the order first seen.
  void PrintHostLog() const {
    std::vector<std::string> order;
    std::map<std::string, int> counts;
    for (const std::string &line : mSyslog.Lines()) {
      // "<27>Nov 21 08:41:37 zark-webapid[19713]: src/... text"
      std::string::size_type start = line.find("]: ");
      std::string message =
          start == std::string::npos ? line : line.substr(start + 3);
      if (counts[message]++ == 0) {
        order.push_back(message);
      }
    }
    std::fprintf(stderr, "--- syslog of zark-webapid (count, message)\n");
    for (const std::string &message : order) {
      std::fprintf(stderr, "%6d %s\n", counts[message], message.c_str());
    }
  }

  // The test network's router as a generic UPnP IGD, stored for its
  // gateway address the way the integration tests do.
  void ConfigureUpnpRouter() {
    ZARK_ROUTER_CONF conf{};
    std::strcpy(conf.brand, "Generic");
    std::strcpy(conf.model, "UPnP IGD");
    std::strcpy(conf.version, "generic");
    std::strcpy(conf.support_upnp, "yes");
    std::strcpy(conf.support_natpmp, "no");
    ZARK_LIBZARKPORTMAP_ERR err{0};
    ASSERT_EQ(0, KLibSetRouterConf(mNet.lanRouter.c_str(), &conf, &err, true))
        << err.err;
  }

  // The router's mappings as upnpc lists them.
  std::set<Mapping> RouterMappings() {
    std::vector<UpnpMapping> mappings;
    std::string raw;
    EXPECT_TRUE(zark::testnet::ListUpnpMappings(mNet, mappings, &raw)) << raw;
    std::set<Mapping> held;
    for (const UpnpMapping &mapping : mappings) {
      EXPECT_EQ(mNet.lanServer, mapping.internalAddress) << raw;
      held.insert({mapping.protocol, mapping.externalPort, mapping.internalPort,
                   mapping.description});
    }
    EXPECT_EQ(mappings.size(), held.size()) << raw;
    return held;
  }

  TestNetwork mNet;
  HostSyslog mSyslog;
  std::unique_ptr<WebapidProcess> mHost;
};

TEST_F(LoadHost, TwentyClientsSaveAndPollWithoutLosingASave) {
  const int seconds = RunSeconds();
  ASSERT_GT(seconds, 0) << "ZARK_LOAD_SECONDS must be 1 to 86400 seconds";

  RunShared run;
  run.port = mHost->Port();
  run.stopAt = Clock::now() + std::chrono::seconds(seconds);
  {
    std::vector<std::jthread> clients;
    for (int client = 0; client < kClients; ++client) {
      if (client < kSavers) {
        clients.emplace_back([&run, client] { RunSaver(run, client); });
      } else {
        clients.emplace_back(
            [&run, client] { RunPoller(run, client - kSavers); });
      }
    }
  } // every client has ended here

  ASSERT_TRUE(mHost->Running()) << "zark-webapid ended during the run";

  // Every started save ended, and someone saw how.
  const std::map<std::string, TaskBook::Entry> tasks = run.tasks.Snapshot();
  long ended = 0;
  std::set<int> savedWell;
  for (const auto &[id, entry] : tasks) {
    if (entry.ended) {
      ++ended;
      if (entry.succeeded) {
        savedWell.insert(entry.saver);
      }
    } else {
      run.problems.Add("save " + id + " of saver " +
                       std::to_string(entry.saver) + ": no end was seen");
    }
  }

  // The port-map library runs no job any more.
  ApiClient checker(run.port, kRequestBound);
  std::string why;
  ASSERT_TRUE(checker.Login(kAccount, kPassword, why)) << why;
  ++run.requests;
  ApiAnswer process = CountedCall(run, checker, "check", kApiBase,
                                  "get_current_process", Json::Value());
  EXPECT_TRUE(process.success) << process.body;
  EXPECT_EQ("none", process.data["process"].asString()) << process.body;

  // The saved rules are exactly one client's set, in the host's answer and
  // in the file.
  ApiAnswer load =
      CountedCall(run, checker, "check", kApiRules, "load", Json::Value());
  ASSERT_TRUE(load.success) << load.body;
  std::optional<int> owner = SaverOfSet(load.data);
  ASSERT_TRUE(owner.has_value())
      << "the saved rules are no client's set: " << load.body;
  EXPECT_TRUE(savedWell.contains(*owner))
      << "saver " << *owner << " never saw a save of its set succeed";
  Json::Value file;
  ASSERT_TRUE(ParseJson(zark::test::ReadFile(kRuleConf), file))
      << zark::test::ReadFile(kRuleConf);
  EXPECT_EQ(Json::Value(1), file["version"]);
  EXPECT_EQ(RuleSet(*owner), file["rules"]) << "the file holds another set";

  // The router holds exactly that set's mappings.
  EXPECT_EQ(RouterMappingsOf(*owner), RouterMappings());

  // Records of ended tasks that are still held: a task whose end its
  // poller saw before the task's thread returned keeps its record until
  // someone polls it again. Asked once for each task (which removes them).
  long held = 0;
  for (const auto &[id, entry] : tasks) {
    ApiAnswer status = CountedCall(run, checker, "check", kApiRules,
                                   "save_status", TaskParams(id));
    if (ClassifyStatus(status) != StatusKind::kGone) {
      ++held;
    }
  }

  // The host stops cleanly: it joins its task threads and exits 0.
  const int status = mHost->Stop(30s);
  EXPECT_TRUE(status != -1 && WIFEXITED(status) && WEXITSTATUS(status) == 0)
      << "zark-webapid did not stop cleanly (wait status " << status << ")";

  std::printf("load: %d clients, %d s, %ld saves started, %ld ended, %ld "
              "requests, %d errors\n",
              kClients, seconds, run.savesStarted.load(), ended,
              run.requests.load(), run.problems.Count());
  std::printf(
      "load details: slowest answer %.1f ms, saver %d's set saved last, %ld "
      "ended tasks still held\n",
      static_cast<double>(run.slowestMicros.load()) / 1000.0, *owner, held);
  std::fflush(stdout);
  EXPECT_EQ(0, run.problems.Count()) << run.problems.Text();
  EXPECT_EQ(run.savesStarted.load(), ended);
  EXPECT_GT(savedWell.size(), 1u) << "the savers did not take turns";
}

// A burst: the host's listening socket takes far more waiting connections
// than the HTTP library's own backlog of 5 (ss shows a listener's backlog as
// its Send-Q), and kBurst clients logging in at the same moment are all
// answered.
TEST_F(LoadHost, ABurstOfClientsConnectingAtOnceIsAnswered) {
  std::string output;
  ASSERT_EQ(
      0, zark::testnet::RunTool({"/usr/bin/ss", "-Hltn",
                                 "sport = :" + std::to_string(mHost->Port())},
                                output))
      << output;
  // "LISTEN 0      4096   127.0.0.1:39957      0.0.0.0:*"
  std::istringstream fields(output);
  std::string state;
  long waiting = -1;
  long backlog = -1;
  fields >> state >> waiting >> backlog;
  EXPECT_EQ("LISTEN", state) << output;
  EXPECT_GE(backlog, 128) << output;

  constexpr int kBurst = 100;
  std::latch start(kBurst);
  Problems problems;
  {
    std::vector<std::jthread> clients;
    for (int i = 0; i < kBurst; ++i) {
      clients.emplace_back([this, i, &start, &problems] {
        ApiClient client(mHost->Port(), kRequestBound);
        start.arrive_and_wait();
        std::string why;
        if (!client.Login(kAccount, kPassword, why)) {
          problems.Add("client " + std::to_string(i) + ": " + why);
        }
      });
    }
  }
  EXPECT_EQ(0, problems.Count()) << problems.Text();
  EXPECT_TRUE(mHost->Running());
}

} // namespace
} // namespace zark::load
