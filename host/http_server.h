// The HTTP side of the host (cpp-httplib): routes the three endpoints to the
// RequestHandler, serves the front end's static files, and holds the
// connection bounds.
#ifndef ZARK_HOST_HTTP_SERVER_H
#define ZARK_HOST_HTTP_SERVER_H

#include "request_handler.h"

#include <atomic>
#include <chrono>
#include <cstddef>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

namespace httplib {
class Server;
}

namespace zark::host {

struct HttpOptions {
  std::string address = "127.0.0.1";
  int port = 5000; // 0: any free port (see Port)
  // The front end's files, served at "/". Empty, missing, or holding a
  // "webapi" entry (which would hide the API): a built-in page instead.
  std::filesystem::path wwwFolder;
  std::size_t threads = 8;
  std::chrono::seconds readTimeout{10};
  std::chrono::seconds writeTimeout{10};
  std::chrono::seconds keepAliveTimeout{5};
  std::size_t keepAliveMaxCount = 100;
  // Bounds every request body while it arrives, whatever its framing
  // (length, chunked, or read until the client closes).
  std::size_t maxBodyBytes = 64 * 1024;
  // A request body must have arrived whole this long after its headers.
  std::chrono::milliseconds bodyTimeout{20000};
  // Header lines of a request, and their names and values together.
  std::size_t maxHeaderCount = 64;
  std::size_t maxHeaderBytes = 16 * 1024;
  // Names the Host header may give besides address literals; empty: those
  // of LocalHostNames().
  std::vector<std::string> hostNames;
};

class HttpServer {
public:
  HttpServer(const RequestHandler &handler, HttpOptions options);
  ~HttpServer();
  HttpServer(const HttpServer &) = delete;
  HttpServer &operator=(const HttpServer &) = delete;

  // Binds the listening socket. False (logged) when the address is not
  // valid or the port is taken.
  [[nodiscard]] bool Bind();

  // The bound port (after Bind).
  [[nodiscard]] int Port() const { return mPort; }

  // Serves until Stop. Returns true when stopped by Stop, false when the
  // server failed (logged). Returns at once when Stop came first.
  bool Serve();

  // Ends Serve: no new connection is accepted, and Serve returns once the
  // requests being handled are answered. Safe from any thread, before,
  // during or after Serve.
  void Stop();

private:
  void Route();

  const RequestHandler &mHandler;
  const HttpOptions mOptions;
  std::unique_ptr<httplib::Server> mServer;
  int mPort = -1;
  std::atomic<bool> mServing{false};
  std::atomic<bool> mStopRequested{false};
};

// The page served at "/" when no front end is installed.
[[nodiscard]] std::string BuiltInPage();

} // namespace zark::host

#endif
