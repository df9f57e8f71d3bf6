// Shared pieces of the fault tests: the fixture (the test network around
// the process, empty fixed folders, the shipped router database), rule sets
// and the router mappings they ask for, what the router holds as upnpc
// lists it, the saved rule configuration read back, whether a lock file is
// free, and bounded waits on the module's status methods.
#ifndef ZARK_TESTS_FAULTS_FAULT_SUPPORT_H
#define ZARK_TESTS_FAULTS_FAULT_SUPPORT_H

#include "module_invoke.h"
#include "test_network.h"

#include <json/json.h>

#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <optional>
#include <set>
#include <string>
#include <tuple>

namespace zark::faults {

inline constexpr char kApiPortForwarding[] = "ZARK.Core.PortForwarding";
inline constexpr char kApiCompatibility[] =
    "ZARK.Core.PortForwarding.Compatibility";
// The code the module answers for a failure without a code of its own
// (among them every router and file failure of a save).
inline constexpr int kModuleDefaultError = 1500;

// One router mapping: protocol ("TCP" / "UDP"), router port, local port.
using Mapping = std::tuple<std::string, int, int>;
using Mappings = std::set<Mapping>;

// A rule as the module's Rules save takes it (enabled).
Json::Value Rule(const std::string &id, const std::string &protocol,
                 const std::string &routerPort, const std::string &dsPort);

// count rules "<idPrefix><i>", each mapping router port firstPort + i of
// protocol ("tcp" or "udp") to the same local port.
Json::Value PortRules(const std::string &idPrefix, const std::string &protocol,
                      int count, int firstPort);

// The two arrays one after the other.
Json::Value Joined(const Json::Value &first, const Json::Value &second);

// The mappings a rule set asks of the router: every enabled rule's
// protocol ("tcp", "udp" or "both") and ports ("a", "a-b", lists with ",";
// an empty router port text means the local ports). Adds a test failure
// for a text it does not read.
Mappings MappingsOf(const Json::Value &rules);

// The rule configuration at path as an array of rules in the shape of the
// module's Rules load; nothing, with why set, when the file is missing,
// cannot be read or does not parse.
std::optional<Json::Value> ReadRuleConf(const std::string &path,
                                        std::string &why);

// True when no process holds a flock on path: a new descriptor of it gets
// LOCK_EX | LOCK_NB at once (and lets go again). False, with why set, when
// it is held or cannot be opened.
bool LockFree(const std::string &path, std::string &why);

// Appends seen to history unless it repeats the last entry: a record of
// what a poll saw, short enough for a failure message.
void Note(Json::Value &history, const Json::Value &seen);

// Calls done every step until it returns true or timeout has passed; true
// when it did.
bool WaitUntil(const std::function<bool()> &done,
               std::chrono::milliseconds timeout,
               std::chrono::milliseconds step = std::chrono::milliseconds(5));

// Polls a status method of the module with {"task_id": taskId} until
// finished(answer) says the task has ended or timeout has passed; the first
// poll waits until the task has reported its first status. Every answer
// goes to history. ended tells which it was.
zark::integration::Answer PollStatus(
    const std::string &api, const std::string &method,
    const std::string &taskId,
    const std::function<bool(const zark::integration::Answer &)> &finished,
    std::chrono::milliseconds timeout, Json::Value &history, bool &ended);

// The fixture of every fault test: the process runs in the server
// namespace of a test network of its own and in its private mount
// namespace; every test starts with empty fixed folders and the shipped
// router database. TearDown thaws the router's daemon and restores its LAN
// link when a test left them broken, then joins every module task.
class FaultTest : public testing::Test {
protected:
  void SetUp() override;
  void TearDown() override;

  // Stores a UPnP IGD router configuration for the network's gateway.
  void ConfigureUpnpRouter();

  // The router's mappings as upnpc lists them; each must go to this
  // server, and none may be listed twice.
  Mappings RouterMappings();

  // Rules save through the module; returns the task id (empty, with a test
  // failure, when the save did not start).
  std::string StartSave(const Json::Value &rules);
  // Follows save_status of taskId until it ends (success or an error),
  // at most timeout; the last answer. history gets every answer.
  zark::integration::Answer FinishSave(const std::string &taskId,
                                       std::chrono::milliseconds timeout,
                                       Json::Value &history);
  // Both, and joins the task: true when the save succeeded.
  bool Save(const Json::Value &rules, Json::Value &history);

  // Faults on the router, remembered so that TearDown can undo them.
  void FreezeRouter();
  void ThawRouter();
  void KillRouter();
  void RestartRouter(bool keepLeases);
  void CutLan();
  void RestoreLan();

  zark::testnet::TestNetwork mNet;
  bool mFrozen = false;
  bool mLanCut = false;
};

} // namespace zark::faults

#endif
