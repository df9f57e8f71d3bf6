#include "detect/dns_probe.h"

#include "base/local_network.h"
#include "base/portmap_log.h"
#include "base/unique_fd.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/random.h>
#include <sys/socket.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstring>

namespace zark::portmap {
namespace {

using Clock = std::chrono::steady_clock;

constexpr std::size_t kHeaderBytes = 12;
constexpr uint16_t kTypeA = 1;
constexpr uint16_t kClassIn = 1;
constexpr uint16_t kFlagResponse = 0x8000;
constexpr uint16_t kFlagTruncated = 0x0200;
constexpr uint16_t kFlagRecursionDesired = 0x0100;
constexpr uint16_t kOpcodeMask = 0x7800;
constexpr uint16_t kRcodeMask = 0x000F;
constexpr int kMaxPointers = 16;
constexpr std::size_t kMaxNameText = 253;
constexpr std::size_t kMaxReplyBytes = 4096;

std::string_view Trim(std::string_view text) {
  const std::size_t start = text.find_first_not_of(" \t\r");
  if (start == std::string_view::npos) {
    return {};
  }
  const std::size_t end = text.find_last_not_of(" \t\r");
  return text.substr(start, end - start + 1);
}

// The labels of a name, or nothing when it is not a valid one.
std::optional<std::vector<std::string_view>> Labels(std::string_view name) {
  if (!name.empty() && name.back() == '.') {
    name.remove_suffix(1);
  }
  if (name.empty() || name.size() > kMaxNameText) {
    return std::nullopt;
  }
  std::vector<std::string_view> labels;
  while (true) {
    const std::size_t dot = name.find('.');
    std::string_view label = name.substr(0, dot);
    if (label.empty() || label.size() > 63 ||
        std::any_of(label.begin(), label.end(), [](char c) {
          return static_cast<unsigned char>(c) <= 0x20 ||
                 static_cast<unsigned char>(c) >= 0x7F;
        })) {
      return std::nullopt;
    }
    labels.push_back(label);
    if (dot == std::string_view::npos) {
      break;
    }
    name.remove_prefix(dot + 1);
  }
  return labels;
}

uint16_t Get16(std::span<const uint8_t> bytes, std::size_t at) {
  return static_cast<uint16_t>((bytes[at] << 8) | bytes[at + 1]);
}

// Reads the name at offset (compression pointers followed, at most
// kMaxPointers, each strictly backwards) as lower-case dotted text; offset
// moves past the name as it is stored where it starts.
bool ReadName(std::span<const uint8_t> bytes, std::size_t &offset,
              std::string &name) {
  name.clear();
  std::size_t at = offset;
  bool jumped = false;
  int pointers = 0;
  for (;;) {
    if (at >= bytes.size()) {
      return false;
    }
    const uint8_t length = bytes[at];
    if ((length & 0xC0) == 0xC0) {
      if (at + 1 >= bytes.size() || ++pointers > kMaxPointers) {
        return false;
      }
      const std::size_t target = ((length & 0x3F) << 8) | bytes[at + 1];
      if (target >= at) {
        return false;
      }
      if (!jumped) {
        offset = at + 2;
        jumped = true;
      }
      at = target;
      continue;
    }
    if ((length & 0xC0) != 0) {
      return false; // the reserved label types 0x40 and 0x80
    }
    if (length == 0) {
      if (!jumped) {
        offset = at + 1;
      }
      return true;
    }
    if (at + 1 + length > bytes.size() ||
        name.size() + length + 1 > kMaxNameText + 1) {
      return false;
    }
    if (!name.empty()) {
      name += '.';
    }
    for (std::size_t i = 0; i < length; ++i) {
      name += static_cast<char>(
          std::tolower(static_cast<unsigned char>(bytes[at + 1 + i])));
    }
    at += 1 + length;
  }
}

std::string Lower(std::string_view text) {
  std::string lower(text);
  for (char &c : lower) {
    c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  }
  if (!lower.empty() && lower.back() == '.') {
    lower.pop_back();
  }
  return lower;
}

uint16_t RandomId() {
  uint16_t id = 0;
  if (::getrandom(&id, sizeof(id), GRND_NONBLOCK) != sizeof(id)) {
    // Without the kernel's randomness the id only has to differ from the
    // last run's; the clock does that.
    id = static_cast<uint16_t>(Clock::now().time_since_epoch().count());
  }
  return id;
}

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

class UdpDnsClient final : public DnsClient {
public:
  explicit UdpDnsClient(DnsClientOptions options) : mOptions(options) {}

  DnsLookup Lookup(std::span<const std::string> servers, std::string_view name,
                   std::chrono::milliseconds budget) override {
    DnsLookup best;
    best.outcome = DnsOutcome::kFailed;
    best.why = "no query could be sent";
    std::vector<Query> queries;
    for (const std::string &server : servers) {
      Query query;
      query.server = server;
      query.id = RandomId();
      query.packet = BuildDnsQuery(query.id, name);
      if (query.packet.empty()) {
        best.why = "\"" + std::string(name) + "\" is not a valid name";
        ZARK_PM_LOG_ERROR("DNS probe: %s", best.why.c_str());
        return best;
      }
      if (!Open(query)) {
        continue;
      }
      if (!Send(query)) {
        continue;
      }
      queries.push_back(std::move(query));
    }
    if (queries.empty()) {
      return best;
    }
    best.outcome = DnsOutcome::kNoAnswer;
    best.why = "no name server answered within " +
               std::to_string(budget.count()) + " ms";

    const Clock::time_point start = Clock::now();
    const Clock::time_point deadline = start + budget;
    bool resent = false;
    for (;;) {
      std::vector<pollfd> watched;
      std::vector<Query *> owners;
      for (Query &query : queries) {
        if (!query.done) {
          watched.push_back({query.fd.Get(), POLLIN, 0});
          owners.push_back(&query);
        }
      }
      const Clock::time_point now = Clock::now();
      if (watched.empty() || now >= deadline) {
        return best;
      }
      if (!resent && now >= start + mOptions.resendAfter) {
        resent = true;
        for (Query *query : owners) {
          (void)Send(*query);
        }
      }
      const Clock::time_point wakeUp =
          resent ? deadline : std::min(deadline, start + mOptions.resendAfter);
      const auto wait =
          std::chrono::duration_cast<std::chrono::milliseconds>(wakeUp - now);
      const int ready =
          ::poll(watched.data(), watched.size(),
                 static_cast<int>(std::max<long>(wait.count(), 0)) + 1);
      if (ready < 0) {
        if (errno == EINTR) {
          continue;
        }
        ZARK_PM_LOG_CALL("poll", ready, errno, "(DNS probe)");
        return best;
      }
      for (std::size_t i = 0; i < watched.size(); ++i) {
        if (watched[i].revents == 0) {
          continue;
        }
        Query &query = *owners[i];
        std::optional<DnsLookup> heard = Receive(query, name);
        if (!heard) {
          continue;
        }
        query.done = true;
        if (heard->outcome == DnsOutcome::kAnswered) {
          return *heard;
        }
        if (Rank(heard->outcome) > Rank(best.outcome)) {
          best = *heard;
        }
      }
    }
  }

private:
  struct Query {
    std::string server;
    UniqueFd fd;
    uint16_t id = 0;
    std::vector<uint8_t> packet;
    bool done = false;
  };

  // A UDP socket connected to the server: only the server's own replies
  // come in, and an ICMP "port unreachable" shows as ECONNREFUSED.
  bool Open(Query &query) const {
    sockaddr_storage address{};
    socklen_t length = 0;
    auto *v4 = reinterpret_cast<sockaddr_in *>(&address);
    auto *v6 = reinterpret_cast<sockaddr_in6 *>(&address);
    if (::inet_pton(AF_INET, query.server.c_str(), &v4->sin_addr) == 1) {
      v4->sin_family = AF_INET;
      v4->sin_port = htons(mOptions.port);
      length = sizeof(sockaddr_in);
    } else if (::inet_pton(AF_INET6, query.server.c_str(), &v6->sin6_addr) ==
               1) {
      v6->sin6_family = AF_INET6;
      v6->sin6_port = htons(mOptions.port);
      length = sizeof(sockaddr_in6);
    } else {
      ZARK_PM_LOG_ERROR("DNS probe: name server \"%s\" is not an address",
                        query.server.c_str());
      return false;
    }
    query.fd.Reset(::socket(address.ss_family,
                            SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    if (!query.fd.Valid()) {
      ZARK_PM_LOG_CALL("socket", -1, errno, "(DNS probe)");
      return false;
    }
    if (::connect(query.fd.Get(), reinterpret_cast<sockaddr *>(&address),
                  length) != 0) {
      ZARK_PM_LOG_CALL(
          "connect", -1, errno,
          ("(DNS probe, name server " + query.server + ")").c_str());
      return false;
    }
    return true;
  }

  static bool Send(Query &query) {
    const ssize_t sent = ::send(query.fd.Get(), query.packet.data(),
                                query.packet.size(), MSG_NOSIGNAL);
    if (sent != static_cast<ssize_t>(query.packet.size())) {
      ZARK_PM_LOG_CALL(
          "send", sent, errno,
          ("(DNS probe, name server " + query.server + ")").c_str());
      return false;
    }
    return true;
  }

  // One datagram from the server: nothing when it is not a reply to our
  // query (kept waiting for the real one), else what it says.
  static std::optional<DnsLookup> Receive(Query &query, std::string_view name) {
    uint8_t buffer[kMaxReplyBytes];
    const ssize_t got = ::recv(query.fd.Get(), buffer, sizeof(buffer), 0);
    DnsLookup heard;
    heard.server = query.server;
    if (got < 0) {
      if (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR) {
        return std::nullopt;
      }
      heard.outcome = DnsOutcome::kServerError;
      heard.why = query.server + ": " + ErrnoText(errno);
      return heard;
    }
    std::optional<DnsReply> reply = ParseDnsReply(
        std::span<const uint8_t>(buffer, static_cast<std::size_t>(got)),
        query.id, name);
    if (!reply) {
      ZARK_PM_LOG_ERROR("DNS probe: a datagram of %zd bytes from %s is not a "
                        "reply to our query; ignored",
                        got, query.server.c_str());
      return std::nullopt;
    }
    heard.rcode = reply->rcode;
    heard.addresses = reply->addresses;
    if (reply->rcode == kDnsNoError && !reply->addresses.empty()) {
      heard.outcome = DnsOutcome::kAnswered;
      heard.why =
          query.server + " answered " + FormatIpv4(reply->addresses.front());
    } else if (reply->rcode == kDnsNoError) {
      heard.outcome = DnsOutcome::kNoAddress;
      heard.why = query.server + " answered without an address";
    } else if (reply->rcode == kDnsNameError) {
      heard.outcome = DnsOutcome::kNameError;
      heard.why = query.server + " answered that the name does not exist";
    } else {
      heard.outcome = DnsOutcome::kServerError;
      heard.why =
          query.server + " answered with error " + std::to_string(reply->rcode);
    }
    return heard;
  }

  DnsClientOptions mOptions;
};

} // namespace

std::vector<std::string> ParseResolvConf(std::string_view text) {
  std::vector<std::string> servers;
  while (!text.empty() && servers.size() < kMaxNameServers) {
    const std::size_t newline = text.find('\n');
    std::string_view line = Trim(text.substr(0, newline));
    text.remove_prefix(newline == std::string_view::npos ? text.size()
                                                         : newline + 1);
    constexpr std::string_view kKeyword = "nameserver";
    if (!line.starts_with(kKeyword) || line.size() == kKeyword.size() ||
        (line[kKeyword.size()] != ' ' && line[kKeyword.size()] != '\t')) {
      continue;
    }
    std::string_view value = Trim(line.substr(kKeyword.size()));
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

std::vector<uint8_t> BuildDnsQuery(uint16_t id, std::string_view name) {
  std::optional<std::vector<std::string_view>> labels = Labels(name);
  if (!labels) {
    return {};
  }
  std::vector<uint8_t> packet = {
      static_cast<uint8_t>(id >> 8),
      static_cast<uint8_t>(id & 0xFF),
      static_cast<uint8_t>(kFlagRecursionDesired >> 8),
      0,
      0,
      1, // one question
      0,
      0,
      0,
      0,
      0,
      0,
  };
  for (std::string_view label : *labels) {
    packet.push_back(static_cast<uint8_t>(label.size()));
    packet.insert(packet.end(), label.begin(), label.end());
  }
  packet.push_back(0);
  packet.push_back(0);
  packet.push_back(kTypeA);
  packet.push_back(0);
  packet.push_back(kClassIn);
  return packet;
}

std::optional<DnsReply> ParseDnsReply(std::span<const uint8_t> bytes,
                                      uint16_t id, std::string_view name) {
  if (bytes.size() < kHeaderBytes || Get16(bytes, 0) != id) {
    return std::nullopt;
  }
  const uint16_t flags = Get16(bytes, 2);
  if ((flags & kFlagResponse) == 0 || (flags & kOpcodeMask) != 0 ||
      Get16(bytes, 4) != 1) {
    return std::nullopt;
  }
  DnsReply reply;
  reply.rcode = flags & kRcodeMask;
  reply.truncated = (flags & kFlagTruncated) != 0;
  const uint16_t answers = Get16(bytes, 6);

  std::size_t offset = kHeaderBytes;
  std::string asked;
  if (!ReadName(bytes, offset, asked) || asked != Lower(name) ||
      offset + 4 > bytes.size() || Get16(bytes, offset) != kTypeA ||
      Get16(bytes, offset + 2) != kClassIn) {
    return std::nullopt;
  }
  offset += 4;
  for (uint16_t i = 0; i < answers; ++i) {
    std::string owner;
    if (!ReadName(bytes, offset, owner) || offset + 10 > bytes.size()) {
      break; // a truncated answer section: keep what was whole
    }
    const uint16_t type = Get16(bytes, offset);
    const uint16_t klass = Get16(bytes, offset + 2);
    const uint16_t length = Get16(bytes, offset + 8);
    offset += 10;
    if (offset + length > bytes.size()) {
      break;
    }
    ++reply.answerRecords;
    if (type == kTypeA && klass == kClassIn && length == 4) {
      reply.addresses.push_back((uint32_t{bytes[offset]} << 24) |
                                (uint32_t{bytes[offset + 1]} << 16) |
                                (uint32_t{bytes[offset + 2]} << 8) |
                                uint32_t{bytes[offset + 3]});
    }
    offset += length;
  }
  return reply;
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
