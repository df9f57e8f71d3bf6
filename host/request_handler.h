// The host's request handling without sockets: a call's fields are read
// and bounded, its session checked, the method looked up and run, and the
// JSON answer made. The HTTP layer only copies what it received into a
// WebRequest and sends the WebAnswer back.
#ifndef ZARK_HOST_REQUEST_HANDLER_H
#define ZARK_HOST_REQUEST_HANDLER_H

#include "login_service.h"
#include "module_registry.h"
#include "session_store.h"
#include "wire_protocol.h"

#include <json/json.h>

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace zark::host {

// The host's three endpoints.
enum class Endpoint {
  Entry, // /webapi/entry.cgi: one module method
  Query, // /webapi/query.cgi: what is served
  Auth,  // /webapi/auth.cgi: login and logout
};

// Name of the session cookie and of the token header.
inline constexpr std::string_view kSessionCookie = "id";
inline constexpr std::string_view kTokenHeader = "X-ZARK-Token";

// What the HTTP layer received. Views into the HTTP layer's request.
struct WebRequest {
  Endpoint endpoint = Endpoint::Entry;
  bool isPost = false;
  std::string_view query;       // the text after "?" in the target
  std::string_view body;        // POST only; ignored for GET
  std::string_view contentType; // the POST's Content-Type header
  std::string_view cookies;     // every Cookie header, joined with "; "
  std::optional<std::string_view> token; // the X-ZARK-Token header
  std::string_view clientAddress;
  std::size_t headerBytes = 0; // names and values of all headers
};

// What to send back: an HTTP status, a JSON body, extra headers.
struct WebAnswer {
  int httpStatus = 200;
  Json::Value body;
  std::vector<std::pair<std::string, std::string>> headers;
};

struct RequestLimits {
  std::size_t maxBodyBytes = 64 * 1024;
  std::size_t maxParams = 64;
  std::size_t maxHeaderBytes = 16 * 1024;
};

// Safe to use from several threads at once (the module methods it calls
// must be too).
class RequestHandler {
public:
  RequestHandler(const ModuleRegistry &modules, SessionStore &sessions,
                 LoginService &logins, const RequestLimits &limits,
                 bool secureCookie);

  // Every answer has HTTP status 200 and a JSON body of the wire protocol,
  // except requests beyond the bounds: 431 (headers) and 413 (body), with
  // the JSON error 108.
  [[nodiscard]] WebAnswer Handle(const WebRequest &request) const;

private:
  [[nodiscard]] bool ReadFields(const WebRequest &request, FormFields &fields,
                                WebAnswer &refusal) const;
  [[nodiscard]] WebAnswer HandleEntry(const WebRequest &request,
                                      const FormFields &fields) const;
  [[nodiscard]] WebAnswer HandleQuery(const WebRequest &request) const;
  [[nodiscard]] WebAnswer HandleAuth(const WebRequest &request,
                                     const FormFields &fields) const;
  // Ends the request's session and expires its cookie.
  [[nodiscard]] WebAnswer HandleLogout(const WebRequest &request) const;
  // 106 or 107 into refusal when the request has no valid session.
  [[nodiscard]] bool CheckSession(const WebRequest &request,
                                  SessionOwner &owner,
                                  WebAnswer &refusal) const;
  [[nodiscard]] Json::Value RunMethod(const ApiCall &call,
                                      const ZARK_API_HANDLER handler,
                                      std::string_view module,
                                      const SessionOwner &owner) const;

  const ModuleRegistry &mModules;
  SessionStore &mSessions;
  LoginService &mLogins;
  const RequestLimits mLimits;
  const bool mSecureCookie;
};

// The value of cookie name in a Cookie header ("a=1; id=abc"), or empty.
[[nodiscard]] std::string_view FindCookie(std::string_view cookies,
                                          std::string_view name);

} // namespace zark::host

#endif
