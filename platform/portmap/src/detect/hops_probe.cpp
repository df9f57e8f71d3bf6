#include "detect/hops_probe.h"

#include "base/ipv4_class.h"
#include "base/local_network.h"
#include "base/portmap_log.h"
#include "base/unique_fd.h"

#include <arpa/inet.h>
#include <linux/errqueue.h>
#include <netinet/in.h>
#include <netinet/ip_icmp.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <map>
#include <optional>

namespace zark::portmap {
namespace {

using Clock = std::chrono::steady_clock;

// The first reply of each TTL.
std::map<int, HopReply> ByTtl(std::span<const HopReply> replies) {
  std::map<int, HopReply> byTtl;
  for (const HopReply &reply : replies) {
    byTtl.emplace(reply.ttl, reply);
  }
  return byTtl;
}

std::optional<int> FirstPublicTtl(const std::map<int, HopReply> &byTtl) {
  for (const auto &[ttl, reply] : byTtl) {
    if (ClassifyIpv4(reply.responder) == Ipv4Class::kPublic) {
      return ttl;
    }
  }
  return std::nullopt;
}

std::optional<int> DestinationTtl(const std::map<int, HopReply> &byTtl) {
  for (const auto &[ttl, reply] : byTtl) {
    if (reply.destination) {
      return ttl;
    }
  }
  return std::nullopt;
}

bool AllAnsweredBelow(const std::map<int, HopReply> &byTtl, int ttl) {
  for (int below = 1; below < ttl; ++below) {
    if (!byTtl.contains(below)) {
      return false;
    }
  }
  return true;
}

// All probes from one unconnected UDP socket; the port a probe went to
// tells which TTL an ICMP error answers.
class UdpHopProber final : public HopProber {
public:
  std::vector<HopReply> Probe(uint32_t destination,
                              const HopLimits &limits) override {
    std::vector<HopReply> replies;
    const int maxTtl = std::clamp(limits.maxTtl, 1, 64);
    UniqueFd fd(
        ::socket(AF_INET, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    if (!fd.Valid()) {
      ZARK_PM_LOG_CALL("socket", -1, errno, "(hop probe)");
      return replies;
    }
    const int on = 1;
    if (::setsockopt(fd.Get(), IPPROTO_IP, IP_RECVERR, &on, sizeof(on)) != 0) {
      ZARK_PM_LOG_CALL("setsockopt(IP_RECVERR)", -1, errno);
      return replies;
    }
    const Clock::time_point start = Clock::now();
    const Clock::time_point deadline = start + limits.budget;
    std::vector<bool> sentOnce(static_cast<std::size_t>(maxTtl) + 1, false);
    for (int ttl = 1; ttl <= maxTtl; ++ttl) {
      sentOnce[static_cast<std::size_t>(ttl)] =
          Send(fd.Get(), destination, ttl, limits.basePort);
    }
    if (std::none_of(sentOnce.begin(), sentOnce.end(),
                     [](bool sent) { return sent; })) {
      return replies;
    }
    bool resent = false;
    for (;;) {
      const Clock::time_point now = Clock::now();
      if (now >= deadline) {
        return replies;
      }
      if (!resent && now >= start + limits.resendAfter) {
        resent = true;
        const std::map<int, HopReply> byTtl = ByTtl(replies);
        // Past the first public address nothing is worth asking again.
        const int upTo = FirstPublicTtl(byTtl).value_or(maxTtl);
        for (int ttl = 1; ttl <= upTo; ++ttl) {
          if (!byTtl.contains(ttl)) {
            (void)Send(fd.Get(), destination, ttl, limits.basePort);
          }
        }
      }
      const Clock::time_point wakeUp =
          resent ? deadline : std::min(deadline, start + limits.resendAfter);
      const auto wait =
          std::chrono::duration_cast<std::chrono::milliseconds>(wakeUp - now);
      pollfd watched{fd.Get(), POLLIN, 0};
      const int ready = ::poll(
          &watched, 1, static_cast<int>(std::max<long>(wait.count(), 0)) + 1);
      if (ready < 0) {
        if (errno == EINTR) {
          continue;
        }
        ZARK_PM_LOG_CALL("poll", ready, errno, "(hop probe)");
        return replies;
      }
      if (ready == 0) {
        continue;
      }
      if ((watched.revents & POLLERR) != 0) {
        ReadErrors(fd.Get(), destination, maxTtl, limits.basePort, replies);
      }
      if ((watched.revents & POLLIN) != 0) {
        // Something on the way answered a probe with UDP: not a hop
        // answer; drain it so that poll does not spin.
        char discard[512];
        while (::recv(fd.Get(), discard, sizeof(discard), MSG_DONTWAIT) >= 0) {
        }
      }
      if (HopsSettled(replies)) {
        return replies;
      }
    }
  }

private:
  // Sends the probe of ttl. An ICMP error received earlier is also
  // reported by the next send (the socket's pending error), which then
  // sends nothing; one more try sends it.
  static bool Send(int fd, uint32_t destination, int ttl, uint16_t basePort) {
    if (::setsockopt(fd, IPPROTO_IP, IP_TTL, &ttl, sizeof(ttl)) != 0) {
      ZARK_PM_LOG_CALL("setsockopt(IP_TTL)", -1, errno);
      return false;
    }
    sockaddr_in target{};
    target.sin_family = AF_INET;
    target.sin_port = htons(static_cast<uint16_t>(basePort + ttl));
    target.sin_addr.s_addr = htonl(destination);
    static const char kPayload[] = "zark-hop";
    for (int attempt = 0; attempt < 2; ++attempt) {
      const ssize_t sent =
          ::sendto(fd, kPayload, sizeof(kPayload) - 1, 0,
                   reinterpret_cast<const sockaddr *>(&target), sizeof(target));
      if (sent >= 0) {
        return true;
      }
      const int saved = errno;
      if (attempt == 1 ||
          (saved != ECONNREFUSED && saved != EHOSTUNREACH &&
           saved != ENETUNREACH && saved != EPROTO && saved != EHOSTDOWN)) {
        ZARK_PM_LOG_CALL(
            "sendto", sent, saved,
            ("(hop probe, TTL " + std::to_string(ttl) + ")").c_str());
        return false;
      }
    }
    return false;
  }

  // Reads every queued ICMP error. The error queue hands over, per error,
  // the original datagram's destination (msg_name: its port tells the TTL)
  // and a sock_extended_err whose offender is the ICMP sender.
  static void ReadErrors(int fd, uint32_t destination, int maxTtl,
                         uint16_t basePort, std::vector<HopReply> &replies) {
    // Bounded: the queue holds at most the answers to 2 * maxTtl probes,
    // and the socket's receive buffer caps it further.
    for (int read = 0; read < 4 * maxTtl; ++read) {
      sockaddr_in original{};
      char payload[64];
      alignas(cmsghdr) char control[512];
      iovec vector{payload, sizeof(payload)};
      msghdr message{};
      message.msg_name = &original;
      message.msg_namelen = sizeof(original);
      message.msg_iov = &vector;
      message.msg_iovlen = 1;
      message.msg_control = control;
      message.msg_controllen = sizeof(control);
      if (::recvmsg(fd, &message, MSG_ERRQUEUE | MSG_DONTWAIT) < 0) {
        if (errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR) {
          ZARK_PM_LOG_CALL("recvmsg(MSG_ERRQUEUE)", -1, errno);
        }
        // Reading the queue clears the socket's pending error as it
        // empties; clear it here too, so that poll does not keep
        // reporting an error that has no queued answer.
        int pending = 0;
        socklen_t length = sizeof(pending);
        (void)::getsockopt(fd, SOL_SOCKET, SO_ERROR, &pending, &length);
        return;
      }
      const int ttl = static_cast<int>(ntohs(original.sin_port)) -
                      static_cast<int>(basePort);
      if (original.sin_family != AF_INET ||
          ntohl(original.sin_addr.s_addr) != destination || ttl < 1 ||
          ttl > maxTtl) {
        continue;
      }
      for (cmsghdr *header = CMSG_FIRSTHDR(&message); header != nullptr;
           header = CMSG_NXTHDR(&message, header)) {
        if (header->cmsg_level != SOL_IP || header->cmsg_type != IP_RECVERR) {
          continue;
        }
        const auto *error =
            reinterpret_cast<const sock_extended_err *>(CMSG_DATA(header));
        if (error->ee_origin != SO_EE_ORIGIN_ICMP) {
          continue; // a local error (message too long ...), not an answer
        }
        const auto *offender =
            reinterpret_cast<const sockaddr_in *>(SO_EE_OFFENDER(error));
        if (offender->sin_family != AF_INET) {
          continue;
        }
        HopReply reply;
        reply.ttl = ttl;
        reply.responder = ntohl(offender->sin_addr.s_addr);
        reply.destination = error->ee_type == ICMP_DEST_UNREACH &&
                            reply.responder == destination;
        replies.push_back(reply);
      }
    }
  }
};

} // namespace

std::unique_ptr<HopProber> MakeUdpHopProber() {
  return std::make_unique<UdpHopProber>();
}

bool HopsSettled(std::span<const HopReply> replies) {
  const std::map<int, HopReply> byTtl = ByTtl(replies);
  std::optional<int> end = FirstPublicTtl(byTtl);
  if (!end) {
    end = DestinationTtl(byTtl);
  }
  return end && AllAnsweredBelow(byTtl, *end);
}

HopsFinding InterpretHops(std::span<const HopReply> replies, int maxTtl) {
  HopsFinding finding;
  const std::map<int, HopReply> byTtl = ByTtl(replies);
  std::optional<int> firstPublic = FirstPublicTtl(byTtl);
  const int shownUpTo =
      firstPublic ? *firstPublic
                  : std::max(maxTtl, byTtl.empty() ? 0 : byTtl.rbegin()->first);
  for (int ttl = 1; ttl <= shownUpTo; ++ttl) {
    if (!finding.path.empty()) {
      finding.path += ", ";
    }
    finding.path += std::to_string(ttl) + " ";
    auto found = byTtl.find(ttl);
    if (found == byTtl.end()) {
      finding.path += "*";
      continue;
    }
    finding.path += FormatIpv4(found->second.responder);
    if (found->second.destination) {
      finding.path += " (destination)";
    }
    if (ClassifyIpv4(found->second.responder) == Ipv4Class::kSharedCgn &&
        (!firstPublic || ttl < *firstPublic)) {
      finding.carrierGradeNat = true;
    }
  }
  if (!firstPublic) {
    finding.why = byTtl.empty() ? "no hop answered within " +
                                      std::to_string(maxTtl) + " hops"
                                : "no public address answered within " +
                                      std::to_string(maxTtl) + " hops";
    return finding;
  }
  finding.known = true;
  finding.hops = *firstPublic - 1;
  finding.why = std::to_string(finding.hops) +
                " hop(s) before the first public address " +
                FormatIpv4(byTtl.at(*firstPublic).responder);
  return finding;
}

} // namespace zark::portmap
