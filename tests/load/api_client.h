// One browser's worth of calls to zark-webapid over HTTP (cpp-httplib): a
// login that keeps the session cookie and token, then module methods
// through /webapi/entry.cgi. One object per thread; each call opens a
// connection of its own, as the HTTP library's client does by default.
#ifndef ZARK_TESTS_LOAD_API_CLIENT_H
#define ZARK_TESTS_LOAD_API_CLIENT_H

#include <json/json.h>

#include <chrono>
#include <memory>
#include <string>

namespace httplib {
class Client;
}

namespace zark::load {

// What one call got back.
struct ApiAnswer {
  // True when an HTTP answer with a JSON object body came back in time;
  // otherwise failure says what happened (connection refused, timeout, a
  // body that is not JSON).
  bool answered = false;
  std::string failure;
  int httpStatus = 0;
  bool success = false;
  Json::Value data;       // "data" of a success
  int code = 0;           // "error"."code" of a failure
  bool hasErrors = false; // the failure has "error"."errors"
  Json::Value errors;
  std::string body;
  std::chrono::microseconds latency{0};
};

class ApiClient {
public:
  // Every call gives up after timeout without an answer (connecting,
  // sending and reading are each bounded by it).
  ApiClient(int port, std::chrono::seconds timeout);
  ApiClient(const ApiClient &) = delete;
  ApiClient &operator=(const ApiClient &) = delete;
  ~ApiClient();

  // Logs in; true when the host answered success with a token and a
  // session cookie, otherwise why says what came back.
  [[nodiscard]] bool Login(const std::string &account,
                           const std::string &password, std::string &why);

  // POST /webapi/entry.cgi: api, version 1, method, and every member of
  // params (an object) as one field, its value written as JSON.
  ApiAnswer Call(const std::string &api, const std::string &method,
                 const Json::Value &params = Json::Value(Json::objectValue));

private:
  std::unique_ptr<httplib::Client> mClient;
  std::string mCookie;
  std::string mToken;
};

// JSON text of value on one line.
std::string JsonText(const Json::Value &value);
// Parses text as JSON; false when it is not.
bool ParseJson(const std::string &text, Json::Value &value);

} // namespace zark::load

#endif
