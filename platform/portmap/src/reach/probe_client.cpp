#include "reach/probe_client.h"

#include "base/library_config.h"
#include "base/portmap_log.h"
#include "base/strict_json.h"
#include "base/unique_fd.h"

#include <arpa/inet.h>
#include <netdb.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>

#include <json/json.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <exception>
#include <memory>
#include <thread>

namespace zark::portmap {
namespace {

using Clock = std::chrono::steady_clock;

// The longest answer line we read; the protocol's are under 120 bytes.
constexpr std::size_t kMaxAnswerLine = 512;
constexpr auto kCancelSlice = std::chrono::milliseconds(100);

std::optional<uint16_t> ParsePort(std::string_view text) {
  unsigned value = 0;
  auto [end, error] =
      std::from_chars(text.data(), text.data() + text.size(), value);
  if (text.empty() || error != std::errc() ||
      end != text.data() + text.size() || value < 1 || value > 65535) {
    return std::nullopt;
  }
  return static_cast<uint16_t>(value);
}

bool IsTokenText(std::string_view token) {
  if (token.size() > 64) {
    return false;
  }
  return std::all_of(token.begin(), token.end(), [](char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') ||
           (c >= '0' && c <= '9') || c == '-' || c == '_';
  });
}

ProbeAnswer Unavailable(std::string why) {
  ProbeAnswer answer;
  answer.status = ProbeStatus::kServiceUnavailable;
  answer.reason = std::move(why);
  return answer;
}

ProbeAnswer CancelledAnswer() {
  ProbeAnswer answer;
  answer.status = ProbeStatus::kCancelled;
  answer.reason = "cancelled";
  return answer;
}

ProbeAnswer BadAnswer(std::string why) {
  ProbeAnswer bad;
  bad.status = ProbeStatus::kBadAnswer;
  bad.reason = std::move(why);
  return bad;
}

// One connection to the probe service at where, for one request line and
// its answer line. Each step returns nothing when it succeeded and the
// answer to give otherwise.
class ProbeConnection {
public:
  ProbeConnection(UniqueFd fd, const std::string &where,
                  const std::function<bool()> &cancelled)
      : mFd(std::move(fd)), mWhere(where), mCancelled(cancelled) {}

  [[nodiscard]] std::optional<ProbeAnswer>
  Connect(const sockaddr_storage &address, socklen_t addressLength,
          std::chrono::milliseconds timeout) {
    const Clock::time_point deadline = Clock::now() + timeout;
    if (::connect(mFd.Get(), reinterpret_cast<const sockaddr *>(&address),
                  addressLength) == 0) {
      return std::nullopt;
    }
    if (errno != EINPROGRESS) {
      int saved = errno;
      ZARK_PM_LOG_CALL("connect", -1, saved, mWhere.c_str());
      return Unavailable("the probe service at " + mWhere +
                         " refuses connections (" + std::strerror(saved) + ")");
    }
    Waited ready = Wait(POLLOUT, deadline);
    if (ready == Waited::kCancelled) {
      return CancelledAnswer();
    }
    if (ready == Waited::kNotReady) {
      ZARK_PM_LOG_ERROR("the probe service at %s did not accept within %lld "
                        "ms",
                        mWhere.c_str(),
                        static_cast<long long>(timeout.count()));
      return Unavailable("the probe service at " + mWhere + " does not answer");
    }
    int error = 0;
    socklen_t length = sizeof(error);
    if (::getsockopt(mFd.Get(), SOL_SOCKET, SO_ERROR, &error, &length) != 0 ||
        error != 0) {
      ZARK_PM_LOG_CALL("connect", -1, error, mWhere.c_str());
      return Unavailable("the probe service at " + mWhere +
                         " refuses connections (" + std::strerror(error) + ")");
    }
    return std::nullopt;
  }

  [[nodiscard]] std::optional<ProbeAnswer>
  SendLine(std::string_view line, Clock::time_point deadline) {
    std::string_view pending = line;
    while (!pending.empty()) {
      ssize_t sent =
          ::send(mFd.Get(), pending.data(), pending.size(), MSG_NOSIGNAL);
      if (sent > 0) {
        pending.remove_prefix(static_cast<std::size_t>(sent));
        continue;
      }
      if (sent < 0 && errno != EAGAIN && errno != EINTR) {
        int saved = errno;
        ZARK_PM_LOG_CALL("send", -1, saved, mWhere.c_str());
        return Closed();
      }
      Waited ready = Wait(POLLOUT, deadline);
      if (ready == Waited::kCancelled) {
        return CancelledAnswer();
      }
      if (ready == Waited::kNotReady) {
        return Unavailable("the probe service at " + mWhere +
                           " does not take the request");
      }
    }
    return std::nullopt;
  }

  // Reads the answer to request up to its newline, into answerLine without
  // the newline; timeout is the one deadline was set with, for the log.
  [[nodiscard]] std::optional<ProbeAnswer>
  ReceiveLine(const std::string &request, Clock::time_point deadline,
              std::chrono::milliseconds timeout, std::string &answerLine) {
    for (;;) {
      std::size_t newline = answerLine.find('\n');
      if (newline != std::string::npos) {
        answerLine.resize(newline);
        return std::nullopt;
      }
      if (answerLine.size() > kMaxAnswerLine) {
        ZARK_PM_LOG_ERROR("the probe service at %s sent a line over %zu bytes",
                          mWhere.c_str(), kMaxAnswerLine);
        return BadAnswer("an answer line that is too long");
      }
      Waited ready = Wait(POLLIN, deadline);
      if (ready == Waited::kCancelled) {
        return CancelledAnswer();
      }
      if (ready == Waited::kNotReady) {
        ZARK_PM_LOG_ERROR("the probe service at %s did not answer \"%.*s\" "
                          "within %lld ms",
                          mWhere.c_str(), static_cast<int>(request.size() - 1),
                          request.c_str(),
                          static_cast<long long>(timeout.count()));
        return Unavailable("the probe service at " + mWhere +
                           " did not answer in time");
      }
      char buffer[256];
      ssize_t n = ::recv(mFd.Get(), buffer, sizeof(buffer), 0);
      if (n < 0) {
        if (errno == EAGAIN || errno == EINTR) {
          continue;
        }
        int saved = errno;
        ZARK_PM_LOG_CALL("recv", -1, saved, mWhere.c_str());
        return Closed();
      }
      if (n == 0) {
        ZARK_PM_LOG_ERROR("the probe service at %s closed the connection "
                          "without an answer",
                          mWhere.c_str());
        return Closed();
      }
      answerLine.append(buffer, static_cast<std::size_t>(n));
    }
  }

private:
  enum class Waited { kReady, kNotReady, kCancelled };

  // Waits in slices so that a cancellation is seen within 100 ms. kNotReady
  // when the deadline passed or poll failed.
  Waited Wait(short events, Clock::time_point deadline) {
    for (;;) {
      if (mCancelled && mCancelled()) {
        return Waited::kCancelled;
      }
      auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - Clock::now());
      if (left.count() <= 0) {
        return Waited::kNotReady;
      }
      left = std::min<std::chrono::milliseconds>(left, kCancelSlice);
      pollfd watched{mFd.Get(), events, 0};
      int ready = ::poll(&watched, 1, static_cast<int>(left.count()));
      if (ready > 0) {
        return Waited::kReady;
      }
      if (ready < 0 && errno != EINTR) {
        return Waited::kNotReady;
      }
    }
  }

  ProbeAnswer Closed() const {
    return Unavailable("the probe service at " + mWhere +
                       " closed the connection");
  }

  UniqueFd mFd;
  const std::string &mWhere;
  const std::function<bool()> &mCancelled;
};

// The answer that line, the service's answer to request, carries; a bad
// answer when it is not one of the protocol.
ProbeAnswer AnswerOfLine(const std::string &where, const std::string &request,
                         const std::string &answerLine) {
  std::optional<ProbeAnswer> answer = ParseProbeAnswer(answerLine);
  if (!answer) {
    ZARK_PM_LOG_ERROR("the probe service at %s answered \"%.200s\", which is "
                      "not an answer of its protocol",
                      where.c_str(), answerLine.c_str());
    return BadAnswer("an answer that is not understood");
  }
  if (answer->status == ProbeStatus::kRefused) {
    ZARK_PM_LOG_ERROR("the probe service at %s refused \"%.*s\": %s",
                      where.c_str(), static_cast<int>(request.size() - 1),
                      request.c_str(), answer->reason.c_str());
  }
  return *answer;
}

} // namespace

const char *ProbeStatusName(ProbeStatus status) {
  switch (status) {
  case ProbeStatus::kReachable:
    return "reachable";
  case ProbeStatus::kUnreachable:
    return "unreachable";
  case ProbeStatus::kUnknown:
    return "unknown";
  case ProbeStatus::kAddress:
    return "address";
  case ProbeStatus::kRateLimited:
    return "rate-limited";
  case ProbeStatus::kRefused:
    return "refused";
  case ProbeStatus::kServiceUnavailable:
    return "service unavailable";
  case ProbeStatus::kBadAnswer:
    return "bad answer";
  case ProbeStatus::kCancelled:
    return "cancelled";
  }
  return "unknown";
}

std::optional<ProbeEndpoint> ParseProbeServiceAddress(std::string_view text) {
  for (char c : text) {
    if (static_cast<unsigned char>(c) <= ' ' || c == 0x7f) {
      return std::nullopt;
    }
  }
  ProbeEndpoint endpoint;
  std::string_view portText;
  if (!text.empty() && text.front() == '[') {
    std::size_t close = text.find(']');
    if (close == std::string_view::npos || close + 1 >= text.size() ||
        text[close + 1] != ':') {
      return std::nullopt;
    }
    endpoint.host = std::string(text.substr(1, close - 1));
    portText = text.substr(close + 2);
    in6_addr probe6{};
    if (::inet_pton(AF_INET6, endpoint.host.c_str(), &probe6) != 1) {
      return std::nullopt;
    }
  } else {
    std::size_t colon = text.rfind(':');
    if (colon == std::string_view::npos ||
        text.find(':') != colon) { // a bare IPv6 address needs brackets
      return std::nullopt;
    }
    endpoint.host = std::string(text.substr(0, colon));
    portText = text.substr(colon + 1);
  }
  std::optional<uint16_t> port = ParsePort(portText);
  if (endpoint.host.empty() || !port) {
    return std::nullopt;
  }
  endpoint.port = *port;
  return endpoint;
}

std::optional<ProbeAnswer> ParseProbeAnswer(std::string_view line) noexcept {
  try {
    if (line.size() > kMaxAnswerLine) {
      return std::nullopt;
    }
    Json::Value root;
    std::string why;
    if (!ParseStrictJsonOrThrow(line, root, why, 4) || !root.isObject() ||
        !root["result"].isString()) {
      return std::nullopt;
    }
    auto text = [&](const char *key) -> std::optional<std::string> {
      const Json::Value &value = root[key];
      if (value.isNull()) {
        return std::string();
      }
      if (!value.isString()) {
        return std::nullopt;
      }
      return value.asString();
    };
    std::optional<std::string> reason = text("reason");
    std::optional<std::string> address = text("address");
    if (!reason || !address) {
      return std::nullopt;
    }
    ProbeAnswer answer;
    answer.reason = *reason;
    const std::string result = root["result"].asString();
    if (result == "reachable") {
      answer.status = ProbeStatus::kReachable;
    } else if (result == "unreachable") {
      answer.status = ProbeStatus::kUnreachable;
    } else if (result == "unknown") {
      answer.status = ProbeStatus::kUnknown;
    } else if (result == "address") {
      if (address->empty()) {
        return std::nullopt;
      }
      answer.status = ProbeStatus::kAddress;
      answer.address = *address;
    } else if (result == "error") {
      if (answer.reason.empty()) {
        return std::nullopt;
      }
      if (answer.reason == "rate-limited") {
        answer.status = ProbeStatus::kRateLimited;
        const Json::Value &retry = root["retry_after_ms"];
        if (!retry.isNull()) {
          if (!retry.isInt() || retry.asInt() < 0) {
            return std::nullopt;
          }
          answer.retryAfterMs = retry.asInt();
        }
      } else {
        answer.status = ProbeStatus::kRefused;
        std::optional<std::string> detail = text("detail");
        if (detail && !detail->empty()) {
          answer.reason += ": " + *detail;
        }
      }
    } else {
      return std::nullopt;
    }
    return answer;
  } catch (const std::exception &) {
    return std::nullopt;
  }
}

std::string ProbeCheckRequest(IpProtocol protocol, uint16_t port,
                              std::string_view token) {
  std::string line = "check ";
  line += ProtocolText(protocol);
  line += ' ';
  line += std::to_string(port);
  if (!token.empty()) {
    line += ' ';
    line += token;
  }
  line += '\n';
  return line;
}

ProbeClient::ProbeClient(ProbeEndpoint endpoint, ProbeClientOptions options)
    : mEndpoint(std::move(endpoint)), mOptions(std::move(options)) {
  addrinfo hints{};
  hints.ai_family = AF_UNSPEC;
  hints.ai_socktype = SOCK_STREAM;
  hints.ai_flags = AI_NUMERICSERV;
  addrinfo *found = nullptr;
  const std::string port = std::to_string(mEndpoint.port);
  int rc = ::getaddrinfo(mEndpoint.host.c_str(), port.c_str(), &hints, &found);
  if (rc != 0 || found == nullptr) {
    ZARK_PM_LOG_ERROR("cannot resolve the probe service %s: getaddrinfo "
                      "rc=%d (%s)",
                      mEndpoint.host.c_str(), rc, ::gai_strerror(rc));
    return;
  }
  std::unique_ptr<addrinfo, decltype(&::freeaddrinfo)> owned(found,
                                                             ::freeaddrinfo);
  // The first address; a probe service has one.
  if (found->ai_addrlen <= sizeof(mAddress)) {
    std::memcpy(&mAddress, found->ai_addr, found->ai_addrlen);
    mAddressLength = found->ai_addrlen;
    mResolved = true;
  }
}

bool ProbeClient::Cancelled() const {
  return mOptions.cancelled && mOptions.cancelled();
}

ProbeAnswer ProbeClient::Check(IpProtocol protocol, uint16_t port,
                               std::string_view token) {
  if (port == 0 || !IsTokenText(token)) {
    ProbeAnswer answer;
    answer.status = ProbeStatus::kRefused;
    answer.reason = "not a valid check";
    return answer;
  }
  return Exchange(ProbeCheckRequest(protocol, port, token));
}

ProbeAnswer ProbeClient::AskAddress() {
  return Exchange("address\n");
}

ProbeAnswer ProbeClient::Exchange(const std::string &line) {
  ProbeAnswer answer;
  for (int attempt = 0;; ++attempt) {
    answer = ExchangeOnce(line);
    // "busy": the service holds as many connections from us as it takes;
    // one of ours ends soon, so try again shortly, like a rate limit.
    const bool busy =
        answer.status == ProbeStatus::kRefused && answer.reason == "busy";
    if ((answer.status != ProbeStatus::kRateLimited && !busy) ||
        attempt >= mOptions.rateLimitRetries) {
      return answer;
    }
    auto wait = std::chrono::milliseconds(
        answer.retryAfterMs >= 0 ? answer.retryAfterMs : (busy ? 250 : 1000));
    wait = std::min(wait, mOptions.maxRetryWait);
    const Clock::time_point until = Clock::now() + wait;
    while (Clock::now() < until) {
      if (Cancelled()) {
        answer.status = ProbeStatus::kCancelled;
        answer.reason = "cancelled";
        return answer;
      }
      std::this_thread::sleep_for(
          std::min<Clock::duration>(kCancelSlice, until - Clock::now()));
    }
  }
}

ProbeAnswer ProbeClient::ExchangeOnce(const std::string &line) {
  if (!mResolved) {
    return Unavailable("the probe service " + mEndpoint.host +
                       " cannot be resolved");
  }
  const std::string where =
      mEndpoint.host + ":" + std::to_string(mEndpoint.port);
  UniqueFd fd(::socket(mAddress.ss_family,
                       SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  if (!fd.Valid()) {
    int saved = errno;
    ZARK_PM_LOG_CALL("socket", -1, saved, where.c_str());
    return Unavailable("no socket for the probe service");
  }
  ProbeConnection connection(std::move(fd), where, mOptions.cancelled);
  if (std::optional<ProbeAnswer> failed = connection.Connect(
          mAddress, mAddressLength, mOptions.connectTimeout)) {
    return *failed;
  }
  const Clock::time_point deadline = Clock::now() + mOptions.answerTimeout;
  if (std::optional<ProbeAnswer> failed = connection.SendLine(line, deadline)) {
    return *failed;
  }
  std::string answerLine;
  if (std::optional<ProbeAnswer> failed = connection.ReceiveLine(
          line, deadline, mOptions.answerTimeout, answerLine)) {
    return *failed;
  }
  return AnswerOfLine(where, line, answerLine);
}

std::unique_ptr<ProbeClient> ConfiguredProbeClient(std::string &why,
                                                   ProbeClientOptions options) {
  const std::string text =
      GetLibraryConfig(config_key::kProbeServiceAddress, "");
  if (text.empty()) {
    why = kNoProbeServiceText;
    return nullptr;
  }
  std::optional<ProbeEndpoint> endpoint = ParseProbeServiceAddress(text);
  if (!endpoint) {
    why = "probe service address \"" + text + "\" is not host:port";
    ZARK_PM_LOG_ERROR("%s", why.c_str());
    return nullptr;
  }
  auto client = std::make_unique<ProbeClient>(*endpoint, std::move(options));
  if (!client->Usable()) {
    why = "cannot resolve the probe service " + endpoint->host;
    return nullptr;
  }
  return client;
}

std::optional<uint32_t>
ExternalAddressFromProbeService(const std::string &serviceAddress) {
  std::optional<ProbeEndpoint> endpoint =
      ParseProbeServiceAddress(serviceAddress);
  if (!endpoint) {
    ZARK_PM_LOG_ERROR("probe service address \"%s\" is not host:port",
                      serviceAddress.c_str());
    return std::nullopt;
  }
  ProbeClient client(*endpoint);
  ProbeAnswer answer = client.AskAddress();
  if (answer.status != ProbeStatus::kAddress) {
    ZARK_PM_LOG_ERROR("the probe service %s did not tell our address: %s "
                      "(%s)",
                      serviceAddress.c_str(), ProbeStatusName(answer.status),
                      answer.reason.c_str());
    return std::nullopt;
  }
  in_addr address{};
  if (::inet_pton(AF_INET, answer.address.c_str(), &address) != 1) {
    ZARK_PM_LOG_ERROR("the probe service %s sees us from %s, not an IPv4 "
                      "address",
                      serviceAddress.c_str(), answer.address.c_str());
    return std::nullopt;
  }
  return ntohl(address.s_addr);
}

} // namespace zark::portmap
