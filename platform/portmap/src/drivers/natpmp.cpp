#include "drivers/natpmp.h"

#include "base/local_network.h"
#include "base/portmap_log.h"
#include "drivers/driver_log.h"

#include <arpa/inet.h>
#include <natpmp.h>
#include <poll.h>
#include <sys/socket.h>

#include <cerrno>
#include <functional>
#include <utility>

namespace zark::portmap {

static_assert(NATPMP_PORT == 5351, "NatPmpOptions::port defaults to 5351");

namespace {

using Clock = std::chrono::steady_clock;

const char *NatPmpResultMeaning(int rc) {
  if (rc >= 0) {
    return "success";
  }
  // strnatpmperr is built into Debian's libnatpmp but only declared with
  // ENABLE_STRNATPMPERR; the few codes acted on are named here.
  switch (rc) {
  case NATPMP_TRYAGAIN:
    return "no reply before the deadline";
  case NATPMP_ERR_NOGATEWAYSUPPORT:
    return "nothing answers NAT-PMP at the gateway";
  case NATPMP_ERR_NOTAUTHORIZED:
    return "not authorized";
  case NATPMP_ERR_NETWORKFAILURE:
    return "the router has no network (no public address)";
  case NATPMP_ERR_OUTOFRESOURCES:
    return "the router is out of resources";
  case NATPMP_ERR_UNSUPPORTEDOPCODE:
    return "unsupported opcode";
  case NATPMP_ERR_UNSUPPORTEDVERSION:
    return "unsupported version";
  case NATPMP_ERR_UNDEFINEDERROR:
    return "undefined router error";
  case NATPMP_ERR_SENDERR:
    return "send failed";
  case NATPMP_ERR_RECVFROM:
    return "receive failed";
  case NATPMP_ERR_SOCKETERROR:
    return "socket failed";
  case NATPMP_ERR_CONNECTERR:
    return "connect failed";
  case NATPMP_ERR_FCNTLERROR:
    return "fcntl failed";
  default:
    return "libnatpmp error";
  }
}

bool IsRouterError(int rc) {
  return rc == NATPMP_ERR_NOTAUTHORIZED || rc == NATPMP_ERR_NETWORKFAILURE ||
         rc == NATPMP_ERR_OUTOFRESOURCES ||
         rc == NATPMP_ERR_UNSUPPORTEDOPCODE ||
         rc == NATPMP_ERR_UNSUPPORTEDVERSION || rc == NATPMP_ERR_UNDEFINEDERROR;
}

std::string MappingText(const PortMapping &mapping) {
  return std::string(UpnpProtocolName(mapping.protocol)) + " " +
         std::to_string(mapping.externalPort) + "->" +
         std::to_string(mapping.internalPort);
}

} // namespace

// Owns the libnatpmp object; closenatpmp on every path.
struct NatPmpRouter::Session {
  natpmp_t handle{};
  bool open = false;

  Session() = default;
  Session(const Session &) = delete;
  Session &operator=(const Session &) = delete;
  ~Session() {
    if (open) {
      closenatpmp(&handle);
    }
  }

  // What waiting for one reply gave.
  enum class Wait { kAnswered, kTimedOut, kPollFailed };

  // Waits until deadline for the reply of responseType. kAnswered: rc is
  // libnatpmp's result (0: response holds the reply) and savedErrno the
  // errno of a failed receive; kPollFailed: savedErrno is poll's.
  Wait AwaitReply(Clock::time_point deadline, int responseType,
                  natpmpresp_t &response, int &rc, int &savedErrno) {
    for (;;) {
      auto remaining = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - Clock::now());
      if (remaining.count() <= 0) {
        return Wait::kTimedOut;
      }
      pollfd watch{handle.s, POLLIN, 0};
      int ready = ::poll(&watch, 1, static_cast<int>(remaining.count()) + 1);
      if (ready < 0) {
        if (errno == EINTR) {
          continue;
        }
        savedErrno = errno;
        return Wait::kPollFailed;
      }
      if (ready == 0) {
        continue; // the loop head sees the deadline
      }
      rc = readnatpmpresponseorretry(&handle, &response);
      savedErrno = rc == NATPMP_ERR_RECVFROM ? errno : 0;
      if (rc == 0 && response.type != responseType) {
        // A late reply to an earlier request: keep waiting for ours.
        handle.has_pending_request = 1;
        continue;
      }
      if (rc == NATPMP_TRYAGAIN || rc == NATPMP_ERR_WRONGPACKETSOURCE) {
        continue;
      }
      return Wait::kAnswered;
    }
  }

  // What a libnatpmp result that ended the wait means for the caller.
  static RouterOutcome OutcomeOfAnswer(int rc) {
    if (rc == 0) {
      return RouterOutcome::kOk;
    }
    if (rc == NATPMP_ERR_NOGATEWAYSUPPORT) {
      // The gateway answered "port unreachable": no NAT-PMP server.
      return RouterOutcome::kNoAnswer;
    }
    return IsRouterError(rc) ? RouterOutcome::kRefused : RouterOutcome::kFailed;
  }

  // Sends a request with send() and waits for the reply of responseType
  // on our own schedule. The reply is in response when the result is kOk.
  RouterResult Exchange(const NatPmpOptions &options, const char *call,
                        const std::function<int(natpmp_t *)> &send,
                        int responseType, const std::string &detail,
                        natpmpresp_t &response) {
    RouterResult result;
    std::chrono::milliseconds wait = options.firstWait;
    for (int attempt = 1; attempt <= options.tries; ++attempt) {
      int sent = send(&handle);
      if (sent < 0) {
        int savedErrno = errno;
        LogRouterCall(__FILE__, __LINE__, call, sent, true,
                      NatPmpResultMeaning(sent), detail, savedErrno);
        result.outcome = RouterOutcome::kFailed;
        result.code = sent;
        result.message =
            std::string(call) + " " + detail + ": " + NatPmpResultMeaning(sent);
        return result;
      }
      // libnatpmp would resend on its own 250 ms doubling schedule from
      // inside readnatpmpresponseorretry; move its next retry far away so
      // that only this loop decides when to send.
      handle.retry_time.tv_sec += 3600;

      int rc = 0;
      int savedErrno = 0;
      switch (AwaitReply(Clock::now() + wait, responseType, response, rc,
                         savedErrno)) {
      case Wait::kTimedOut:
        wait *= 2;
        continue;
      case Wait::kPollFailed:
        LogRouterCall(__FILE__, __LINE__, "poll", -1, true, "poll failed",
                      detail, savedErrno);
        result.outcome = RouterOutcome::kFailed;
        result.message = std::string(call) + " " + detail + ": poll failed";
        return result;
      case Wait::kAnswered:
        break;
      }
      std::string tried = detail + " (try " + std::to_string(attempt) + " of " +
                          std::to_string(options.tries) + ")";
      LogRouterCall(__FILE__, __LINE__, call, rc, rc != 0,
                    NatPmpResultMeaning(rc), tried, savedErrno);
      result.code = rc;
      result.message = std::string(call) + " " + detail + ": " +
                       NatPmpResultMeaning(rc) + " (" + std::to_string(rc) +
                       ")";
      result.outcome = OutcomeOfAnswer(rc);
      return result;
    }
    // Every wait ran out: the last word of libnatpmp was "try again".
    std::string tried =
        detail + " (" + std::to_string(options.tries) + " tries)";
    LogRouterCall(__FILE__, __LINE__, call, NATPMP_TRYAGAIN, true,
                  NatPmpResultMeaning(NATPMP_TRYAGAIN), tried);
    result.outcome = RouterOutcome::kNoAnswer;
    result.code = NATPMP_TRYAGAIN;
    result.message = std::string(call) + " " + detail +
                     ": no reply from the router after " +
                     std::to_string(options.tries) + " tries";
    return result;
  }
};

NatPmpRouter::NatPmpRouter(NatPmpOptions options)
    : mOptions(std::move(options)) {}

NatPmpRouter::~NatPmpRouter() = default;

std::string NatPmpRouter::Location() const {
  return mSession ? mOptions.gateway : std::string();
}

RouterResult NatPmpRouter::Open() {
  RouterResult result;
  if (mSession) {
    result.outcome = RouterOutcome::kOk;
    return result;
  }
  std::optional<uint32_t> gateway = ParseIpv4(mOptions.gateway);
  if (!gateway) {
    result.outcome = RouterOutcome::kNoRouter;
    result.message =
        "NAT-PMP: gateway \"" + mOptions.gateway + "\" is not an IPv4 address";
    ZARK_PM_LOG_ERROR("%s", result.message.c_str());
    return result;
  }
  auto session = std::make_unique<Session>();
  session->handle.s = -1;
  int rc = initnatpmp(&session->handle, 1, htonl(*gateway));
  int savedErrno = rc < 0 ? errno : 0;
  // initnatpmp may have opened the socket before it failed.
  session->open = rc == 0 || session->handle.s >= 0;
  LogRouterCall(__FILE__, __LINE__, "initnatpmp", rc, rc != 0,
                NatPmpResultMeaning(rc), mOptions.gateway, savedErrno);
  if (rc != 0) {
    result.outcome = RouterOutcome::kFailed;
    result.code = rc;
    result.message = "NAT-PMP: initnatpmp failed for " + mOptions.gateway;
    return result;
  }
  if (mOptions.port != NATPMP_PORT) {
    // initnatpmp connected the socket to the standard port; a test router
    // listens elsewhere. libnatpmp sends with send() and checks only the
    // source address of replies, so reconnecting is enough.
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(mOptions.port);
    address.sin_addr.s_addr = htonl(*gateway);
    if (::connect(session->handle.s, reinterpret_cast<sockaddr *>(&address),
                  sizeof(address)) != 0) {
      ZARK_PM_LOG_CALL("connect", -1, errno, mOptions.gateway.c_str());
      result.outcome = RouterOutcome::kFailed;
      result.message = "NAT-PMP: cannot reach " + mOptions.gateway;
      return result;
    }
  }
  mSession = std::move(session);
  result.outcome = RouterOutcome::kOk;
  return result;
}

RouterResult NatPmpRouter::AddPortMapping(const PortMapping &mapping) {
  RouterResult opened = Open();
  if (!opened.Ok()) {
    return opened;
  }
  const int protocol = mapping.protocol == IpProtocol::kTcp
                           ? NATPMP_PROTOCOL_TCP
                           : NATPMP_PROTOCOL_UDP;
  const int responseType = mapping.protocol == IpProtocol::kTcp
                               ? NATPMP_RESPTYPE_TCPPORTMAPPING
                               : NATPMP_RESPTYPE_UDPPORTMAPPING;
  natpmpresp_t response{};
  const std::string detail = MappingText(mapping) + " lifetime " +
                             std::to_string(mOptions.lifetimeSeconds);
  RouterResult result = mSession->Exchange(
      mOptions, "sendnewportmappingrequest",
      [&](natpmp_t *handle) {
        return sendnewportmappingrequest(handle, protocol, mapping.internalPort,
                                         mapping.externalPort,
                                         mOptions.lifetimeSeconds);
      },
      responseType, detail, response);
  if (!result.Ok()) {
    return result;
  }
  const uint16_t granted = response.pnu.newportmapping.mappedpublicport;
  result.leaseSeconds = response.pnu.newportmapping.lifetime;
  if (granted != mapping.externalPort) {
    // The router holds our private port under another public port: ours is
    // taken. Never accept a port the user did not ask for.
    result.outcome = RouterOutcome::kConflict;
    result.grantedExternalPort = granted;
    result.message = "NAT-PMP: the router gave public port " +
                     std::to_string(granted) + " instead of " +
                     std::to_string(mapping.externalPort) + " for " +
                     MappingText(mapping);
    ZARK_PM_LOG_ERROR("%s", result.message.c_str());
    return result;
  }
  if (result.leaseSeconds == 0) {
    result.outcome = RouterOutcome::kNotHeld;
    result.message =
        "NAT-PMP: the router granted lifetime 0 for " + MappingText(mapping);
    ZARK_PM_LOG_ERROR("%s", result.message.c_str());
    return result;
  }
  result.message = "mapped " + MappingText(mapping) + " for " +
                   std::to_string(result.leaseSeconds) + " s";
  return result;
}

ZARK_FAILURE_KIND NatPmpRouter::FailureKind(const RouterResult &result) const {
  if (result.outcome == RouterOutcome::kNotHeld) {
    // Lifetime 0 granted for a mapping asked with a lifetime.
    return ZARK_FAILURE_LEASE_REFUSED;
  }
  switch (result.code) {
  case NATPMP_ERR_NOTAUTHORIZED:
    return ZARK_FAILURE_PORT_REFUSED;
  case NATPMP_ERR_OUTOFRESOURCES:
    return ZARK_FAILURE_TABLE_FULL;
  default:
    return RouterDriver::FailureKind(result);
  }
}

int NatPmpRouter::AnswerDeadlineSeconds() const {
  std::chrono::milliseconds total{0};
  std::chrono::milliseconds wait = mOptions.firstWait;
  for (int attempt = 0; attempt < mOptions.tries; ++attempt) {
    total += wait;
    wait *= 2;
  }
  return static_cast<int>((total.count() + 999) / 1000);
}

RouterResult NatPmpRouter::DeletePortMapping(const PortMapping &mapping) {
  RouterResult opened = Open();
  if (!opened.Ok()) {
    return opened;
  }
  const int protocol = mapping.protocol == IpProtocol::kTcp
                           ? NATPMP_PROTOCOL_TCP
                           : NATPMP_PROTOCOL_UDP;
  const int responseType = mapping.protocol == IpProtocol::kTcp
                               ? NATPMP_RESPTYPE_TCPPORTMAPPING
                               : NATPMP_RESPTYPE_UDPPORTMAPPING;
  natpmpresp_t response{};
  // RFC 6886: lifetime 0 and public port 0 delete the mapping of the
  // private port.
  return mSession->Exchange(
      mOptions, "sendnewportmappingrequest",
      [&](natpmp_t *handle) {
        return sendnewportmappingrequest(handle, protocol, mapping.internalPort,
                                         0, 0);
      },
      responseType, "delete " + MappingText(mapping), response);
}

RouterResult NatPmpRouter::GetSpecificPortMapping(IpProtocol, uint16_t,
                                                  RouterMapping &) {
  RouterResult result;
  result.outcome = RouterOutcome::kUnsupported;
  result.message = "NAT-PMP cannot read a router's mapping";
  return result;
}

RouterResult NatPmpRouter::ListMappings(std::vector<RouterMapping> &entries) {
  entries.clear();
  RouterResult result;
  result.outcome = RouterOutcome::kUnsupported;
  result.message = "NAT-PMP cannot list a router's mappings";
  return result;
}

RouterResult NatPmpRouter::GetExternalAddress(std::string &address) {
  RouterResult opened = Open();
  if (!opened.Ok()) {
    return opened;
  }
  natpmpresp_t response{};
  RouterResult result = mSession->Exchange(
      mOptions, "sendpublicaddressrequest",
      [](natpmp_t *handle) { return sendpublicaddressrequest(handle); },
      NATPMP_RESPTYPE_PUBLICADDRESS, mOptions.gateway, response);
  if (result.Ok()) {
    address = FormatIpv4(ntohl(response.pnu.publicaddress.addr.s_addr));
  }
  return result;
}

} // namespace zark::portmap
