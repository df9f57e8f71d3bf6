// Fuzz target of the probe service's request reading (probe/): the bytes of
// a connection to the service, read line by line by a server on 127.0.0.1
// in a private network namespace, whose connect-back only records what it
// was asked. Also checks that the service and the library's client
// (platform/portmap/src/probe_client.h) agree on the wire.
//
// Input: byte 0 chooses the mode (modulo 2), the rest is its input:
//   0  one request line for ParseRequestLine, and the library's reading of
//      the answers the service would give to it;
//   1  the bytes of a whole connection to the server.
//
// Besides not crashing, leaking or hanging:
// - a parsed request is written back (FormatRequest) to a line that parses
//   to the same request; the client library writes a check the same way
//   (ProbeCheckRequest);
// - the library reads every answer the service writes to the status it
//   stands for (FormatCheckAnswer, FormatBadRequestAnswer,
//   FormatErrorAnswer, FormatAddressAnswer);
// - over a connection: every answer line is one the library reads; there is
//   at most one answer per request line, plus one for a line that is too
//   long; every connect-back goes to the requester's own address
//   (127.0.0.1) for a request that was sent.
#include "connect_back.h"
#include "fuzz_support.h"
#include "probe_protocol.h"
#include "probe_server.h"
#include "reach/probe_client.h"
#include "syslog_capture.h"

#include <arpa/inet.h>
#include <netinet/in.h>

#include <cstddef>
#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

namespace {

using zark::fuzz::Require;
namespace probe = zark::probe;
namespace portmap = zark::portmap;

// Answers every check as unreachable and records where it would have gone.
class RecordingConnectBack final : public probe::ConnectBack {
public:
  [[nodiscard]] probe::Verdict Check(const sockaddr_storage &requester,
                                     socklen_t,
                                     const probe::Request &request) override {
    std::lock_guard lock(mMutex);
    mRequesters.push_back(probe::AddressText(requester, sizeof(requester)));
    mRequests.push_back(request);
    probe::Verdict verdict;
    verdict.result = probe::Result::kUnreachable;
    verdict.reason = probe::reason::kRefused;
    return verdict;
  }
  void Take(std::vector<std::string> &requesters,
            std::vector<probe::Request> &requests) {
    std::lock_guard lock(mMutex);
    requesters.swap(mRequesters);
    requests.swap(mRequests);
    mRequesters.clear();
    mRequests.clear();
  }

private:
  std::mutex mMutex;
  std::vector<std::string> mRequesters;
  std::vector<probe::Request> mRequests;
};

struct Service {
  RecordingConnectBack connectBack;
  std::unique_ptr<probe::ProbeServer> server;
  uint16_t port = 0;
};
Service *gService = nullptr;

portmap::ProbeAnswer ReadAnswer(const std::string &line) {
  Require(!line.empty() && line.back() == '\n', "an answer without newline");
  const std::optional<portmap::ProbeAnswer> answer = portmap::ParseProbeAnswer(
      std::string_view(line).substr(0, line.size() - 1));
  Require(answer.has_value(), "the library cannot read the answer " + line);
  return *answer;
}

void CheckLine(std::string_view line) {
  const probe::ParsedRequest parsed = probe::ParseRequestLine(line);
  Require(probe::ParseErrorName(parsed.error) != nullptr, "an unnamed error");
  if (parsed.error != probe::ParseError::kNone) {
    const portmap::ProbeAnswer refused =
        ReadAnswer(probe::FormatBadRequestAnswer(parsed.error));
    Require(refused.status == portmap::ProbeStatus::kRefused,
            "a bad-request answer read as another status");
    return;
  }
  const probe::Request &request = parsed.request;
  const std::string written = probe::FormatRequest(request);
  Require(!written.empty() && written.back() == '\n',
          "a request written without newline");
  const probe::ParsedRequest again = probe::ParseRequestLine(
      std::string_view(written).substr(0, written.size() - 1));
  Require(again.error == probe::ParseError::kNone && again.request == request,
          "a written request reads back different: " + written);
  if (request.kind == probe::Request::Kind::kCheck) {
    Require(request.port != 0, "a check of port 0");
    Require(request.token.empty() || probe::IsValidToken(request.token),
            "a check with an invalid token");
    const portmap::IpProtocol protocol =
        request.transport == probe::Transport::kTcp ? portmap::IpProtocol::kTcp
                                                    : portmap::IpProtocol::kUdp;
    Require(portmap::ProbeCheckRequest(protocol, request.port, request.token) ==
                written,
            "the library writes this check differently: " + written);
    const struct {
      probe::Result result;
      portmap::ProbeStatus status;
    } kVerdicts[] = {
        {probe::Result::kReachable, portmap::ProbeStatus::kReachable},
        {probe::Result::kUnreachable, portmap::ProbeStatus::kUnreachable},
        {probe::Result::kUnknown, portmap::ProbeStatus::kUnknown},
    };
    for (const auto &verdict : kVerdicts) {
      const portmap::ProbeAnswer answer = ReadAnswer(probe::FormatCheckAnswer(
          request, probe::Verdict{verdict.result, probe::reason::kTimeout}));
      Require(answer.status == verdict.status,
              "a check answer read as another status");
    }
  } else {
    const portmap::ProbeAnswer address =
        ReadAnswer(probe::FormatAddressAnswer("203.0.113.5"));
    Require(address.status == portmap::ProbeStatus::kAddress &&
                address.address == "203.0.113.5",
            "an address answer read wrong");
  }
  const long long wait = static_cast<long long>(line.size()) * 7;
  const portmap::ProbeAnswer limited =
      ReadAnswer(probe::FormatErrorAnswer(probe::reason::kRateLimited, wait));
  Require(limited.status == portmap::ProbeStatus::kRateLimited &&
              limited.retryAfterMs == wait,
          "a rate-limited answer read wrong");
}

void CheckConnection(std::string_view bytes) {
  const std::string replies =
      zark::fuzz::ExchangeOverTcp(gService->port, bytes, 1 << 16, 10000);
  std::vector<std::string> requesters;
  std::vector<probe::Request> checked;
  gService->connectBack.Take(requesters, checked);

  std::size_t lines = 0;
  for (char c : bytes) {
    lines += c == '\n';
  }
  std::size_t answers = 0;
  zark::fuzz::InputReader reader(replies);
  while (!reader.Empty()) {
    const std::string line(reader.Piece("\n"));
    (void)ReadAnswer(line + "\n");
    ++answers;
  }
  Require(answers <= lines + 1, "more answers than request lines");
  Require(checked.size() <= lines, "more checks than request lines");
  for (std::size_t i = 0; i < checked.size(); ++i) {
    Require(requesters[i] == "127.0.0.1", "a connect-back to " + requesters[i]);
    // The service cannot make up a port or a token: both were sent.
    Require(std::string_view(bytes).find(std::to_string(checked[i].port)) !=
                    std::string_view::npos &&
                std::string_view(bytes).find(checked[i].token) !=
                    std::string_view::npos,
            "a check for a request that was not sent");
  }
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int *, char ***) {
  zark::fuzz::EnterPrivateNetworkOrDie();
  static Service service;
  probe::ServerOptions options;
  options.listen = {"127.0.0.1:0"};
  // Limits out of the way: every input starts alike.
  options.ratePerSecond = 1e9;
  options.burst = 1e9;
  options.idleTimeout = std::chrono::milliseconds(3000);
  service.server =
      std::make_unique<probe::ProbeServer>(options, service.connectBack);
  std::string error;
  if (!service.server->Start(error)) {
    std::fprintf(stderr, "the probe service cannot start: %s\n", error.c_str());
    std::abort();
  }
  service.port = service.server->Ports().at(0);
  gService = &service;
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  // Log lines are captured (tests/support/syslog_capture.h); keep only
  // this input's.
  zark::test::ClearLogs();
  zark::fuzz::InputReader input(zark::fuzz::AsText(data, size));
  if (input.Byte() % 2 == 0) {
    CheckLine(input.Rest());
  } else {
    CheckConnection(input.Rest());
  }
  return 0;
}
