#include "compat/compatibility_test.h"

#include "base/conf_file.h"
#include "base/library_config.h"
#include "base/local_network.h"
#include "base/portmap_log.h"
#include "base/record_text.h"
#include "base/strict_json.h"
#include "catalog/router_conf_store.h"
#include "compat/compatibility_report.h"
#include "klibc.h"
#include "reach/token_listener.h"

#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <exception>
#include <set>
#include <thread>

namespace zark::portmap {
namespace {

using Clock = std::chrono::steady_clock;
namespace key = upnp_test_key;
namespace value = upnp_test_value;

constexpr int kRunVersion = 1;
// Ports tried for the listener of the outside checks before giving up.
constexpr int kListenerTries = 16;
// Spare ports beyond the asked number, for ports found taken on the way.
constexpr int kSparePorts = 32;

std::string TcpPort(uint16_t port) {
  return "tcp " + std::to_string(port);
}

PortMapping TestMapping(uint16_t port, const std::string &client) {
  return {IpProtocol::kTcp, port, port, client, kUpnpTestDescription};
}

// True when the router's entry is one of this test's: our description,
// our address, the same port inside.
bool IsOurs(const RouterMapping &entry, uint16_t port,
            const std::string &client) {
  return entry.description == kUpnpTestDescription &&
         entry.internalClient == client && entry.internalPort == port;
}

// Holds the system-wide port-map lock (KLibZarkPortMapLock) for its life.
class PortMapLockGuard {
public:
  PortMapLockGuard() : mHeld(KLibZarkPortMapLock() == 0) {}
  PortMapLockGuard(const PortMapLockGuard &) = delete;
  PortMapLockGuard &operator=(const PortMapLockGuard &) = delete;
  ~PortMapLockGuard() {
    if (mHeld) {
      (void)KLibZarkPortMapUnLock();
    }
  }
  [[nodiscard]] bool Held() const { return mHeld; }

private:
  bool mHeld;
};

bool ReadStopRequest(const std::string &path, const std::string &runId) {
  ReadResult read = ReadSmallFile(path, 256);
  if (read.status != ReadStatus::kRead) {
    return false;
  }
  std::string text = read.content;
  while (!text.empty() && (text.back() == '\n' || text.back() == ' ')) {
    text.pop_back();
  }
  return text == "*" || text == runId;
}

void RemoveFile(const std::string &path) {
  if (::unlink(path.c_str()) != 0 && errno != ENOENT) {
    int saved = errno;
    ZARK_PM_LOG_CALL("unlink", -1, saved, path.c_str());
  }
}

bool SaveRun(const std::string &path, const UpnpTestRun &run) {
  return ReplaceFileAtomically(path, SerializeUpnpTestRun(run), 0600);
}

// The progress file, or nothing when the test runs without one.
class Progress {
public:
  Progress(std::string path, bool write)
      : mPath(std::move(path)), mWrite(write) {}

  // A fresh file holding only "upnp_init=processing".
  [[nodiscard]] bool Start() {
    if (!mWrite) {
      return true;
    }
    return ReplaceFileAtomically(
        mPath, std::string(key::kInit) + "=" + value::kProcessing + "\n", 0644);
  }

  void Set(const char *name, const std::string &text) {
    if (!mWrite) {
      return;
    }
    if (KLIBCFileSetKeyValue(mPath.c_str(), name, text.c_str(), 0) < 0) {
      ZARK_PM_LOG_ERROR("cannot set %s=%s in %s [0x%04X %s:%d]", name,
                        text.c_str(), mPath.c_str(), KLIBCErrGet(),
                        KLIBCErrorGetFile(), KLIBCErrorGetLine());
    }
  }

private:
  std::string mPath;
  bool mWrite;
};

// One run of the test.
class CompatibilityTest {
public:
  CompatibilityTest(int maxMappings, const UpnpTestEnvironment &environment,
                    ZARK_ROUTER_TEST_COMPATIBILITY_RESULT &result,
                    ZARK_TEST_COMPATIBILITY_PROGRESS_CB callback, void *arg)
      : mMax(maxMappings), mEnv(environment), mResult(result),
        mCallback(callback), mArg(arg),
        mProgress(environment.progressPath, environment.writeProgress),
        mStart(Clock::now()) {}

  int Run();

private:
  // The stages; false when the test ends there (mError set).
  bool Init();
  bool AddFirst();
  bool Fill();
  bool DeleteAll();
  bool ConnectionClosed();
  bool Readd();
  bool ConnectionOpen();
  void CleanUp();

  // The steps of Init; false when the test ends there (mError set).
  bool ChooseUpnpRouter();
  bool MakeProbeAndFindClient();
  // The TCP ports the user's rules hold on this router, into taken, and
  // where the router was found before, into memo.
  void ReadMappingState(std::set<uint16_t> &taken, RouterRecord &memo);
  bool OpenRouter(RouterRecord &memo);
  // The TCP ports the router already maps, into taken.
  void ReadRouterTable(std::set<uint16_t> &taken);
  // The ports from mEnv.firstPort on that are not taken, as many as the
  // test may need.
  [[nodiscard]] std::vector<uint16_t>
  FreePorts(const std::set<uint16_t> &taken) const;
  // The connection-check port and the fill candidates after it.
  bool ChooseTestPorts(const std::vector<uint16_t> &free);
  // The steps of Fill: adds the candidates until the router's table is
  // full or mMax is reached, then reads every confirmed one back; false
  // when the test ends there (mError set).
  bool AddUntilFull();
  bool CheckAddedStillHeld();
  // The steps of Run. MappingCountValid and StartFiles set mResult.error
  // when they return false; RunStages is true when every stage passed;
  // Finish cleans up and writes the report; Conclude fills mResult.
  bool MappingCountValid();
  bool StartFiles();
  bool RunStages();
  void Finish();
  int Conclude(bool passed);

  // Ends the test at stage key (marked failedText) with error and reason.
  bool Fail(const char *stage, const std::string &failedText, int error,
            const std::string &reason);
  // True when the test must stop now (asked to, or out of time); the stage
  // is then failed with ZARK_UPNP_TEST_ERR_STOPPED.
  bool MustStop(const char *stage, const std::string &failedText);
  [[nodiscard]] bool StopAsked() const;
  void Report(int percentage);
  void Note(const std::string &line);
  [[nodiscard]] bool SaveRunFile();
  [[nodiscard]] ProbeAnswer Probe();
  void WriteReport();

  int mMax;
  const UpnpTestEnvironment &mEnv;
  ZARK_ROUTER_TEST_COMPATIBILITY_RESULT &mResult;
  ZARK_TEST_COMPATIBILITY_PROGRESS_CB mCallback;
  void *mArg;
  Progress mProgress;
  Clock::time_point mStart;

  const char *mStage = key::kInit; // the stage under way
  int mError = ZARK_PORTMAP_ERR_NONE;
  std::string mReason;
  std::vector<std::string> mLog;
  std::size_t mLogDropped = 0;

  UpnpTestRun mRun;
  std::string mGateway;
  std::string mClient;
  ZARK_ROUTER_CONF mConf{};
  bool mHaveConf = false;
  std::unique_ptr<RouterDriver> mRouter;
  std::unique_ptr<OutsideProbe> mProbe;
  TokenListener mListener;
  uint16_t mConnectionPort = 0;
  std::vector<uint16_t> mCandidates; // fill ports after the first
  std::vector<uint16_t> mAdded;      // confirmed held, not yet deleted
  std::vector<uint16_t> mUncertain;  // the router's answer left it open
  int mReached = 0;
};

void CompatibilityTest::Note(const std::string &line) {
  syslog(LOG_INFO, "%s:%d UPnP compatibility test: %s", __FILE__, __LINE__,
         line.c_str());
  std::time_t now = std::time(nullptr);
  std::tm local{};
  gmtime_r(&now, &local);
  char stamp[16] = {};
  std::strftime(stamp, sizeof(stamp), "%H:%M:%S", &local);
  // The first lines and the last ones are the telling ones.
  if (mLog.size() >= kMaxReportLogLines) {
    mLog.erase(mLog.begin() + kMaxReportLogLines / 2);
    ++mLogDropped;
  }
  mLog.push_back(std::string(stamp) + " " + line);
}

void CompatibilityTest::Report(int percentage) {
  mResult.progress = percentage;
  if (mCallback != nullptr) {
    mCallback(&mResult, mArg);
  }
}

bool CompatibilityTest::Fail(const char *stage, const std::string &failedText,
                             int error, const std::string &reason) {
  if (mError == ZARK_PORTMAP_ERR_NONE) {
    mError = error;
    mReason = reason;
  }
  ZARK_PM_LOG_ERROR("UPnP compatibility test failed at %s: %s", stage,
                    reason.c_str());
  Note(std::string(stage) + " failed: " + reason);
  mProgress.Set(stage, failedText);
  // A reader looks at upnp_add before upnp_init.
  if (std::strcmp(stage, key::kInit) == 0) {
    mProgress.Set(key::kAdd, value::kFailed);
  }
  return false;
}

bool CompatibilityTest::StopAsked() const {
  return ReadStopRequest(mEnv.stopPath, mRun.runId) ||
         Clock::now() - mStart >= mEnv.deadline;
}

bool CompatibilityTest::MustStop(const char *stage,
                                 const std::string &failedText) {
  if (ReadStopRequest(mEnv.stopPath, mRun.runId)) {
    Fail(stage, failedText, ZARK_UPNP_TEST_ERR_STOPPED, "stopped on request");
    return true;
  }
  if (Clock::now() - mStart >= mEnv.deadline) {
    Fail(stage, failedText, ZARK_UPNP_TEST_ERR_STOPPED,
         "out of time after " + std::to_string(mEnv.deadline.count()) + " s");
    return true;
  }
  return false;
}

bool CompatibilityTest::SaveRunFile() {
  if (!SaveRun(mEnv.runPath, mRun)) {
    ZARK_PM_LOG_ERROR("cannot write %s", mEnv.runPath.c_str());
    return false;
  }
  return true;
}

ProbeAnswer CompatibilityTest::Probe() {
  return mProbe->Check(IpProtocol::kTcp, mConnectionPort, mListener.Token());
}

bool CompatibilityTest::ChooseUpnpRouter() {
  std::optional<std::string> gateway = mEnv.gateway();
  if (!gateway) {
    return Fail(key::kInit, value::kFailed, ZARK_UPNP_TEST_ERR_INIT,
                "no default gateway");
  }
  mGateway = *gateway;
  mRun.gateway = mGateway;
  RouterChoice choice;
  int err = ZARK_PORTMAP_ERR_NONE;
  if (!mEnv.chooseRouter(mGateway, choice, err)) {
    if (err == ZARK_PORTMAP_ERR_NOT_CONFIGURED) {
      return Fail(key::kInit, value::kFailed, ZARK_PORTMAP_ERR_NOT_CONFIGURED,
                  "no router the library can drive is configured for " +
                      mGateway);
    }
    return Fail(key::kInit, value::kFailed, ZARK_UPNP_TEST_ERR_INIT,
                "cannot read the router configuration of " + mGateway);
  }
  if (choice.protocol != RouterProtocol::kUpnp) {
    return Fail(key::kInit, value::kFailed, ZARK_PORTMAP_ERR_NOT_CONFIGURED,
                "the router configured for " + mGateway + " is driven by " +
                    std::string(RouterProtocolName(choice.protocol)) +
                    ", not UPnP");
  }
  mHaveConf = mEnv.routerConf && mEnv.routerConf(mGateway, mConf);
  return true;
}

bool CompatibilityTest::MakeProbeAndFindClient() {
  std::string why;
  mProbe = mEnv.makeProbe ? mEnv.makeProbe(why, [this] { return StopAsked(); })
                          : nullptr;
  if (mProbe == nullptr) {
    return Fail(key::kInit, value::kFailed, ZARK_UPNP_TEST_ERR_INIT,
                why.empty() ? kNoProbeServiceText : why);
  }
  std::optional<std::string> client = mEnv.localAddress(mGateway);
  if (!client) {
    return Fail(key::kInit, value::kFailed, ZARK_UPNP_TEST_ERR_INIT,
                "no route to the gateway " + mGateway);
  }
  mClient = *client;
  mRun.client = mClient;
  return true;
}

void CompatibilityTest::ReadMappingState(std::set<uint16_t> &taken,
                                         RouterRecord &memo) {
  MappingState state;
  if (!LoadMappingState(mEnv.mappingStatePath, state)) {
    return;
  }
  for (const RouterRecord &record : state.routers) {
    if (record.gateway != mGateway) {
      continue;
    }
    if (record.protocol == RouterProtocol::kUpnp) {
      memo.location = record.location;
    }
    for (const RecordedMapping &mapping : record.mappings) {
      if (mapping.protocol == IpProtocol::kTcp) {
        taken.insert(mapping.externalPort);
      }
    }
  }
}

bool CompatibilityTest::OpenRouter(RouterRecord &memo) {
  memo.finiteLeases = true;
  mRouter = mEnv.makeRouter(RouterProtocol::kUpnp, mGateway, &memo);
  if (mRouter == nullptr) {
    return Fail(key::kInit, value::kFailed, ZARK_UPNP_TEST_ERR_INIT,
                "no UPnP driver");
  }
  RouterResult opened = mRouter->Open();
  if (!opened.Ok()) {
    return Fail(key::kInit, value::kFailed, ZARK_UPNP_TEST_ERR_INIT,
                "the router's UPnP service cannot be used: " + opened.message);
  }
  mRun.location = mRouter->Location();
  Note("using the UPnP service at " + mRun.location + " for " + mClient);
  return true;
}

void CompatibilityTest::ReadRouterTable(std::set<uint16_t> &taken) {
  std::vector<RouterMapping> entries;
  RouterResult listed = mRouter->ListMappings(entries);
  if (listed.Ok()) {
    for (const RouterMapping &entry : entries) {
      if (entry.protocol == IpProtocol::kTcp) {
        taken.insert(entry.externalPort);
      }
    }
    Note("the router lists " + std::to_string(entries.size()) +
         " mapping(s) before the test");
  } else {
    Note("the router's table cannot be listed (" + listed.message +
         "); ports found taken are skipped on the way");
  }
}

std::vector<uint16_t>
CompatibilityTest::FreePorts(const std::set<uint16_t> &taken) const {
  std::vector<uint16_t> free;
  const std::size_t wanted =
      static_cast<std::size_t>(mMax) + kSparePorts + kListenerTries;
  for (uint32_t port = mEnv.firstPort; port <= 65535 && free.size() < wanted;
       ++port) {
    if (taken.count(static_cast<uint16_t>(port)) == 0) {
      free.push_back(static_cast<uint16_t>(port));
    }
  }
  return free;
}

bool CompatibilityTest::ChooseTestPorts(const std::vector<uint16_t> &free) {
  // The connection-check port: the first free one this server can listen
  // on.
  std::size_t first = 0;
  for (; first < free.size() && first < kListenerTries; ++first) {
    const std::string token = NewProbeToken();
    if (token.empty()) {
      break;
    }
    if (mListener.Open(IpProtocol::kTcp, free[first], token) ==
        TokenListener::OpenResult::kOpen) {
      mConnectionPort = free[first];
      break;
    }
  }
  if (mConnectionPort == 0) {
    return Fail(key::kInit, value::kFailed, ZARK_UPNP_TEST_ERR_INIT,
                "no local port from " + std::to_string(mEnv.firstPort) +
                    " on to listen on for the outside checks");
  }
  mCandidates.assign(free.begin() + static_cast<std::ptrdiff_t>(first) + 1,
                     free.end());
  return true;
}

bool CompatibilityTest::Init() {
  if (!ChooseUpnpRouter() || !MakeProbeAndFindClient()) {
    return false;
  }
  // Ports the user's rules hold on this router are never touched.
  std::set<uint16_t> taken;
  // Where the router was found before, and finite leases: should the
  // test's own cleanup and every later one fail, its mappings still run
  // out within the hour (a router that takes only permanent ones gets
  // those, after its 725).
  RouterRecord memo;
  memo.gateway = mGateway;
  memo.protocol = RouterProtocol::kUpnp;
  ReadMappingState(taken, memo);
  if (MustStop(key::kInit, value::kFailed)) {
    return false;
  }
  if (!OpenRouter(memo)) {
    return false;
  }
  // And neither are the ports the router already maps for anyone.
  ReadRouterTable(taken);
  if (!ChooseTestPorts(FreePorts(taken))) {
    return false;
  }
  // Everything the test may map is listed before the first request, so
  // that a killed test can be cleaned up after.
  mRun.ports.push_back(mConnectionPort);
  mRun.ports.insert(mRun.ports.end(), mCandidates.begin(), mCandidates.end());
  if (!SaveRunFile()) {
    return Fail(key::kInit, value::kFailed, ZARK_PORTMAP_ERR_GENERIC,
                "cannot write " + mEnv.runPath);
  }
  mProgress.Set(key::kInit, value::kSuccess);
  Report(10);
  return true;
}

bool CompatibilityTest::AddFirst() {
  mStage = key::kAdd;
  mProgress.Set(key::kAdd, value::kProcessing);
  if (MustStop(key::kAdd, value::kFailed)) {
    return false;
  }
  RouterResult added =
      mRouter->AddPortMapping(TestMapping(mConnectionPort, mClient));
  if (!added.Ok()) {
    if (added.outcome != RouterOutcome::kConflict &&
        added.outcome != RouterOutcome::kRefused) {
      mUncertain.push_back(mConnectionPort);
    }
    return Fail(key::kAdd, value::kFailed, ZARK_UPNP_TEST_ERR_ADD,
                "adding " + TcpPort(mConnectionPort) + ": " + added.message);
  }
  mAdded.push_back(mConnectionPort);
  mReached = 1;
  Note("added " + TcpPort(mConnectionPort) + " (lease " +
       std::to_string(added.leaseSeconds) + ")");
  mProgress.Set(key::kAdd, value::kFinished);
  mProgress.Set(key::kMax, "1");
  Report(20);
  return true;
}

bool CompatibilityTest::AddUntilFull() {
  int conflicts = 0;
  std::string limit;
  for (uint16_t port : mCandidates) {
    if (mReached >= mMax) {
      break;
    }
    if (MustStop(key::kMax, "-1")) {
      return false;
    }
    RouterResult added = mRouter->AddPortMapping(TestMapping(port, mClient));
    switch (added.outcome) {
    case RouterOutcome::kOk:
      conflicts = 0;
      mAdded.push_back(port);
      ++mReached;
      mProgress.Set(key::kMax, std::to_string(mReached));
      Report(20 + 30 * mReached / mMax);
      continue;
    case RouterOutcome::kConflict:
      // Someone else's port, or a full table answered with 718.
      if (++conflicts < mEnv.conflictsInARow) {
        Note(TcpPort(port) + " is taken on the router; trying the next port");
        continue;
      }
      limit = std::to_string(conflicts) + " ports in a row answered as taken";
      break;
    case RouterOutcome::kNotHeld:
      mUncertain.push_back(port);
      limit = added.message;
      break;
    case RouterOutcome::kRefused:
    case RouterOutcome::kNotFound:
    case RouterOutcome::kUnsupported:
      limit = added.message;
      break;
    case RouterOutcome::kBadReply:
    case RouterOutcome::kNoAnswer:
    case RouterOutcome::kNoRouter:
    case RouterOutcome::kFailed:
      mUncertain.push_back(port);
      return Fail(key::kMax, "-1", ZARK_UPNP_TEST_ERR_FILL,
                  "the router stopped working after " +
                      std::to_string(mReached) + " mappings: " + added.message);
    }
    break;
  }
  if (!limit.empty()) {
    Note("the router's table took " + std::to_string(mReached) +
         " mapping(s); the next one: " + limit);
  } else if (mReached < mMax) {
    Note("no more free ports to map after " + std::to_string(mReached));
  }
  return true;
}

bool CompatibilityTest::CheckAddedStillHeld() {
  int dropped = 0;
  for (uint16_t port : mAdded) {
    if (MustStop(key::kMax, "-1")) {
      return false;
    }
    RouterMapping entry;
    RouterResult held =
        mRouter->GetSpecificPortMapping(IpProtocol::kTcp, port, entry);
    if (held.outcome == RouterOutcome::kNotFound ||
        (held.Ok() && !IsOurs(entry, port, mClient))) {
      ++dropped;
    } else if (!held.Ok()) {
      return Fail(key::kMax, "-1", ZARK_UPNP_TEST_ERR_FILL,
                  "reading back " + TcpPort(port) + ": " + held.message);
    }
  }
  if (dropped > 0) {
    return Fail(key::kMax, "-1", ZARK_UPNP_TEST_ERR_FILL,
                "the router dropped " + std::to_string(dropped) + " of the " +
                    std::to_string(mAdded.size()) +
                    " mappings it had confirmed");
  }
  return true;
}

bool CompatibilityTest::Fill() {
  mStage = key::kMax;
  if (!AddUntilFull()) {
    return false;
  }
  // Does the router still hold every mapping it confirmed?
  if (!CheckAddedStillHeld()) {
    return false;
  }
  mProgress.Set(key::kMax, std::to_string(mReached));
  Note("the router holds all " + std::to_string(mReached) + " mapping(s)");
  Report(50);
  return true;
}

bool CompatibilityTest::DeleteAll() {
  mStage = key::kDelete;
  mProgress.Set(key::kDelete, value::kProcessing);
  while (!mAdded.empty()) {
    if (MustStop(key::kDelete, value::kFailed)) {
      return false;
    }
    const uint16_t port = mAdded.back();
    RouterResult deleted =
        mRouter->DeletePortMapping(TestMapping(port, mClient));
    if (!deleted.Ok() && deleted.outcome != RouterOutcome::kNotFound) {
      return Fail(key::kDelete, value::kFailed, ZARK_UPNP_TEST_ERR_DELETE,
                  "deleting " + TcpPort(port) + ": " + deleted.message);
    }
    mAdded.pop_back();
    RouterMapping entry;
    RouterResult gone =
        mRouter->GetSpecificPortMapping(IpProtocol::kTcp, port, entry);
    if (gone.Ok()) {
      if (IsOurs(entry, port, mClient)) {
        mAdded.push_back(port);
      }
      return Fail(key::kDelete, value::kFailed, ZARK_UPNP_TEST_ERR_DELETE,
                  "the router still holds " + TcpPort(port) +
                      " after deleting it");
    }
    if (gone.outcome != RouterOutcome::kNotFound) {
      return Fail(key::kDelete, value::kFailed, ZARK_UPNP_TEST_ERR_DELETE,
                  "reading back " + TcpPort(port) + ": " + gone.message);
    }
  }
  Note("deleted all " + std::to_string(mReached) + " mapping(s)");
  mProgress.Set(key::kDelete, value::kFinished);
  Report(60);
  return true;
}

bool CompatibilityTest::ConnectionClosed() {
  mStage = key::kConnectionFailed;
  mProgress.Set(key::kConnectionFailed, value::kProcessing);
  if (MustStop(key::kConnectionFailed, value::kFailed)) {
    return false;
  }
  ProbeAnswer answer = Probe();
  switch (answer.status) {
  case ProbeStatus::kUnreachable:
    Note(TcpPort(mConnectionPort) + " is closed from outside (" +
         answer.reason + ")");
    mProgress.Set(key::kConnectionFailed, value::kSuccess);
    Report(70);
    return true;
  case ProbeStatus::kReachable:
    return Fail(key::kConnectionFailed, value::kFailed,
                ZARK_UPNP_TEST_ERR_STILL_OPEN,
                "the deleted mapping " + TcpPort(mConnectionPort) +
                    " still answers from outside");
  case ProbeStatus::kCancelled:
    MustStop(key::kConnectionFailed, value::kFailed);
    return false;
  default:
    return Fail(
        key::kConnectionFailed, value::kFailed, ZARK_UPNP_TEST_ERR_STILL_OPEN,
        std::string("the probe service gave no verdict: ") +
            ProbeStatusName(answer.status) + " (" + answer.reason + ")");
  }
}

bool CompatibilityTest::Readd() {
  mStage = key::kReadd1;
  mProgress.Set(key::kReadd1, value::kProcessing);
  if (MustStop(key::kReadd1, value::kFailed)) {
    return false;
  }
  const PortMapping mapping = TestMapping(mConnectionPort, mClient);
  RouterResult added = mRouter->AddPortMapping(mapping);
  if (!added.Ok()) {
    if (added.outcome != RouterOutcome::kConflict &&
        added.outcome != RouterOutcome::kRefused) {
      mUncertain.push_back(mConnectionPort);
    }
    return Fail(key::kReadd1, value::kFailed, ZARK_UPNP_TEST_ERR_READD,
                "adding " + TcpPort(mConnectionPort) +
                    " again: " + added.message);
  }
  mAdded.push_back(mConnectionPort);
  mProgress.Set(key::kReadd1, value::kSuccess);
  mStage = key::kReadd2;
  mProgress.Set(key::kReadd2, value::kProcessing);
  if (MustStop(key::kReadd2, value::kFailed)) {
    return false;
  }
  RouterResult renewed = mRouter->AddPortMapping(mapping);
  if (!renewed.Ok()) {
    return Fail(key::kReadd2, value::kFailed, ZARK_UPNP_TEST_ERR_READD,
                "adding " + TcpPort(mConnectionPort) +
                    " over itself: " + renewed.message);
  }
  Note("added " + TcpPort(mConnectionPort) + " again, and over itself");
  mProgress.Set(key::kReadd2, value::kFinished);
  Report(80);
  return true;
}

bool CompatibilityTest::ConnectionOpen() {
  mStage = key::kConnectionSuccess;
  mProgress.Set(key::kConnectionSuccess, value::kProcessing);
  if (MustStop(key::kConnectionSuccess, value::kFailed)) {
    return false;
  }
  ProbeAnswer answer = Probe();
  switch (answer.status) {
  case ProbeStatus::kReachable:
    Note(TcpPort(mConnectionPort) + " answers from outside");
    mProgress.Set(key::kConnectionSuccess, value::kSuccess);
    Report(90);
    return true;
  case ProbeStatus::kUnreachable:
    return Fail(key::kConnectionSuccess, value::kFailed,
                ZARK_UPNP_TEST_ERR_NOT_OPEN,
                "the re-added mapping " + TcpPort(mConnectionPort) +
                    " does not answer from outside (" + answer.reason + ")");
  case ProbeStatus::kCancelled:
    MustStop(key::kConnectionSuccess, value::kFailed);
    return false;
  default:
    return Fail(
        key::kConnectionSuccess, value::kFailed, ZARK_UPNP_TEST_ERR_NOT_OPEN,
        std::string("the probe service gave no verdict: ") +
            ProbeStatusName(answer.status) + " (" + answer.reason + ")");
  }
}

void CompatibilityTest::CleanUp() {
  if (mRouter == nullptr) {
    return;
  }
  // Whatever happened: nothing of ours stays on the router. Bounded: one
  // delete per mapping, and a router that stops answering ends it (what
  // is left stays in the run file for the next test or a stop).
  std::vector<uint16_t> left;
  bool routerGone = false;
  auto remove = [&](uint16_t port, bool mustCheck) {
    if (routerGone) {
      left.push_back(port);
      return;
    }
    if (mustCheck) {
      RouterMapping entry;
      RouterResult held =
          mRouter->GetSpecificPortMapping(IpProtocol::kTcp, port, entry);
      if (held.outcome == RouterOutcome::kNotFound ||
          (held.Ok() && !IsOurs(entry, port, mClient))) {
        return;
      }
      if (!held.Ok()) {
        routerGone = true;
        left.push_back(port);
        return;
      }
    }
    RouterResult deleted =
        mRouter->DeletePortMapping(TestMapping(port, mClient));
    if (deleted.Ok() || deleted.outcome == RouterOutcome::kNotFound) {
      return;
    }
    routerGone = deleted.outcome == RouterOutcome::kNoAnswer ||
                 deleted.outcome == RouterOutcome::kNoRouter ||
                 deleted.outcome == RouterOutcome::kFailed;
    left.push_back(port);
  };
  std::set<uint16_t> done;
  for (uint16_t port : mAdded) {
    if (done.insert(port).second) {
      remove(port, false);
    }
  }
  for (uint16_t port : mUncertain) {
    if (done.insert(port).second) {
      remove(port, true);
    }
  }
  if (!done.empty()) {
    Note("cleaned up " + std::to_string(done.size() - left.size()) + " of " +
         std::to_string(done.size()) + " mapping(s)");
  }
  mAdded.clear();
  mUncertain.clear();
  if (left.empty()) {
    RemoveFile(mEnv.runPath);
    return;
  }
  mRun.ports = left;
  (void)SaveRunFile();
  Fail(key::kDelete, value::kFailed, ZARK_UPNP_TEST_ERR_DELETE,
       std::to_string(left.size()) +
           " mapping(s) of the test could not be removed from the router; "
           "they are removed by the next test or by stopping the test");
}

void CompatibilityTest::WriteReport() {
  UpnpTestReport report;
  report.failed = mError != ZARK_PORTMAP_ERR_NONE;
  report.error = mError;
  report.reason = mReason;
  report.date = UtcDateText(mEnv.now());
  report.mappingsAsked = mMax;
  report.mappingsReached = mReached;
  report.gateway = mGateway;
  report.location = mRun.location;
  if (mHaveConf) {
    report.brand = std::string(Field(mConf.brand));
    report.model = std::string(Field(mConf.model));
    report.version = std::string(Field(mConf.version));
    report.supportUpnp = std::string(Field(mConf.support_upnp));
    report.supportNatpmp = std::string(Field(mConf.support_natpmp));
  }
  report.log = mLog;
  if (mLogDropped > 0) {
    report.log.insert(report.log.begin() + kMaxReportLogLines / 2,
                      "... " + std::to_string(mLogDropped) +
                          " line(s) left out ...");
  }
  if (!ReplaceFileAtomically(mEnv.reportPath, SerializeUpnpTestReport(report),
                             0600)) {
    ZARK_PM_LOG_ERROR("cannot keep the test report in %s",
                      mEnv.reportPath.c_str());
  }
}

bool CompatibilityTest::MappingCountValid() {
  if (mMax < 1 || mMax > kMaxUpnpTestMappings) {
    ZARK_PM_LOG_ERROR("UPnP compatibility test: %d mappings asked; 1 to %d "
                      "can be tested",
                      mMax, kMaxUpnpTestMappings);
    mResult.error = ZARK_PORTMAP_ERR_BAD_PARAMETER;
    return false;
  }
  return true;
}

bool CompatibilityTest::StartFiles() {
  // A stop asked of an earlier test must not end this one, and what a
  // killed test left on the router goes first.
  RemoveFile(mEnv.stopPath);
  if (!CleanUpEarlierUpnpTest(mEnv)) {
    ZARK_PM_LOG_ERROR("UPnP compatibility test: mappings of an earlier test "
                      "are still on the router");
  }
  mRun.runId = NewProbeToken();
  mRun.pid = static_cast<long>(::getpid());
  if (mRun.runId.empty() || !mProgress.Start() || !SaveRunFile()) {
    ZARK_PM_LOG_ERROR("UPnP compatibility test: cannot start its files");
    mResult.error = ZARK_PORTMAP_ERR_GENERIC;
    return false;
  }
  return true;
}

bool CompatibilityTest::RunStages() {
  try {
    return Init() && AddFirst() && Fill() && DeleteAll() &&
           ConnectionClosed() && Readd() && ConnectionOpen();
  } catch (const std::exception &e) {
    // Ends the stage under way; the cleanup after still runs.
    Fail(mStage, std::strcmp(mStage, key::kMax) == 0 ? "-1" : value::kFailed,
         ZARK_PORTMAP_ERR_GENERIC, std::string("internal error: ") + e.what());
  }
  return false;
}

void CompatibilityTest::Finish() {
  try {
    CleanUp();
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("UPnP compatibility test: cleaning up: %s", e.what());
    Fail(key::kDelete, value::kFailed, ZARK_UPNP_TEST_ERR_DELETE,
         std::string("cleaning up: ") + e.what());
  }
  if (mRouter == nullptr) {
    RemoveFile(mEnv.runPath);
  }
  mProgress.Set(key::kTerminal, value::kFinished);
  RemoveFile(mEnv.stopPath);
  WriteReport();
}

int CompatibilityTest::Conclude(bool passed) {
  if (!passed || mError != ZARK_PORTMAP_ERR_NONE) {
    mResult.error =
        mError != ZARK_PORTMAP_ERR_NONE ? mError : ZARK_PORTMAP_ERR_GENERIC;
    Note("ended: failed (error " + std::to_string(mResult.error) + ")");
    Report(mResult.progress);
    return -1;
  }
  CopyText(mResult.record.brand, mHaveConf ? Field(mConf.brand) : "");
  CopyText(mResult.record.model, mHaveConf ? Field(mConf.model) : "");
  CopyText(mResult.record.version, mHaveConf ? Field(mConf.version) : "");
  CopyText(mResult.record.date, UtcDateText(mEnv.now()));
  mResult.record.max_mappings = mReached;
  Note("ended: success, " + std::to_string(mReached) + " mapping(s)");
  Report(100);
  return 0;
}

int CompatibilityTest::Run() {
  mResult = ZARK_ROUTER_TEST_COMPATIBILITY_RESULT{};
  if (!MappingCountValid()) {
    return -1;
  }
  RunningTaskMark mark(ZARK_PORTMAP_TASK_UPNP_TEST, mEnv.runningTaskPath);
  if (!mark.Held()) {
    ZARK_PM_LOG_ERROR("UPnP compatibility test: another test is running (or "
                      "%s cannot be used); not starting",
                      mEnv.runningTaskPath.c_str());
    mResult.error = ZARK_PORTMAP_ERR_GENERIC;
    return -1;
  }
  // The router's table is the test's until it ends: a rule save waits
  // (and, past the lock's bound, fails) rather than change it meanwhile.
  PortMapLockGuard lock;
  if (!lock.Held()) {
    ZARK_PM_LOG_ERROR("UPnP compatibility test: the port-map lock is held "
                      "elsewhere (rules are being applied); not starting");
    mResult.error = ZARK_PORTMAP_ERR_GENERIC;
    return -1;
  }
  if (!StartFiles()) {
    return -1;
  }
  Report(0);
  Note("started: up to " + std::to_string(mMax) + " mapping(s)");
  const bool passed = RunStages();
  Finish();
  return Conclude(passed);
}

// Marks the stage a killed test left "processing" as failed, so that a
// reader of the progress file sees the test end.
void MarkInterrupted(const std::string &path) {
  auto read = [&](const char *name) -> std::optional<std::string> {
    char buffer[4096] = {};
    if (KLIBCFileGetKeyValue(path.c_str(), name, buffer, sizeof(buffer), 0) <
        0) {
      return std::nullopt;
    }
    return std::string(buffer);
  };
  std::optional<std::string> terminal = read(key::kTerminal);
  if (!terminal || !terminal->empty()) {
    return; // no file, or the test ended by itself
  }
  const char *const stages[] = {key::kInit,
                                key::kAdd,
                                key::kMax,
                                key::kDelete,
                                key::kConnectionFailed,
                                key::kReadd1,
                                key::kReadd2,
                                key::kConnectionSuccess};
  const char *last = nullptr;
  std::string lastValue;
  for (const char *stage : stages) {
    std::optional<std::string> text = read(stage);
    if (text && !text->empty()) {
      last = stage;
      lastValue = *text;
    }
  }
  if (last == nullptr) {
    return;
  }
  auto set = [&](const char *name, const char *text) {
    if (KLIBCFileSetKeyValue(path.c_str(), name, text, 0) < 0) {
      ZARK_PM_LOG_ERROR("cannot set %s in %s [0x%04X %s:%d]", name,
                        path.c_str(), KLIBCErrGet(), KLIBCErrorGetFile(),
                        KLIBCErrorGetLine());
    }
  };
  if (std::strcmp(last, key::kMax) == 0) {
    set(key::kMax, "-1");
  } else if (lastValue == value::kProcessing) {
    set(last, value::kFailed);
    if (std::strcmp(last, key::kInit) == 0) {
      set(key::kAdd, value::kFailed);
    }
  } else {
    // The stage after the last one that ended never got under way.
    for (std::size_t i = 0; i + 1 < std::size(stages); ++i) {
      if (std::strcmp(stages[i], last) == 0) {
        set(stages[i + 1], value::kFailed);
        break;
      }
    }
  }
  set(key::kTerminal, value::kFinished);
}

} // namespace

std::string SerializeUpnpTestRun(const UpnpTestRun &run) {
  Json::Value root(Json::objectValue);
  root["version"] = kRunVersion;
  root["run_id"] = run.runId;
  root["pid"] = static_cast<Json::Int64>(run.pid);
  root["gateway"] = run.gateway;
  root["location"] = run.location;
  root["client"] = run.client;
  Json::Value ports(Json::arrayValue);
  for (uint16_t port : run.ports) {
    ports.append(port);
  }
  root["ports"] = ports;
  return WriteJsonText(root);
}

bool ParseUpnpTestRun(std::string_view text, UpnpTestRun &run,
                      std::string &why) noexcept {
  try {
    Json::Value root;
    if (!ParseStrictJson(text, root, why, 4)) {
      return false;
    }
    if (!root.isObject()) {
      why = "not a JSON object";
      return false;
    }
    long long version = 0;
    long long pid = 0;
    UpnpTestRun parsed;
    if (!ReadJsonInt(root, "version", kRunVersion, kRunVersion, version, why) ||
        !ReadJsonString(root, "run_id", parsed.runId, why, 64) ||
        !ReadJsonInt(root, "pid", 0, INT32_MAX, pid, why) ||
        !ReadJsonString(root, "gateway", parsed.gateway, why) ||
        !ReadJsonString(root, "location", parsed.location, why) ||
        !ReadJsonString(root, "client", parsed.client, why)) {
      return false;
    }
    parsed.pid = static_cast<long>(pid);
    if (!parsed.gateway.empty() && !ParseIpv4(parsed.gateway)) {
      why = "\"gateway\" is not an IPv4 address";
      return false;
    }
    if (!parsed.client.empty() && !ParseIpv4(parsed.client)) {
      why = "\"client\" is not an IPv4 address";
      return false;
    }
    const Json::Value &ports = root["ports"];
    if (!ports.isArray() || ports.size() > static_cast<Json::ArrayIndex>(
                                               kMaxUpnpTestMappings +
                                               kSparePorts + kListenerTries)) {
      why = "\"ports\" is not an array of at most the test's ports";
      return false;
    }
    for (const Json::Value &port : ports) {
      if (!port.isInt() || port.asInt() < 1 || port.asInt() > 65535) {
        why = "a port is not 1..65535";
        return false;
      }
      parsed.ports.push_back(static_cast<uint16_t>(port.asInt()));
    }
    run = std::move(parsed);
    return true;
  } catch (const std::exception &e) {
    why = e.what();
    return false;
  }
}

UpnpTestEnvironment DefaultUpnpTestEnvironment() {
  UpnpTestEnvironment environment;
  environment.gateway = []() -> std::optional<std::string> {
    char buffer[64] = {};
    if (KLibGetGatewayIP(buffer, sizeof(buffer)) < 0) {
      return std::nullopt;
    }
    return std::string(buffer);
  };
  environment.chooseRouter = ChooseRouter;
  environment.makeRouter = MakeRouter;
  environment.localAddress = [](const std::string &gateway) {
    return LocalAddressTowards(gateway);
  };
  environment.makeProbe =
      [](std::string &why,
         std::function<bool()> cancelled) -> std::unique_ptr<OutsideProbe> {
    ProbeClientOptions options;
    options.cancelled = std::move(cancelled);
    return ConfiguredProbeClient(why, std::move(options));
  };
  environment.routerConf = [](const std::string &gateway,
                              ZARK_ROUTER_CONF &conf) {
    int err = ZARK_PORTMAP_ERR_NONE;
    return LoadRouterConfForGateway(gateway, conf, err);
  };
  environment.now = [] { return static_cast<int64_t>(std::time(nullptr)); };
  const std::string first =
      GetLibraryConfig(config_key::kUpnpTestFirstPort, "");
  if (!first.empty()) {
    unsigned port = 0;
    auto [end, error] =
        std::from_chars(first.data(), first.data() + first.size(), port);
    if (error == std::errc() && end == first.data() + first.size() &&
        port >= 1024 && port <= 65000) {
      environment.firstPort = static_cast<uint16_t>(port);
    } else {
      ZARK_PM_LOG_ERROR("%s \"%s\" is not a port in 1024..65000; using %u",
                        std::string(config_key::kUpnpTestFirstPort).c_str(),
                        first.c_str(), kDefaultUpnpTestFirstPort);
    }
  }
  return environment;
}

int RunUpnpCompatibilityTest(int maxMappings,
                             const UpnpTestEnvironment &environment,
                             ZARK_ROUTER_TEST_COMPATIBILITY_RESULT &result,
                             ZARK_TEST_COMPATIBILITY_PROGRESS_CB callback,
                             void *arg) {
  CompatibilityTest test(maxMappings, environment, result, callback, arg);
  return test.Run();
}

bool CleanUpEarlierUpnpTest(const UpnpTestEnvironment &environment) {
  ReadResult read = ReadSmallFile(environment.runPath, 256 * 1024);
  if (read.status == ReadStatus::kMissing) {
    return true;
  }
  UpnpTestRun run;
  std::string why;
  if (read.status != ReadStatus::kRead ||
      !ParseUpnpTestRun(read.content, run, why)) {
    ZARK_PM_LOG_ERROR("%s cannot be read (%s); dropping it",
                      environment.runPath.c_str(), why.c_str());
    RemoveFile(environment.runPath);
    return true;
  }
  if (run.ports.empty() || run.gateway.empty() || run.client.empty()) {
    RemoveFile(environment.runPath);
    return true;
  }
  // Not while rules are being applied (a running test holds the lock
  // already; it counts recursion).
  PortMapLockGuard lock;
  if (!lock.Held()) {
    ZARK_PM_LOG_ERROR("the mappings an earlier compatibility test left stay "
                      "listed in %s: the port-map lock is held elsewhere",
                      environment.runPath.c_str());
    return false;
  }
  RouterRecord memo;
  memo.gateway = run.gateway;
  memo.protocol = RouterProtocol::kUpnp;
  memo.location = run.location;
  std::unique_ptr<RouterDriver> router =
      environment.makeRouter(RouterProtocol::kUpnp, run.gateway, &memo);
  if (router == nullptr || !router->Open().Ok()) {
    ZARK_PM_LOG_ERROR("the router of an earlier compatibility test (%s) "
                      "cannot be reached; its mappings stay listed in %s",
                      run.gateway.c_str(), environment.runPath.c_str());
    return false;
  }
  std::vector<uint16_t> left;
  int removed = 0;
  for (uint16_t port : run.ports) {
    RouterMapping entry;
    RouterResult held =
        router->GetSpecificPortMapping(IpProtocol::kTcp, port, entry);
    if (held.outcome == RouterOutcome::kNotFound ||
        (held.Ok() && !IsOurs(entry, port, run.client))) {
      continue;
    }
    if (held.Ok()) {
      RouterResult deleted =
          router->DeletePortMapping(TestMapping(port, run.client));
      if (deleted.Ok() || deleted.outcome == RouterOutcome::kNotFound) {
        ++removed;
        continue;
      }
    }
    left.push_back(port);
    if (held.outcome == RouterOutcome::kNoAnswer) {
      // The router stopped answering: keep the rest for later, unasked.
      auto at = std::find(run.ports.begin(), run.ports.end(), port);
      left.insert(left.end(), at + 1, run.ports.end());
      break;
    }
  }
  syslog(LOG_INFO,
         "%s:%d removed %d mapping(s) an earlier compatibility test left on "
         "%s; %zu left",
         __FILE__, __LINE__, removed, run.gateway.c_str(), left.size());
  if (left.empty()) {
    RemoveFile(environment.runPath);
    return true;
  }
  run.ports = left;
  (void)SaveRun(environment.runPath, run);
  return false;
}

int StopUpnpCompatibilityTest(const UpnpTestEnvironment &environment,
                              std::chrono::milliseconds wait) {
  int running =
      IsTaskRunning(ZARK_PORTMAP_TASK_UPNP_TEST, environment.runningTaskPath);
  if (running < 0) {
    return -1;
  }
  if (running == 1) {
    // The running test's id, so that the request cannot outlive it and
    // stop the next one; "*" when its run file cannot be read.
    std::string id = "*";
    ReadResult read = ReadSmallFile(environment.runPath, 256 * 1024);
    UpnpTestRun run;
    std::string why;
    if (read.status == ReadStatus::kRead &&
        ParseUpnpTestRun(read.content, run, why) && !run.runId.empty()) {
      id = run.runId;
    }
    if (!ReplaceFileAtomically(environment.stopPath, id + "\n", 0600)) {
      return -1;
    }
    const Clock::time_point deadline = Clock::now() + wait;
    for (;;) {
      running = IsTaskRunning(ZARK_PORTMAP_TASK_UPNP_TEST,
                              environment.runningTaskPath);
      if (running == 0) {
        syslog(LOG_INFO, "%s:%d the UPnP compatibility test has stopped",
               __FILE__, __LINE__);
        return 0;
      }
      if (running < 0 || Clock::now() >= deadline) {
        ZARK_PM_LOG_ERROR("the UPnP compatibility test did not stop within "
                          "%lld ms",
                          static_cast<long long>(wait.count()));
        return -1;
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
  }
  // No test runs: tidy up after one that was killed.
  RemoveFile(environment.stopPath);
  MarkInterrupted(environment.progressPath);
  if (!CleanUpEarlierUpnpTest(environment)) {
    return -1;
  }
  return 0;
}

} // namespace zark::portmap

extern "C" int KLibTestUpnpCompatibility(
    int maxMappings, ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *result,
    ZARK_TEST_COMPATIBILITY_PROGRESS_CB callback, void *arg, bool flag) {
  using namespace zark::portmap;
  if (result == nullptr) {
    ZARK_PM_LOG_ERROR("KLibTestUpnpCompatibility: result is NULL");
    return -1;
  }
  try {
    UpnpTestEnvironment environment = DefaultUpnpTestEnvironment();
    // flag: write the progress file (the module always asks for it).
    environment.writeProgress = flag;
    return RunUpnpCompatibilityTest(maxMappings, environment, *result, callback,
                                    arg);
  } catch (const std::exception &e) {
    // Nothing may cross the C boundary (the test itself catches what its
    // stages throw and cleans up; this is what is left: allocation in the
    // set-up).
    ZARK_PM_LOG_ERROR("KLibTestUpnpCompatibility: %s", e.what());
    result->error = ZARK_PORTMAP_ERR_GENERIC;
    return -1;
  }
}

extern "C" int KLibStopTestUpnpCompatibility(void) {
  using namespace zark::portmap;
  try {
    return StopUpnpCompatibilityTest(DefaultUpnpTestEnvironment());
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("KLibStopTestUpnpCompatibility: %s", e.what());
    return -1;
  }
}
