#include "detect/dns_probe.h"

#include "klibc_text.h"

#include "base/local_network.h"
#include "base/portmap_log.h"

#include <ares.h>
#include <arpa/inet.h>
#include <arpa/nameser.h>
#include <netinet/in.h>
#include <poll.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <mutex>

namespace zark::portmap {

namespace {

using Clock = std::chrono::steady_clock;

// Our names of the reply codes are <arpa/nameser.h>'s.
constexpr bool SameRcode(DnsRcode ours, int nameser) {
  return static_cast<int>(ours) == nameser;
}
static_assert(SameRcode(kDnsNoError, ns_r_noerror) &&
              SameRcode(kDnsFormatError, ns_r_formerr) &&
              SameRcode(kDnsServerFailure, ns_r_servfail) &&
              SameRcode(kDnsNameError, ns_r_nxdomain) &&
              SameRcode(kDnsNotImplemented, ns_r_notimpl) &&
              SameRcode(kDnsRefused, ns_r_refused));

constexpr std::size_t kMaxNameText = 253;
constexpr std::size_t kMaxLabel = 63;
// More A records than a 512-byte reply can hold.
constexpr int kMaxAddresses = 64;

std::string ErrnoText(int error) {
  char buffer[128];
  // The GNU strerror_r returns the text, which may or may not be in buffer.
  return strerror_r(error, buffer, sizeof(buffer));
}

int Rank(DnsOutcome outcome) {
  switch (outcome) {
  case DnsOutcome::kAnswered:
    return 5;
  case DnsOutcome::kNameError:
    return 4;
  case DnsOutcome::kNoAddress:
    return 3;
  case DnsOutcome::kServerError:
    return 2;
  case DnsOutcome::kNoAnswer:
    return 1;
  case DnsOutcome::kFailed:
    return 0;
  }
  return 0;
}

// The RCODE c-ares turned into status (ares_query's callback), or the
// reply's own when c-ares left an unusual one as ARES_SUCCESS.
int ReplyRcode(int status, std::span<const uint8_t> reply) {
  if (reply.size() >= sizeof(HEADER)) {
    HEADER header;
    std::memcpy(&header, reply.data(), sizeof(header));
    return header.rcode;
  }
  switch (status) {
  case ARES_EFORMERR:
    return ns_r_formerr;
  case ARES_ESERVFAIL:
    return ns_r_servfail;
  case ARES_ENOTFOUND:
    return ns_r_nxdomain;
  case ARES_ENOTIMP:
    return ns_r_notimpl;
  case ARES_EREFUSED:
    return ns_r_refused;
  default:
    return ns_r_noerror;
  }
}

// ares_library_init once per process, whichever thread gets here first.
int AresLibraryStatus() {
  static std::once_flag once;
  static int status = ARES_SUCCESS;
  std::call_once(once, [] { status = ares_library_init(ARES_LIB_INIT_ALL); });
  return status;
}

struct AresChannelDeleter {
  void operator()(ares_channeldata *channel) const { ares_destroy(channel); }
};
// Destroying the channel ends its queries: their callbacks run with
// ARES_EDESTRUCTION before it returns.
using AresChannel = std::unique_ptr<ares_channeldata, AresChannelDeleter>;

// "a.b.c.d:port" or "[v6]:port", as ares_set_servers_ports_csv reads it;
// empty when server is not an address.
std::string ServerCsv(const std::string &server, uint16_t port) {
  in_addr v4{};
  in6_addr v6{};
  if (::inet_pton(AF_INET, server.c_str(), &v4) == 1) {
    return server + ":" + std::to_string(port);
  }
  if (::inet_pton(AF_INET6, server.c_str(), &v6) == 1) {
    return "[" + server + "]:" + std::to_string(port);
  }
  return {};
}

class UdpDnsClient final : public DnsClient {
public:
  explicit UdpDnsClient(DnsClientOptions options) : mOptions(options) {}

  DnsLookup Lookup(std::span<const std::string> servers, std::string_view name,
                   std::chrono::milliseconds budget) override {
    DnsLookup best;
    best.outcome = DnsOutcome::kFailed;
    best.why = "no query could be sent";
    if (!IsValidDnsName(name)) {
      best.why = "\"" + std::string(name) + "\" is not a valid name";
      ZARK_PM_LOG_ERROR("DNS probe: %s", best.why.c_str());
      return best;
    }
    if (const int status = AresLibraryStatus(); status != ARES_SUCCESS) {
      ZARK_PM_LOG_CALL("ares_library_init", status, 0, ares_strerror(status));
      return best;
    }
    const std::string nameText(name);
    std::vector<std::unique_ptr<Query>> queries;
    for (const std::string &server : servers) {
      auto query = std::make_unique<Query>();
      query->server = server;
      if (!Open(*query)) {
        continue;
      }
      ares_query(query->channel.get(), nameText.c_str(), ns_c_in, ns_t_a,
                 OnReply, query.get());
      queries.push_back(std::move(query));
    }
    if (queries.empty()) {
      return best;
    }
    best.outcome = DnsOutcome::kNoAnswer;
    best.why = "no name server answered within " +
               std::to_string(budget.count()) + " ms";

    const Clock::time_point deadline = Clock::now() + budget;
    for (;;) {
      std::vector<Query *> pending;
      for (const std::unique_ptr<Query> &query : queries) {
        if (!query->heard) {
          pending.push_back(query.get());
          continue;
        }
        if (query->counted) {
          continue;
        }
        query->counted = true;
        if (query->heard->outcome == DnsOutcome::kAnswered) {
          return *query->heard;
        }
        if (Rank(query->heard->outcome) > Rank(best.outcome)) {
          best = *query->heard;
        }
      }
      const Clock::time_point now = Clock::now();
      if (pending.empty() || now >= deadline) {
        return best; // the channels still asking are destroyed
      }
      if (!Wait(pending, deadline - now)) {
        return best;
      }
    }
  }

private:
  struct Query {
    std::string server;
    std::optional<DnsLookup> heard; // what the callback made of the end
    bool counted = false;
    // Last, so that it is destroyed first: its callbacks still find the
    // members above.
    AresChannel channel;
  };

  // ares_query's callback. c-ares calls it once per query: with the reply,
  // with the error that ended it, or with ARES_EDESTRUCTION when the budget
  // ran out and the channel is destroyed.
  static void OnReply(void *arg, int status, int, unsigned char *reply,
                      int length) {
    auto *query = static_cast<Query *>(arg);
    if (status == ARES_EDESTRUCTION) {
      return;
    }
    try {
      query->heard =
          ReadDnsAnswer(query->server, status,
                        reply == nullptr || length <= 0
                            ? std::span<const uint8_t>()
                            : std::span<const uint8_t>(
                                  reply, static_cast<std::size_t>(length)));
    } catch (...) {
      // Nothing may leave a C callback; an allocation failure here counts
      // as no answer from this server.
      query->heard.emplace();
      query->heard->outcome = DnsOutcome::kNoAnswer;
    }
  }

  // A channel that asks query.server alone, over UDP only, and reads no
  // system file: every setting c-ares would take from /etc/resolv.conf is
  // given, so that it does not open it.
  bool Open(Query &query) const {
    const std::string csv = ServerCsv(query.server, mOptions.port);
    if (csv.empty()) {
      ZARK_PM_LOG_ERROR("DNS probe: name server \"%s\" is not an address",
                        query.server.c_str());
      return false;
    }
    ares_options options{};
    options.flags = ARES_FLAG_IGNTC | ARES_FLAG_NOCHECKRESP |
                    ARES_FLAG_NOSEARCH | ARES_FLAG_NOALIASES;
    options.timeout = static_cast<int>(mOptions.resendAfter.count());
    options.tries = 2;
    options.ndots = 1;
    options.servers = nullptr;
    options.nservers = 0;
    options.domains = nullptr;
    options.ndomains = 0;
    options.sortlist = nullptr;
    options.nsort = 0;
    char lookups[] = "b"; // DNS only, no hosts file
    options.lookups = lookups;
    const int mask = ARES_OPT_FLAGS | ARES_OPT_TIMEOUTMS | ARES_OPT_TRIES |
                     ARES_OPT_NDOTS | ARES_OPT_SERVERS | ARES_OPT_DOMAINS |
                     ARES_OPT_SORTLIST | ARES_OPT_LOOKUPS | ARES_OPT_NOROTATE;
    ares_channel raw = nullptr;
    int status = ares_init_options(&raw, &options, mask);
    if (status != ARES_SUCCESS) {
      ZARK_PM_LOG_CALL(
          "ares_init_options", status, 0,
          ("(DNS probe) " + std::string(ares_strerror(status))).c_str());
      return false;
    }
    query.channel.reset(raw);
    status = ares_set_servers_ports_csv(raw, csv.c_str());
    if (status != ARES_SUCCESS) {
      ZARK_PM_LOG_CALL("ares_set_servers_ports_csv", status, 0,
                       ("(DNS probe, name server " + query.server + ") " +
                        ares_strerror(status))
                           .c_str());
      return false;
    }
    return true;
  }

  // Waits for the sockets of the pending queries, at most left (and no
  // longer than the first retry or timeout c-ares has planned), then lets
  // each channel read what came and act on its timers. False on a poll
  // failure (logged).
  static bool Wait(const std::vector<Query *> &pending, Clock::duration left) {
    const auto leftUs =
        std::chrono::duration_cast<std::chrono::microseconds>(left).count();
    timeval wait{static_cast<time_t>(leftUs / 1000000),
                 static_cast<suseconds_t>(leftUs % 1000000)};
    std::vector<pollfd> watched;
    std::vector<Query *> owners;
    for (Query *query : pending) {
      std::array<ares_socket_t, ARES_GETSOCK_MAXNUM> sockets{};
      const int bits = ares_getsock(query->channel.get(), sockets.data(),
                                    static_cast<int>(sockets.size()));
      for (int i = 0; i < ARES_GETSOCK_MAXNUM; ++i) {
        const short events =
            static_cast<short>((ARES_GETSOCK_READABLE(bits, i) ? POLLIN : 0) |
                               (ARES_GETSOCK_WRITABLE(bits, i) ? POLLOUT : 0));
        if (events != 0) {
          watched.push_back({sockets[static_cast<std::size_t>(i)], events, 0});
          owners.push_back(query);
        }
      }
      timeval until{};
      const timeval *next = ares_timeout(query->channel.get(), &wait, &until);
      wait = *next;
    }
    // Rounded up: waking before c-ares's timer is due would spin.
    const int waitMs =
        static_cast<int>(wait.tv_sec * 1000 + (wait.tv_usec + 999) / 1000);
    const int ready = ::poll(watched.data(), watched.size(), waitMs);
    if (ready < 0) {
      if (errno == EINTR) {
        return true;
      }
      ZARK_PM_LOG_CALL("poll", ready, errno, "(DNS probe)");
      return false;
    }
    std::vector<Query *> served;
    for (std::size_t i = 0; i < watched.size(); ++i) {
      if (watched[i].revents == 0) {
        continue;
      }
      // An error (an ICMP "port unreachable" on the connected socket) is
      // read as such by c-ares's receive.
      const bool readable = (watched[i].revents & ~POLLOUT) != 0;
      const bool writable = (watched[i].revents & POLLOUT) != 0;
      ares_process_fd(owners[i]->channel.get(),
                      readable ? watched[i].fd : ARES_SOCKET_BAD,
                      writable ? watched[i].fd : ARES_SOCKET_BAD);
      served.push_back(owners[i]);
    }
    for (Query *query : pending) {
      if (std::find(served.begin(), served.end(), query) == served.end()) {
        // Nothing to read: c-ares only resends or gives up what is due.
        ares_process_fd(query->channel.get(), ARES_SOCKET_BAD, ARES_SOCKET_BAD);
      }
    }
    return true;
  }

  DnsClientOptions mOptions;
};

} // namespace

std::vector<std::string> ParseResolvConf(std::string_view text) {
  std::vector<std::string> servers;
  while (!text.empty() && servers.size() < kMaxNameServers) {
    const std::size_t newline = text.find('\n');
    std::string_view line =
        klibc::Trim(text.substr(0, newline), klibc::kSpaceTabAndCr);
    text.remove_prefix(newline == std::string_view::npos ? text.size()
                                                         : newline + 1);
    constexpr std::string_view kKeyword = "nameserver";
    if (!line.starts_with(kKeyword) || line.size() == kKeyword.size() ||
        (line[kKeyword.size()] != ' ' && line[kKeyword.size()] != '\t')) {
      continue;
    }
    std::string_view value =
        klibc::Trim(line.substr(kKeyword.size()), klibc::kSpaceTabAndCr);
    value = value.substr(0, value.find_first_of(" \t#;"));
    if (value.find('\0') != std::string_view::npos) {
      continue;
    }
    const std::string address(value);
    in_addr v4{};
    in6_addr v6{};
    if (::inet_pton(AF_INET, address.c_str(), &v4) == 1 ||
        ::inet_pton(AF_INET6, address.c_str(), &v6) == 1) {
      servers.push_back(address);
    }
  }
  return servers;
}

bool IsValidDnsName(std::string_view name) {
  if (!name.empty() && name.back() == '.') {
    name.remove_suffix(1);
  }
  if (name.empty() || name.size() > kMaxNameText) {
    return false;
  }
  for (;;) {
    const std::size_t dot = name.find('.');
    const std::string_view label = name.substr(0, dot);
    if (label.empty() || label.size() > kMaxLabel ||
        std::any_of(label.begin(), label.end(), [](char c) {
          return static_cast<unsigned char>(c) <= 0x20 ||
                 static_cast<unsigned char>(c) >= 0x7F;
        })) {
      return false;
    }
    if (dot == std::string_view::npos) {
      return true;
    }
    name.remove_prefix(dot + 1);
  }
}

DnsLookup ReadDnsAnswer(std::string_view server, int status,
                        std::span<const uint8_t> reply) {
  DnsLookup heard;
  heard.server = std::string(server);
  heard.rcode = ReplyRcode(status, reply);
  if (status == ARES_SUCCESS && heard.rcode != ns_r_noerror) {
    // An RCODE that ares_query does not name (6..15) is still an error.
    status = ARES_ESERVFAIL;
  }
  int parsed = status;
  if (status == ARES_SUCCESS) {
    std::array<ares_addrttl, kMaxAddresses> records{};
    int count = kMaxAddresses;
    parsed = ares_parse_a_reply(reply.data(), static_cast<int>(reply.size()),
                                nullptr, records.data(), &count);
    if (parsed == ARES_EBADNAME) {
      parsed = ARES_EBADRESP; // a name in the reply that cannot be read
    }
    if (parsed == ARES_SUCCESS) {
      for (int i = 0; i < count; ++i) {
        heard.addresses.push_back(
            ntohl(records[static_cast<std::size_t>(i)].ipaddr.s_addr));
      }
    }
  }
  switch (parsed) {
  case ARES_SUCCESS:
  case ARES_ENODATA:
  case ARES_EBADRESP:
    if (!heard.addresses.empty()) {
      heard.outcome = DnsOutcome::kAnswered;
      heard.why =
          heard.server + " answered " + FormatIpv4(heard.addresses.front());
    } else {
      heard.outcome = DnsOutcome::kNoAddress;
      heard.why = heard.server + " answered without an address";
      if (parsed == ARES_EBADRESP) {
        heard.why += std::string(" (") + ares_strerror(parsed) + ")";
      }
    }
    break;
  case ARES_ENOTFOUND:
    heard.outcome = DnsOutcome::kNameError;
    heard.why = heard.server + " answered that the name does not exist";
    break;
  case ARES_EFORMERR:
  case ARES_ESERVFAIL:
  case ARES_ENOTIMP:
  case ARES_EREFUSED:
    heard.outcome = DnsOutcome::kServerError;
    heard.why =
        heard.server + " answered with error " + std::to_string(heard.rcode);
    break;
  case ARES_ECONNREFUSED:
    // c-ares's sockets are connected: an ICMP "port unreachable" for both
    // tries (or a send that failed) ends the query with this.
    heard.outcome = DnsOutcome::kServerError;
    heard.why = heard.server + ": " + ErrnoText(ECONNREFUSED);
    break;
  case ARES_ETIMEOUT:
  case ARES_ECANCELLED:
    heard.outcome = DnsOutcome::kNoAnswer;
    heard.why = heard.server + " did not answer";
    break;
  default:
    heard.outcome = DnsOutcome::kFailed;
    heard.why = heard.server + ": " + ares_strerror(parsed);
    break;
  }
  return heard;
}

const char *DnsOutcomeName(DnsOutcome outcome) {
  switch (outcome) {
  case DnsOutcome::kAnswered:
    return "answered";
  case DnsOutcome::kNoAddress:
    return "no address";
  case DnsOutcome::kNameError:
    return "no such name";
  case DnsOutcome::kServerError:
    return "server error";
  case DnsOutcome::kNoAnswer:
    return "no answer";
  case DnsOutcome::kFailed:
    return "failed";
  }
  return "failed";
}

std::unique_ptr<DnsClient> MakeUdpDnsClient(DnsClientOptions options) {
  return std::make_unique<UdpDnsClient>(options);
}

DnsCheck CheckDns(const std::optional<std::string> &resolvConf,
                  std::string_view name, DnsClient &client,
                  std::chrono::milliseconds budget) {
  DnsCheck check;
  if (!resolvConf) {
    check.why = std::string("cannot read ") + kResolvConfPath;
    return check;
  }
  const std::vector<std::string> servers = ParseResolvConf(*resolvConf);
  if (servers.empty()) {
    check.why =
        std::string("no name server is configured in ") + kResolvConfPath;
    return check;
  }
  DnsLookup lookup = client.Lookup(servers, name, budget);
  check.ok = lookup.outcome == DnsOutcome::kAnswered;
  check.why = "lookup of " + std::string(name) + ": " + lookup.why;
  return check;
}

} // namespace zark::portmap
