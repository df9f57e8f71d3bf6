// Fuzz target of the host's HTTP side (host/http_server.h over
// cpp-httplib): the raw bytes of a connection, as a browser or anything
// else on the network could send them, to a host listening on 127.0.0.1 in
// a private network namespace, with the fuzz module loaded (fuzz_host.h).
// "@ID@" and "@TOKEN@" in the input are replaced by the administrator
// session's id and token, so that inputs can reach the module's methods.
//
// Besides not crashing, leaking or hanging:
// - every reply starts with an HTTP/1.1 status line (only the first is
//   looked at when a HEAD request was sent);
// - every reply of the API (a JSON body) with status 200, 413 or 431 has
//   the wire protocol's shape (CheckHostAnswer);
// - without the administrator's token in the input no method succeeds.
#include "fuzz_host.h"
#include "fuzz_support.h"
#include "http_server.h"
#include "syslog_capture.h"
#include "webapi.h"

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>
#include <thread>

namespace {

using zark::fuzz::Require;

// The one host of the process; its server thread serves every input.
struct Served {
  zark::fuzz::FuzzHost host;
  std::unique_ptr<zark::host::HttpServer> server;
  std::thread thread;
};
Served *gServed = nullptr;

std::string Replace(std::string text, std::string_view from,
                    const std::string &to) {
  for (std::size_t at = text.find(from); at != std::string::npos;
       at = text.find(from, at + to.size())) {
    text.replace(at, from.size(), to);
  }
  return text;
}

// Checks each reply of a connection, one after another. A reply to HEAD
// announces a Content-Length but carries no body, so after a HEAD request
// (bodiesFollow false) the replies cannot be told apart: only the first
// is looked at.
void CheckReplies(std::string_view replies, bool mayHaveSession,
                  bool bodiesFollow) {
  while (!replies.empty()) {
    Require(replies.substr(0, 9) == "HTTP/1.1 ",
            "a reply without a status line: " +
                std::string(replies.substr(0, 40)));
    if (!bodiesFollow) {
      return;
    }
    const std::size_t headEnd = replies.find("\r\n\r\n");
    if (headEnd == std::string_view::npos) {
      return; // cut short by the bound on what is read
    }
    const std::string_view head = replies.substr(0, headEnd);
    const int status = std::atoi(std::string(head.substr(9, 3)).c_str());
    std::size_t length = 0;
    const std::size_t at = head.find("Content-Length: ");
    if (at != std::string_view::npos) {
      length = std::strtoul(std::string(head.substr(at + 16, 20)).c_str(),
                            nullptr, 10);
    }
    const std::string_view body = replies.substr(headEnd + 4, length);
    if (head.find("Content-Type: application/json") != std::string_view::npos &&
        (status == 200 || status == 413 || status == 431) &&
        body.size() == length) {
      Json::CharReaderBuilder builder;
      const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
      Json::Value answer;
      std::string errors;
      Require(reader->parse(body.data(), body.data() + body.size(), &answer,
                            &errors),
              "an API reply that is not JSON: " + errors);
      zark::fuzz::CheckHostAnswer(status, answer);
      if (answer["success"].asBool() && answer["data"].isMember("params")) {
        Require(mayHaveSession, "a method ran without the session's token");
      }
    }
    if (headEnd + 4 + length >= replies.size()) {
      return;
    }
    replies.remove_prefix(headEnd + 4 + length);
  }
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int *, char ***) {
  zark::fuzz::EnterHermeticOrDie();
  zark::fuzz::EnterPrivateNetworkOrDie();
  zark::fuzz::FuzzHost::Prepare();
  // The task registry of the host framework is a static of its own; made
  // before ours, it is destroyed after ours, whose destructor still stops
  // and joins tasks.
  ZARK::APIPolling::JoinAll();
  static Served served;
  zark::host::HttpOptions options;
  options.address = "127.0.0.1";
  options.port = 0;
  options.threads = 2;
  options.readTimeout = std::chrono::seconds(2);
  options.writeTimeout = std::chrono::seconds(2);
  served.server =
      std::make_unique<zark::host::HttpServer>(served.host.Handler(), options);
  if (!served.server->Bind()) {
    std::fprintf(stderr, "the fuzz host cannot listen\n");
    std::abort();
  }
  gServed = &served;
  served.thread = std::thread([] { gServed->server->Serve(); });
  std::atexit([] {
    gServed->server->Stop();
    gServed->thread.join();
  });
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  zark::test::ClearLogs();
  // An input may log out; the next one starts with fresh sessions.
  gServed->host.RenewSessions();
  const std::string raw(zark::fuzz::AsText(data, size));
  const zark::fuzz::HostSessions &sessions = gServed->host.Sessions();
  const bool mayHaveSession = raw.find("@TOKEN@") != std::string::npos;
  const std::string bytes = Replace(Replace(raw, "@ID@", sessions.admin.id),
                                    "@TOKEN@", sessions.admin.token);
  const std::string replies = zark::fuzz::ExchangeOverTcp(
      static_cast<uint16_t>(gServed->server->Port()), bytes, 1 << 20, 5000);
  CheckReplies(replies, mayHaveSession, raw.find("HEAD") == std::string::npos);
  return 0;
}
