#include "fault_support.h"

#include "RouterRuleConf.h"
#include "db_test_support.h"
#include "hermetic.h"
#include "libzarkportmap.h"
#include "syslog_capture.h"
#include "webapi.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <sstream>
#include <thread>
#include <vector>

namespace zark::faults {

using zark::integration::Answer;
using zark::integration::Invoke;

Json::Value Rule(const std::string &id, const std::string &protocol,
                 const std::string &routerPort, const std::string &dsPort) {
  Json::Value rule(Json::objectValue);
  rule["rule_id"] = id;
  rule["enable"] = true;
  rule["router_protocol"] = protocol;
  rule["router_port"] = routerPort;
  rule["ds_port"] = dsPort;
  rule["serviceid"] = "";
  rule["service_name"] = "";
  return rule;
}

Json::Value PortRules(const std::string &idPrefix, const std::string &protocol,
                      int count, int firstPort) {
  Json::Value rules(Json::arrayValue);
  for (int i = 0; i < count; ++i) {
    const std::string port = std::to_string(firstPort + i);
    rules.append(Rule(idPrefix + std::to_string(i), protocol, port, port));
  }
  return rules;
}

Json::Value Joined(const Json::Value &first, const Json::Value &second) {
  Json::Value joined = first;
  for (const Json::Value &rule : second) {
    joined.append(rule);
  }
  return joined;
}

namespace {

// "8080", "20000-20039", "80,443": the ports in order.
std::vector<int> Ports(const std::string &text) {
  std::vector<int> ports;
  std::stringstream items(text);
  std::string item;
  while (std::getline(items, item, ',')) {
    std::size_t dash = item.find('-');
    int first = std::stoi(item.substr(0, dash));
    int last =
        dash == std::string::npos ? first : std::stoi(item.substr(dash + 1));
    for (int port = first; port <= last; ++port) {
      ports.push_back(port);
    }
  }
  return ports;
}

} // namespace

Mappings MappingsOf(const Json::Value &rules) {
  Mappings mappings;
  for (const Json::Value &rule : rules) {
    if (!rule["enable"].asBool()) {
      continue;
    }
    std::string routerText = rule["router_port"].asString();
    std::string localText = rule["ds_port"].asString();
    if (routerText.empty()) {
      routerText = localText;
    }
    if (localText.empty()) {
      localText = routerText;
    }
    const std::vector<int> routerPorts = Ports(routerText);
    const std::vector<int> localPorts = Ports(localText);
    if (routerPorts.size() != localPorts.size()) {
      ADD_FAILURE() << "rule " << rule.toStyledString()
                    << " pairs ports of different counts";
      continue;
    }
    const std::string protocol = rule["router_protocol"].asString();
    std::vector<std::string> protocols;
    if (protocol == "tcp" || protocol == "both") {
      protocols.push_back("TCP");
    }
    if (protocol == "udp" || protocol == "both") {
      protocols.push_back("UDP");
    }
    if (protocols.empty()) {
      ADD_FAILURE() << "rule protocol \"" << protocol << "\" is not read here";
    }
    for (const std::string &name : protocols) {
      for (std::size_t i = 0; i < routerPorts.size(); ++i) {
        mappings.insert({name, routerPorts[i], localPorts[i]});
      }
    }
  }
  return mappings;
}

std::optional<Json::Value> ReadRuleConf(const std::string &path,
                                        std::string &why) {
  struct stat info {};
  if (::stat(path.c_str(), &info) != 0) {
    why = path + " does not exist: " + std::strerror(errno);
    return std::nullopt;
  }
  RouterRuleConfReader reader(path);
  if (!reader.IsValid()) {
    why = path + " does not parse (" + std::to_string(info.st_size) +
          " bytes): " + zark::test::ReadFile(path);
    return std::nullopt;
  }
  Json::Value rules(Json::arrayValue);
  for (const RouterRule &stored : reader.Rules()) {
    Json::Value rule(Json::objectValue);
    rule["rule_id"] = stored.ruleId;
    rule["enable"] = stored.enable;
    rule["router_protocol"] = stored.protocol;
    rule["router_port"] = stored.routerPort;
    rule["ds_port"] = stored.dsPort;
    rule["serviceid"] = stored.serviceId;
    rule["service_name"] = stored.serviceName;
    rules.append(rule);
  }
  return rules;
}

bool LockFree(const std::string &path, std::string &why) {
  int fd = ::open(path.c_str(), O_RDWR | O_CLOEXEC | O_NOFOLLOW);
  if (fd < 0) {
    if (errno == ENOENT) {
      return true; // nobody can hold a lock on a file that is not there
    }
    why = "open " + path + ": " + std::strerror(errno);
    return false;
  }
  bool free = ::flock(fd, LOCK_EX | LOCK_NB) == 0;
  if (!free) {
    why = path + " is locked: " + std::strerror(errno);
  } else {
    ::flock(fd, LOCK_UN);
  }
  ::close(fd);
  return free;
}

void Note(Json::Value &history, const Json::Value &seen) {
  if (history.empty() || history[history.size() - 1] != seen) {
    history.append(seen);
  }
}

bool WaitUntil(const std::function<bool()> &done,
               std::chrono::milliseconds timeout,
               std::chrono::milliseconds step) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    if (done()) {
      return true;
    }
    if (std::chrono::steady_clock::now() >= deadline) {
      return false;
    }
    std::this_thread::sleep_for(step);
  }
}

Answer PollStatus(const std::string &api, const std::string &method,
                  const std::string &taskId,
                  const std::function<bool(const Answer &)> &finished,
                  std::chrono::milliseconds timeout, Json::Value &history,
                  bool &ended) {
  Json::Value params(Json::objectValue);
  params["task_id"] = taskId;
  Answer answer;
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  // A status method polled before its task reported anything answers an
  // error, as it would to a browser polling that early: wait for the
  // task's first report in the framework's record first.
  ended = WaitUntil(
      [&] {
        ZARK::APIPolling polling;
        Json::Value record;
        return polling.Status(taskId, record) && record["data"].isObject() &&
               record["data"].isMember("status");
      },
      timeout, std::chrono::milliseconds(1));
  if (!ended) {
    history.append("the task reported nothing");
    return answer;
  }
  const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
      deadline - std::chrono::steady_clock::now());
  ended = WaitUntil(
      [&] {
        answer = Invoke(api, method, params);
        Json::Value seen(Json::objectValue);
        seen["success"] = answer.success;
        seen["data"] = answer.data;
        seen["code"] = answer.errorCode;
        Note(history, seen);
        return finished(answer);
      },
      std::max(left, std::chrono::milliseconds(0)),
      std::chrono::milliseconds(2));
  return answer;
}

void FaultTest::SetUp() {
  std::optional<zark::testnet::TestNetwork> network =
      zark::testnet::CurrentNetwork();
  ASSERT_TRUE(network.has_value())
      << "run through testnet/run-in-testnet.sh (as CTest does)";
  mNet = *network;
  ASSERT_FALSE(mNet.script.empty())
      << "testnet.sh did not say how to reach its router commands";
  zark::test::ResetFixedPaths();
  zark::test::InstallShippedRouterDb();
  zark::test::ClearLogs();
}

void FaultTest::TearDown() {
  std::string why;
  if (mFrozen) {
    EXPECT_TRUE(zark::testnet::PauseRouterDaemon(mNet, false, &why)) << why;
  }
  if (mLanCut) {
    EXPECT_TRUE(zark::testnet::RestoreRouterLan(mNet, &why)) << why;
  }
  ZARK::APIPolling::JoinAll();
}

void FaultTest::ConfigureUpnpRouter() {
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

Mappings FaultTest::RouterMappings() {
  std::vector<zark::testnet::UpnpMapping> listed;
  std::string raw;
  EXPECT_TRUE(zark::testnet::ListUpnpMappings(mNet, listed, &raw)) << raw;
  Mappings held;
  for (const zark::testnet::UpnpMapping &mapping : listed) {
    EXPECT_EQ(mNet.lanServer, mapping.internalAddress) << raw;
    held.insert({mapping.protocol, mapping.externalPort, mapping.internalPort});
  }
  EXPECT_EQ(listed.size(), held.size()) << raw;
  return held;
}

std::string FaultTest::StartSave(const Json::Value &rules) {
  Json::Value params(Json::objectValue);
  params["rules"] = rules;
  Answer started = Invoke(zark::integration::kApiRules, "save", params);
  EXPECT_TRUE(started.success) << started.errorCode;
  const std::string taskId = started.data["task_id"].asString();
  EXPECT_FALSE(taskId.empty());
  return taskId;
}

Answer FaultTest::FinishSave(const std::string &taskId,
                             std::chrono::milliseconds timeout,
                             Json::Value &history) {
  return zark::integration::PollUntilFinished(
      zark::integration::kApiRules, "save_status", taskId, timeout, history);
}

bool FaultTest::Save(const Json::Value &rules, Json::Value &history) {
  const std::string taskId = StartSave(rules);
  if (taskId.empty()) {
    return false;
  }
  Answer last = FinishSave(taskId, std::chrono::seconds(60), history);
  ZARK::APIPolling::JoinAll();
  return last.success;
}

void FaultTest::FreezeRouter() {
  std::string why;
  ASSERT_TRUE(zark::testnet::PauseRouterDaemon(mNet, true, &why)) << why;
  mFrozen = true;
}

void FaultTest::ThawRouter() {
  std::string why;
  ASSERT_TRUE(zark::testnet::PauseRouterDaemon(mNet, false, &why)) << why;
  mFrozen = false;
}

void FaultTest::KillRouter() {
  std::string why;
  ASSERT_TRUE(zark::testnet::StopRouterDaemon(mNet, true, &why)) << why;
  // A killed daemon is no longer frozen.
  mFrozen = false;
}

void FaultTest::RestartRouter(bool keepLeases) {
  std::string why;
  ASSERT_TRUE(zark::testnet::StartRouterDaemon(mNet, keepLeases, &why)) << why;
}

void FaultTest::CutLan() {
  std::string why;
  ASSERT_TRUE(zark::testnet::CutRouterLan(mNet, &why)) << why;
  mLanCut = true;
}

void FaultTest::RestoreLan() {
  std::string why;
  ASSERT_TRUE(zark::testnet::RestoreRouterLan(mNet, &why)) << why;
  mLanCut = false;
}

} // namespace zark::faults
