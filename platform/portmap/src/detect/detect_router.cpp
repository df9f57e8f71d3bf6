#include "detect/detect_router.h"

#include "base/conf_file.h"
#include "base/detect_log.h"
#include "base/ipv4_class.h"
#include "base/library_config.h"
#include "base/portmap_log.h"
#include "base/record_text.h"
#include "base/unique_fd.h"
#include "catalog/detect_result_store.h"
#include "catalog/router_conf_store.h"
#include "catalog/router_db.h"

#include <fcntl.h>
#include <sys/file.h>
#include <syslog.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <exception>
#include <mutex>

namespace zark::portmap {
namespace {

using Clock = std::chrono::steady_clock;

// The resolv.conf of a machine is a few lines.
constexpr std::size_t kMaxResolvConfBytes = 64 * 1024;

std::mutex gFactoryMutex;
std::function<DetectEnvironment()> gFactory;

std::string NameOf(std::string_view brand, std::string_view model,
                   std::string_view version) {
  if (brand.empty() || model.empty()) {
    return {};
  }
  std::string name = std::string(brand) + ": " + std::string(model);
  if (!version.empty()) {
    name += "(" + std::string(version) + ")";
  }
  return name;
}

// One run: announces stages, times and logs the checks.
class Run {
public:
  Run(ZARK_ROUTER_DETECT_RESULT &record, ZARK_DETECT_PROGRESS_CB callback,
      void *arg, DetectEnvironment &environment)
      : mRecord(record), mCallback(callback), mArg(arg), mEnv(environment) {}

  // Runs the checks in order; 0 when all passed, -1 at the first that
  // stopped the run (logged).
  int Execute() {
    if (!InterfaceStage() || !GatewayStage() || !WanStage()) {
      return -1;
    }
    HopsStage();
    if (!DnsStage() || !RouterStage()) {
      return -1;
    }
    Begin(ZARK_DETECT_STAGE_DONE);
    return 0;
  }

private:
  // 20: the interface.
  bool InterfaceStage() {
    Begin(ZARK_DETECT_STAGE_INTERFACE);
    mRouteTable = mEnv.network->RouteTable();
    mInterfaces = mEnv.network->Interfaces();
    if (!mInterfaces) {
      return Stop("interface", "the network interfaces cannot be listed");
    }
    if (mRouteTable) {
      mRoutes = ParseDefaultRoutes(*mRouteTable);
    }
    InterfaceCheck interface = CheckInterface(mRoutes, *mInterfaces);
    CopyTextZeroFilled(mRecord.network_interface, interface.interface);
    if (!interface.ok) {
      return Stop("interface", interface.why);
    }
    Passed("interface", interface.why);
    return true;
  }

  // 30: the gateway.
  bool GatewayStage() {
    Begin(ZARK_DETECT_STAGE_GATEWAY);
    if (!mRouteTable) {
      return Stop("gateway", "the routing table cannot be read");
    }
    GatewayCheck gateway = CheckGateway(mRoutes, *mInterfaces);
    if (!gateway.ok) {
      return Stop("gateway", gateway.why);
    }
    mGatewayText = FormatIpv4(gateway.gateway);
    CopyTextZeroFilled(mRecord.gateway_ip, mGatewayText);
    if (gateway.warning) {
      mRecord.warning |= ZARK_DETECT_WARN_GATEWAY;
      ZARK_DETECT_WARNING("detection: the gateway setting looks wrong: %s",
                          gateway.why.c_str());
    }
    Passed("gateway", gateway.why);
    return true;
  }

  // 40: the WAN.
  bool WanStage() {
    Begin(ZARK_DETECT_STAGE_WAN);
    const std::vector<WanProbeHost> hosts = ParseWanProbeHosts(
        mEnv.config(config_key::kWanProbeHosts, kDefaultWanProbeHosts));
    NameResolver resolve = [this](std::string_view name,
                                  std::chrono::milliseconds budget) {
      std::optional<std::string> text = mEnv.resolvConf();
      const std::vector<std::string> servers =
          text ? ParseResolvConf(*text) : std::vector<std::string>{};
      DnsLookup lookup = mEnv.dns->Lookup(servers, name, budget);
      return lookup.outcome == DnsOutcome::kAnswered ? lookup.addresses
                                                     : std::vector<uint32_t>{};
    };
    WanCheck wan =
        CheckWan(hosts, resolve, *mEnv.connector, mEnv.limits.wanBudget);
    if (!wan.ok) {
      return Stop("WAN", wan.why);
    }
    mWanAddress = wan.reached.address;
    Passed("WAN", wan.why);
    return true;
  }

  // 70: the hops to the first public address. Never stops the run.
  void HopsStage() {
    Begin(ZARK_DETECT_STAGE_HOPS);
    const std::vector<HopReply> replies =
        mEnv.hopProber->Probe(mWanAddress, mEnv.limits.hops);
    HopsFinding hops = InterpretHops(replies, mEnv.limits.hops.maxTtl);
    if (!hops.known) {
      mRecord.hops = 0;
      mRecord.warning |= ZARK_DETECT_WARN_HOPS_UNKNOWN;
      ZARK_DETECT_WARNING("detection: the hop count towards %s is unknown: "
                          "%s (path %s)",
                          FormatIpv4(mWanAddress).c_str(), hops.why.c_str(),
                          hops.path.c_str());
    } else {
      mRecord.hops = hops.hops;
      if (hops.hops > 1) {
        mRecord.warning |= ZARK_DETECT_WARN_HOPS_OVER_ONE;
        ZARK_DETECT_WARNING(
            "detection: %d private hops before the internet (path %s): %s",
            hops.hops, hops.path.c_str(),
            hops.carrierGradeNat
                ? "the carrier puts this network behind its own NAT "
                  "(carrier-grade NAT, 100.64.0.0/10)"
                : "a router behind a router");
      }
    }
    Passed("hops", hops.why + " (path " + hops.path + ")");
  }

  // 50: DNS.
  bool DnsStage() {
    Begin(ZARK_DETECT_STAGE_DNS);
    const std::string name =
        mEnv.config(config_key::kDnsProbeName, kDefaultDnsProbeName);
    DnsCheck dns =
        CheckDns(mEnv.resolvConf(), name, *mEnv.dns, mEnv.limits.dnsBudget);
    if (!dns.ok) {
      return Stop("DNS", dns.why);
    }
    Passed("DNS", dns.why);
    return true;
  }

  // 80: the router.
  bool RouterStage() {
    Begin(ZARK_DETECT_STAGE_ROUTER);
    RouterFindings findings = ProbeRouter(*mEnv.router, mGatewayText);
    RouterCheck router = CheckRouter(findings);
    RecordRouter(router);
    if (router.doubleNat) {
      WarnDoubleNat(*router.outsideAddress);
    }
    if (!router.ok) {
      return Stop("router", router.why);
    }
    Passed("router", router.why + ", name \"" + router.name.pfpath +
                         "\", max rules " +
                         std::to_string(mRecord.router_max_rule));
    return true;
  }

  // What the router check found, into the record (also when it failed).
  void RecordRouter(const RouterCheck &router) {
    mRecord.support_upnp = static_cast<int32_t>(router.upnp);
    mRecord.support_natpmp = static_cast<int32_t>(router.natpmp);
    CopyTextZeroFilled(mRecord.router_brand, router.name.brand);
    CopyTextZeroFilled(mRecord.router_model, router.name.model);
    CopyTextZeroFilled(mRecord.router_version, router.name.version);
    CopyTextZeroFilled(mRecord.upnp_pfpath, router.name.pfpath);
    CopyTextZeroFilled(mRecord.router_user_setting_name,
                       mEnv.userSettingName(mGatewayText));
    mRecord.router_max_rule =
        router.name.pfpath.empty() ? 0 : mEnv.maxRules(router.name);
  }

  void WarnDoubleNat(uint32_t outsideAddress) {
    mRecord.warning |= kDetectWarnDoubleNat | ZARK_DETECT_WARN_HOPS_OVER_ONE;
    ZARK_DETECT_WARNING(
        "detection: double NAT: the router's outside address %s is %s; "
        "ports it forwards are not reachable from the internet",
        FormatIpv4(outsideAddress).c_str(),
        ClassifyIpv4(outsideAddress) == Ipv4Class::kSharedCgn
            ? "carrier-grade NAT space (100.64.0.0/10)"
            : "a private address (RFC 1918)");
  }

  void Begin(int32_t stage) {
    mRecord.enProgress = stage;
    mStarted = mEnv.now();
    if (mCallback != nullptr) {
      mCallback(&mRecord, mArg);
    }
  }

  long long Elapsed() const {
    return std::chrono::duration_cast<std::chrono::milliseconds>(mEnv.now() -
                                                                 mStarted)
        .count();
  }

  void Passed(const char *check, const std::string &why) {
    ZARK_DETECT_INFO("detection: %s check passed in %lld ms: %s", check,
                     Elapsed(), why.c_str());
  }

  // Logs why the run stops at this check; always false.
  bool Stop(const char *check, const std::string &why) {
    ZARK_PM_LOG_ERROR("detection stopped at the %s check (stage %d) after "
                      "%lld ms: %s",
                      check, mRecord.enProgress, Elapsed(), why.c_str());
    return false;
  }

  ZARK_ROUTER_DETECT_RESULT &mRecord;
  ZARK_DETECT_PROGRESS_CB mCallback;
  void *mArg;
  DetectEnvironment &mEnv;
  Clock::time_point mStarted;
  // What one check leaves for the later ones.
  std::optional<std::string> mRouteTable;
  std::optional<std::vector<InterfaceInfo>> mInterfaces;
  std::vector<DefaultRoute> mRoutes;
  std::string mGatewayText;
  uint32_t mWanAddress = 0;
};

int32_t MaxRulesFromDatabase(const RouterName &name) {
  RouterDbEntry entry;
  int err = ZARK_PORTMAP_ERR_NONE;
  if (FindRouterDbEntry(name.brand, name.model, name.version, entry, err)) {
    return entry.maxRules;
  }
  if (err != ZARK_PORTMAP_ERR_NOT_CONFIGURED) {
    return 0; // the database cannot be read; logged by the reader
  }
  RouterDb db;
  if (!ReadRouterDb(db, err)) {
    return 0;
  }
  for (const RouterDbEntry &candidate : db.entries) {
    if (candidate.generic && candidate.brand == name.brand &&
        candidate.model == name.model) {
      return candidate.maxRules;
    }
  }
  return 0;
}

std::string StoredSettingName(const std::string &gateway) {
  ZARK_ROUTER_CONF conf{};
  int err = ZARK_PORTMAP_ERR_NONE;
  if (!LoadRouterConfForGateway(gateway, conf, err)) {
    return {};
  }
  return NameOf(Field(conf.brand), Field(conf.model), Field(conf.version));
}

// Holds the detection lock (flock on kDetectLockPath) for its lifetime.
class DetectionLock {
public:
  DetectionLock() {
    if (!MakeFolders(ZARK_PORTMAP_CONF_DIR, 0755)) {
      return;
    }
    mFd.Reset(::open(kDetectLockPath, O_RDWR | O_CREAT | O_CLOEXEC, 0600));
    if (!mFd.Valid()) {
      ZARK_PM_LOG_CALL("open", -1, errno, kDetectLockPath);
      return;
    }
    if (::flock(mFd.Get(), LOCK_EX | LOCK_NB) != 0) {
      if (errno == EWOULDBLOCK) {
        ZARK_PM_LOG_ERROR("another router detection is running");
      } else {
        ZARK_PM_LOG_CALL("flock", -1, errno, kDetectLockPath);
      }
      mFd.Reset();
    }
  }
  [[nodiscard]] bool Held() const { return mFd.Valid(); }

private:
  UniqueFd mFd; // closing it releases the lock
};

} // namespace

DetectEnvironment MakeSystemDetectEnvironment() {
  DetectEnvironment environment;
  environment.network = MakeSystemNetworkInfo();
  environment.connector = MakeSystemTcpConnector();
  environment.hopProber = MakeUdpHopProber();
  environment.dns = MakeUdpDnsClient();
  environment.router = MakeRouterProbes(RouterProbeOptions{});
  environment.config = [](std::string_view key, std::string_view fallback) {
    return GetLibraryConfig(key, fallback);
  };
  environment.resolvConf = []() -> std::optional<std::string> {
    ReadResult read = ReadSmallFile(kResolvConfPath, kMaxResolvConfBytes);
    if (read.status == ReadStatus::kRead) {
      return std::move(read.content);
    }
    return std::nullopt;
  };
  environment.maxRules = MaxRulesFromDatabase;
  environment.userSettingName = StoredSettingName;
  environment.now = [] { return Clock::now(); };
  return environment;
}

int RunDetection(ZARK_ROUTER_DETECT_RESULT &record,
                 ZARK_DETECT_PROGRESS_CB callback, void *arg,
                 DetectEnvironment &environment) {
  Run run(record, callback, arg, environment);
  return run.Execute();
}

void SetDetectEnvironmentFactoryForTesting(
    std::function<DetectEnvironment()> factory) {
  std::lock_guard<std::mutex> lock(gFactoryMutex);
  gFactory = std::move(factory);
}

} // namespace zark::portmap

extern "C" {

// flag true: the final record (of a complete run or of one stopped at a
// check) is kept for KLibGetRouterDetectResult; false: it is only
// returned. A run that cannot start (stage 10: no record, another
// detection running, no lock file) keeps nothing.
int KLibDetectRouter(ZARK_ROUTER_DETECT_RESULT *result,
                     ZARK_DETECT_PROGRESS_CB callback, void *arg, bool flag) {
  using namespace zark::portmap;
  if (result == nullptr) {
    ZARK_PM_LOG_ERROR("KLibDetectRouter: result must not be NULL");
    return -1;
  }
  try {
    *result = ZARK_ROUTER_DETECT_RESULT{};
    result->enProgress = ZARK_DETECT_STAGE_START;
    if (callback != nullptr) {
      callback(result, arg);
    }
    DetectionLock lock;
    if (!lock.Held()) {
      ZARK_PM_LOG_ERROR("KLibDetectRouter: detection could not start");
      return -1;
    }
    std::function<DetectEnvironment()> factory;
    {
      std::lock_guard<std::mutex> guard(gFactoryMutex);
      factory = gFactory;
    }
    DetectEnvironment environment =
        factory ? factory() : MakeSystemDetectEnvironment();
    const int rc = RunDetection(*result, callback, arg, environment);
    if (flag && !StoreDetectResult(kDetectResultPath, *result)) {
      ZARK_PM_LOG_ERROR("KLibDetectRouter: the result could not be kept; "
                        "KLibGetRouterDetectResult answers the previous one");
    }
    return rc;
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("KLibDetectRouter: stopped at stage %d: %s",
                      result->enProgress, e.what());
    return -1;
  }
}

int KLibGetRouterDetectResult(ZARK_ROUTER_DETECT_RESULT *result) {
  using namespace zark::portmap;
  if (result == nullptr) {
    ZARK_PM_LOG_ERROR("KLibGetRouterDetectResult: result must not be NULL");
    return -1;
  }
  try {
    ZARK_ROUTER_DETECT_RESULT loaded{};
    switch (LoadDetectResult(kDetectResultPath, loaded)) {
    case DetectResultLoad::kLoaded:
      *result = loaded;
      return 0;
    case DetectResultLoad::kNone:
      // Nothing detected yet is an answer, not a failure: an empty record
      // (no router found), so that a router can be configured by hand
      // before any detection has run.
      *result = ZARK_ROUTER_DETECT_RESULT{};
      syslog(LOG_INFO, "KLibGetRouterDetectResult: no router detection has "
                       "been run yet, answering an empty result");
      return 0;
    case DetectResultLoad::kBroken:
      return -1;
    }
    return -1;
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("KLibGetRouterDetectResult: %s", e.what());
    return -1;
  }
}

} // extern "C"
