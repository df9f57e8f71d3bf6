#include "http_server.h"

#include "host_log.h"
#include "request_guard.h"

#include "klibc_text.h"

#include <httplib.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <optional>
#include <system_error>
#include <thread>

namespace zark::host {
namespace {

constexpr const char *kJsonType = "application/json";
constexpr const char *kApiPattern = "/webapi/(entry|query|auth)\\.cgi";

Endpoint EndpointOf(const std::string &path) {
  if (path == "/webapi/query.cgi") {
    return Endpoint::Query;
  }
  if (path == "/webapi/auth.cgi") {
    return Endpoint::Auth;
  }
  return Endpoint::Entry;
}

std::string_view QueryOf(const std::string &target) {
  std::size_t mark = target.find('?');
  if (mark == std::string::npos) {
    return {};
  }
  return std::string_view(target).substr(mark + 1);
}

void SendJson(httplib::Response &response, int status,
              const Json::Value &body) {
  response.status = status;
  response.set_header("Cache-Control", "no-store");
  response.set_content(SerializeAnswer(body), kJsonType);
}

// The strings a WebRequest views, copied out of the library's request.
struct ReceivedRequest {
  std::string cookies;
  std::optional<std::string> token;
  std::string contentType;
  std::string body;
};

WebRequest ToWebRequest(const httplib::Request &request,
                        ReceivedRequest &received) {
  WebRequest web;
  web.endpoint = EndpointOf(request.path);
  web.query = QueryOf(request.target);
  web.clientAddress = request.remote_addr;
  for (const auto &[name, value] : request.headers) {
    web.headerBytes += name.size() + value.size();
  }
  const std::size_t cookieCount = request.get_header_value_count("Cookie");
  for (std::size_t i = 0; i < cookieCount; ++i) {
    if (i > 0) {
      received.cookies += "; ";
    }
    received.cookies += request.get_header_value("Cookie", i);
  }
  web.cookies = received.cookies;
  const std::string tokenHeader(kTokenHeader);
  if (request.has_header(tokenHeader)) {
    received.token = request.get_header_value(tokenHeader);
    web.token = *received.token;
  }
  return web;
}

void SendAnswer(httplib::Response &response, const WebAnswer &answer) {
  for (const auto &[name, value] : answer.headers) {
    response.set_header(name, value);
  }
  SendJson(response, answer.httpStatus, answer.body);
}

bool IsApiPath(const std::string &path) {
  return path.rfind("/webapi/", 0) == 0;
}

// A www folder that can be served: a folder without a "webapi" entry.
bool UsableWwwFolder(const std::filesystem::path &folder) {
  if (folder.empty()) {
    return false;
  }
  std::error_code error;
  if (!std::filesystem::is_directory(folder, error)) {
    HOST_LOG(LOG_WARNING,
             "www folder %s is not a folder; serving the built-in page",
             folder.c_str());
    return false;
  }
  if (std::filesystem::exists(folder / "webapi", error)) {
    HOST_LOG(LOG_ERR,
             "www folder %s holds a \"webapi\" entry, which would hide the "
             "API; serving the built-in page",
             folder.c_str());
    return false;
  }
  return true;
}

// Threads, timeouts, the body bound and the headers of every answer.
void ApplyLimits(httplib::Server &server, const HttpOptions &options) {
  const std::size_t threads = options.threads == 0 ? 1 : options.threads;
  // The library owns and deletes the queue that this factory makes.
  server.new_task_queue = [threads] {
    return new httplib::ThreadPool(threads);
  };
  server.set_read_timeout(options.readTimeout);
  server.set_write_timeout(options.writeTimeout);
  server.set_keep_alive_timeout(options.keepAliveTimeout.count());
  server.set_keep_alive_max_count(options.keepAliveMaxCount);
  // Bodies beyond the bound are refused (413) and skipped by the library
  // before any handler sees them.
  server.set_payload_max_length(options.maxBodyBytes);
  server.set_default_headers({{"X-Content-Type-Options", "nosniff"},
                              {"X-Frame-Options", "DENY"},
                              {"Referrer-Policy", "no-referrer"}});
}

// Why a body was not read whole.
enum class BodyRefusal {
  None,
  Broken,   // the client sent a broken body or went away
  TooLarge, // beyond maxBodyBytes
  TooSlow,  // not whole within bodyTimeout
};

// The answer when a POST body could not be read whole.
void SendBodyRefusal(httplib::Response &response, BodyRefusal refusal,
                     std::size_t maxBodyBytes) {
  // The rest of the body stays unread: the connection ends with the answer.
  response.set_header("Connection", "close");
  if (refusal == BodyRefusal::TooLarge) {
    Json::Value errors(Json::objectValue);
    errors["limit"] = "body";
    errors["max"] = static_cast<Json::UInt64>(maxBodyBytes);
    SendJson(response, 413, ErrorAnswer(ZARK::WEBAPI_ERR_TOO_LARGE, errors));
  } else if (refusal == BodyRefusal::TooSlow) {
    Json::Value errors(Json::objectValue);
    errors["reason"] = "body_timeout";
    SendJson(response, 408, ErrorAnswer(ZARK::WEBAPI_ERR_BAD_REQUEST, errors));
  } else {
    Json::Value errors(Json::objectValue);
    errors["reason"] = "body";
    SendJson(response, 400, ErrorAnswer(ZARK::WEBAPI_ERR_BAD_REQUEST, errors));
  }
}

// GET and POST of the API endpoints, answered by handler.
void RouteApi(httplib::Server &server, const RequestHandler &handler,
              const HttpOptions &options) {
  const std::size_t maxBodyBytes = options.maxBodyBytes;
  const std::chrono::milliseconds bodyTimeout = options.bodyTimeout;
  server.Get(kApiPattern, [&handler](const httplib::Request &request,
                                     httplib::Response &response) {
    ReceivedRequest received;
    WebRequest web = ToWebRequest(request, received);
    SendAnswer(response, handler.Handle(web));
  });

  server.Post(kApiPattern, [&handler, maxBodyBytes,
                            bodyTimeout](const httplib::Request &request,
                                         httplib::Response &response,
                                         const httplib::ContentReader &reader) {
    ReceivedRequest received;
    // The library bounds only bodies with a Content-Length; a chunked body
    // or one read until the client closes is bounded here, piece by piece
    // as it arrives, in size and in time (a body trickled a byte at a time
    // never meets the read timeout, which applies to each read).
    const auto deadline = std::chrono::steady_clock::now() + bodyTimeout;
    BodyRefusal refusal = BodyRefusal::None;
    bool read = reader([&](const char *data, std::size_t length) {
      if (length > maxBodyBytes - received.body.size()) {
        refusal = BodyRefusal::TooLarge;
        return false;
      }
      if (std::chrono::steady_clock::now() > deadline) {
        refusal = BodyRefusal::TooSlow;
        return false;
      }
      received.body.append(data, length);
      return true;
    });
    if (!read) {
      if (refusal == BodyRefusal::None && response.status == 413) {
        refusal = BodyRefusal::TooLarge;
      }
      SendBodyRefusal(response, refusal, maxBodyBytes);
      return;
    }
    WebRequest web = ToWebRequest(request, received);
    web.isPost = true;
    web.body = received.body;
    received.contentType = request.get_header_value("Content-Type");
    web.contentType = received.contentType;
    SendAnswer(response, handler.Handle(web));
  });
}

// A JSON body for an error the library answered under /webapi/.
httplib::Server::HandlerResponse
AnswerLibraryError(const httplib::Request &request,
                   httplib::Response &response) {
  if (!IsApiPath(request.path) || !response.body.empty()) {
    return httplib::Server::HandlerResponse::Unhandled;
  }
  int code = ZARK::WEBAPI_ERR_BAD_REQUEST;
  if (response.status == 413 || response.status == 414 ||
      response.status == 431) {
    code = ZARK::WEBAPI_ERR_TOO_LARGE;
  } else if (response.status >= 500) {
    code = ZARK::WEBAPI_ERR_UNKNOWN;
  }
  SendJson(response, response.status, ErrorAnswer(code));
  return httplib::Server::HandlerResponse::Handled;
}

// A handler threw: logged, and answered with a 500.
void AnswerException(const httplib::Request &request,
                     httplib::Response &response,
                     const std::exception_ptr &exception) {
  std::string what = "unknown";
  try {
    if (exception) {
      std::rethrow_exception(exception);
    }
  } catch (const std::exception &e) {
    what = e.what();
  } catch (...) {
  }
  HOST_LOG(LOG_ERR, "request for %s failed: %s", request.path.c_str(),
           what.c_str());
  SendJson(response, 500, ErrorAnswer(ZARK::WEBAPI_ERR_UNKNOWN));
}

// A refusal of the request guard: JSON under /webapi/, plain text elsewhere.
httplib::Server::HandlerResponse Refuse(const httplib::Request &request,
                                        httplib::Response &response, int status,
                                        int code, const char *reason) {
  // The body, if any, is left unread: the connection ends with the answer.
  response.set_header("Connection", "close");
  if (IsApiPath(request.path)) {
    Json::Value errors(Json::objectValue);
    errors["reason"] = reason;
    SendJson(response, status, ErrorAnswer(code, errors));
  } else {
    response.status = status;
    response.set_content(std::string(reason) + " refused\n", "text/plain");
  }
  return httplib::Server::HandlerResponse::Handled;
}

// 431 for headers beyond the bounds (JSON under /webapi/).
httplib::Server::HandlerResponse RefuseHeaders(const httplib::Request &request,
                                               httplib::Response &response,
                                               std::size_t max, bool count) {
  response.set_header("Connection", "close");
  if (!IsApiPath(request.path)) {
    response.status = 431;
    response.set_content("headers refused\n", "text/plain");
    return httplib::Server::HandlerResponse::Handled;
  }
  Json::Value errors(Json::objectValue);
  errors["limit"] = count ? "header_count" : "headers";
  errors["max"] = static_cast<Json::UInt64>(max);
  SendJson(response, 431, ErrorAnswer(ZARK::WEBAPI_ERR_TOO_LARGE, errors));
  return httplib::Server::HandlerResponse::Handled;
}

// Every request, before it is routed (and before its body is read): too
// many or too large headers, a compressed body, control characters in the
// path, a Host that is not this machine, an Origin of another site.
void GuardRequests(httplib::Server &server, const HttpOptions &options,
                   std::vector<std::string> names) {
  server.set_pre_routing_handler(
      [names = std::move(names), maxCount = options.maxHeaderCount,
       maxBytes = options.maxHeaderBytes](const httplib::Request &request,
                                          httplib::Response &response) {
        std::size_t headerBytes = 0;
        for (const auto &[name, value] : request.headers) {
          headerBytes += name.size() + value.size();
        }
        if (request.headers.size() > maxCount || headerBytes > maxBytes) {
          return RefuseHeaders(request, response,
                               request.headers.size() > maxCount ? maxCount
                                                                 : maxBytes,
                               request.headers.size() > maxCount);
        }
        // The library would inflate a gzip or brotli body before any bound
        // applies (61 KB of gzip make 60 MB): refused unread.
        if (request.has_header("Content-Encoding") &&
            !klibc::EqualsIgnoringCase(
                request.get_header_value("Content-Encoding"), "identity")) {
          return Refuse(request, response, 415, ZARK::WEBAPI_ERR_BAD_REQUEST,
                        "content_encoding");
        }
        if (HasControlCharacter(request.path)) {
          return Refuse(request, response, 400, ZARK::WEBAPI_ERR_BAD_REQUEST,
                        "path");
        }
        const std::string host = request.get_header_value("Host");
        if (request.get_header_value_count("Host") > 1 ||
            !IsAllowedHost(host, names)) {
          HOST_LOG(LOG_NOTICE, "request from %s refused: not this host",
                   request.remote_addr.c_str());
          return Refuse(request, response, 421, ZARK::WEBAPI_ERR_NOT_ALLOWED,
                        "host");
        }
        // Browsers send Origin with every POST and every cross-site call;
        // a client that sends none is not a browser page of another site.
        if (request.has_header("Origin") &&
            !IsSameOrigin(request.get_header_value("Origin"), host)) {
          HOST_LOG(LOG_NOTICE, "request from %s refused: another site's page",
                   request.remote_addr.c_str());
          return Refuse(request, response, 403, ZARK::WEBAPI_ERR_NOT_ALLOWED,
                        "origin");
        }
        return httplib::Server::HandlerResponse::Unhandled;
      });
}

// The front end from the www folder, or the built-in page when it cannot
// be served.
void RouteFrontEnd(httplib::Server &server,
                   const std::filesystem::path &wwwFolder) {
  if (UsableWwwFolder(wwwFolder)) {
    if (!server.set_mount_point("/", wwwFolder.string())) {
      HOST_LOG(LOG_ERR, "www folder %s cannot be served", wwwFolder.c_str());
    } else {
      HOST_LOG(LOG_INFO, "serving the front end from %s", wwwFolder.c_str());
      return;
    }
  }
  auto page = [](const httplib::Request &, httplib::Response &response) {
    response.set_content(BuiltInPage(), "text/html; charset=utf-8");
  };
  server.Get("/", page);
  server.Get("/index.html", page);
}

} // namespace

std::string BuiltInPage() {
  return "<!DOCTYPE html>\n<html><head><meta charset=\"utf-8\">"
         "<title>zark-webapid</title></head><body>"
         "<h1>zark-webapid</h1>"
         "<p>The web API is running, but the browser front end is not "
         "installed.</p>"
         "<p>Install it and start the host with <code>--www "
         "FOLDER</code>.</p></body></html>\n";
}

HttpServer::HttpServer(const RequestHandler &handler, HttpOptions options)
    : mHandler(handler), mOptions(std::move(options)),
      mServer(std::make_unique<httplib::Server>()) {
  Route();
}

HttpServer::~HttpServer() {
  Stop();
}

void HttpServer::Route() {
  httplib::Server &server = *mServer;
  ApplyLimits(server, mOptions);
  GuardRequests(server, mOptions,
                mOptions.hostNames.empty() ? LocalHostNames()
                                           : mOptions.hostNames);
  RouteApi(server, mHandler, mOptions);
  // Failures the library answers itself (bounds, unknown paths under
  // /webapi/) get a JSON body there too.
  httplib::Server::HandlerWithResponse errorHandler = AnswerLibraryError;
  server.set_error_handler(std::move(errorHandler));
  server.set_exception_handler(AnswerException);
  RouteFrontEnd(server, mOptions.wwwFolder);
}

bool HttpServer::Bind() {
  // The HTTP library listens with a backlog of 5 (CPPHTTPLIB_LISTEN_BACKLOG,
  // fixed when the distribution built it): a burst of clients connecting at
  // once overflows it, and the kernel drops their handshakes (a second's
  // wait to retry) or resets them. Listening again on the bound socket with
  // the system's maximum raises the backlog; the socket is the one the
  // library's socket options were last applied to.
  auto listening = std::make_shared<int>(-1);
  mServer->set_socket_options([listening](socket_t sock) {
    httplib::default_socket_options(sock);
    // The library writes an answer's headers and body in two writes:
    // without TCP_NODELAY the second waits for the client's delayed ACK
    // (40 ms) on a kept-alive connection. Accepted sockets inherit it from
    // the listening one.
    const int on = 1;
    (void)::setsockopt(sock, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
    *listening = sock;
  });
  if (mOptions.port == 0) {
    mPort = mServer->bind_to_any_port(mOptions.address);
  } else if (mServer->bind_to_port(mOptions.address, mOptions.port)) {
    mPort = mOptions.port;
  } else {
    mPort = -1;
  }
  if (mPort <= 0) {
    HOST_LOG(LOG_ERR, "cannot listen on %s port %d", mOptions.address.c_str(),
             mOptions.port);
    return false;
  }
  if (::listen(*listening, SOMAXCONN) != 0) {
    HOST_LOG(LOG_WARNING, "listen backlog stays at the HTTP library's: %s",
             std::strerror(errno));
  }
  HOST_LOG(LOG_INFO, "listening on %s port %d", mOptions.address.c_str(),
           mPort);
  return true;
}

bool HttpServer::Serve() {
  mServing = true;
  if (mStopRequested) {
    mServing = false;
    return true;
  }
  bool served = mServer->listen_after_bind();
  mServing = false;
  if (mStopRequested) {
    return true;
  }
  if (!served) {
    HOST_LOG(LOG_ERR, "the server stopped on an error");
  }
  return served;
}

void HttpServer::Stop() {
  mStopRequested = true;
  // stop() acts only on a running server: when Serve has begun but the
  // library is not yet accepting, wait (bounded) until it is.
  for (int i = 0; i < 400 && mServing && !mServer->is_running(); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  mServer->stop();
}

} // namespace zark::host
