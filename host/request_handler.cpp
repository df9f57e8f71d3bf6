#include "request_handler.h"

#include "account_file.h"
#include "host_log.h"

#include "klibc_text.h"

#include <cctype>
#include <cstdint>
#include <exception>
#include <map>

namespace zark::host {
namespace {

constexpr std::string_view kFormType = "application/x-www-form-urlencoded";

// Fields of auth.cgi besides "method". Their values are taken as they are,
// never as JSON.
constexpr const char *kAccountField = "account";
constexpr const char *kPasswordField = "passwd";

// "application/x-www-form-urlencoded; charset=UTF-8" is a form too.
bool IsFormType(std::string_view contentType) {
  std::string_view media = contentType.substr(0, contentType.find(';'));
  return klibc::EqualsIgnoringCase(klibc::Trim(media, klibc::kSpaceAndTab),
                                   kFormType);
}

WebAnswer Answer(Json::Value body, int httpStatus = 200) {
  WebAnswer answer;
  answer.httpStatus = httpStatus;
  answer.body = std::move(body);
  return answer;
}

Json::Value Reason(const char *reason) {
  Json::Value errors(Json::objectValue);
  errors["reason"] = reason;
  return errors;
}

Json::Value Limit(const char *limit, std::size_t max) {
  Json::Value errors(Json::objectValue);
  errors["limit"] = limit;
  errors["max"] = static_cast<Json::UInt64>(max);
  return errors;
}

std::string SessionCookie(std::string_view value, bool secure, bool expire) {
  std::string cookie = std::string(kSessionCookie) + "=" + std::string(value) +
                       "; Path=/; HttpOnly; SameSite=Strict";
  if (expire) {
    cookie += "; Max-Age=0";
  }
  if (secure) {
    cookie += "; Secure";
  }
  return cookie;
}

// True when the query text (already decoded once without error) has a
// field of this name.
bool QueryHasField(std::string_view query, std::string_view name) {
  FormFields fields;
  if (DecodeForm(query, SIZE_MAX, fields) != FormResult::Ok) {
    return false;
  }
  for (const FormField &field : fields) {
    if (field.name == name) {
      return true;
    }
  }
  return false;
}

// The fields of an auth request by name; kept empty with the answer in
// refusal when a field is given twice.
using FieldValues = std::map<std::string_view, std::string_view>;

bool IndexFields(const FormFields &fields, FieldValues &values,
                 WebAnswer &refusal) {
  for (const FormField &field : fields) {
    if (!values.emplace(field.name, field.value).second) {
      Json::Value errors(Json::objectValue);
      errors["field"] = field.name;
      errors["reason"] = "repeated";
      refusal = Answer(ErrorAnswer(ZARK::WEBAPI_ERR_BAD_REQUEST, errors));
      return false;
    }
  }
  return true;
}

// The value of field name, nothing when it is absent or empty.
std::optional<std::string_view> NonEmptyField(const FieldValues &values,
                                              const char *name) {
  auto it = values.find(name);
  if (it == values.end() || it->second.empty()) {
    return std::nullopt;
  }
  return it->second;
}

WebAnswer MissingField(const char *name) {
  Json::Value errors(Json::objectValue);
  errors["field"] = name;
  return Answer(ErrorAnswer(ZARK::WEBAPI_ERR_BAD_REQUEST, errors));
}

// The answer to a login attempt: the session's token and cookie, or why
// not.
WebAnswer LoginAnswer(const LoginOutcome &outcome, bool secureCookie) {
  switch (outcome.result) {
  case LoginOutcome::Result::Ok: {
    Json::Value data(Json::objectValue);
    data["token"] = outcome.session.token;
    data["account"] = outcome.owner.account;
    WebAnswer answer = Answer(SuccessAnswer(data));
    answer.headers.emplace_back(
        "Set-Cookie", SessionCookie(outcome.session.id, secureCookie, false));
    return answer;
  }
  case LoginOutcome::Result::BadCredentials:
    return Answer(
        ErrorAnswer(ZARK::WEBAPI_ERR_NOT_ALLOWED, Reason("bad_credentials")));
  case LoginOutcome::Result::Throttled: {
    Json::Value errors = Reason("throttled");
    errors["retry_after"] =
        static_cast<Json::Int64>(outcome.retryAfter.count());
    WebAnswer answer =
        Answer(ErrorAnswer(ZARK::WEBAPI_ERR_NOT_ALLOWED, errors));
    answer.headers.emplace_back("Retry-After",
                                std::to_string(outcome.retryAfter.count()));
    return answer;
  }
  case LoginOutcome::Result::Unavailable:
    break;
  }
  return Answer(ErrorAnswer(ZARK::WEBAPI_ERR_UNKNOWN));
}

} // namespace

std::string_view FindCookie(std::string_view cookies, std::string_view name) {
  while (!cookies.empty()) {
    std::size_t end = cookies.find(';');
    std::string_view pair =
        klibc::Trim(cookies.substr(0, end), klibc::kSpaceAndTab);
    cookies = end == std::string_view::npos ? std::string_view()
                                            : cookies.substr(end + 1);
    std::size_t equals = pair.find('=');
    if (equals != std::string_view::npos &&
        klibc::Trim(pair.substr(0, equals), klibc::kSpaceAndTab) == name) {
      return klibc::Trim(pair.substr(equals + 1), klibc::kSpaceAndTab);
    }
  }
  return {};
}

RequestHandler::RequestHandler(const ModuleRegistry &modules,
                               SessionStore &sessions, LoginService &logins,
                               const RequestLimits &limits, bool secureCookie)
    : mModules(modules), mSessions(sessions), mLogins(logins), mLimits(limits),
      mSecureCookie(secureCookie) {}

WebAnswer RequestHandler::Handle(const WebRequest &request) const {
  FormFields fields;
  WebAnswer refusal;
  if (!ReadFields(request, fields, refusal)) {
    return refusal;
  }
  switch (request.endpoint) {
  case Endpoint::Entry:
    return HandleEntry(request, fields);
  case Endpoint::Query:
    return HandleQuery(request);
  case Endpoint::Auth:
    return HandleAuth(request, fields);
  }
  return Answer(ErrorAnswer(ZARK::WEBAPI_ERR_UNKNOWN));
}

bool RequestHandler::ReadFields(const WebRequest &request, FormFields &fields,
                                WebAnswer &refusal) const {
  if (request.headerBytes > mLimits.maxHeaderBytes) {
    refusal = Answer(ErrorAnswer(ZARK::WEBAPI_ERR_TOO_LARGE,
                                 Limit("headers", mLimits.maxHeaderBytes)),
                     431);
    return false;
  }
  const bool hasBody = request.isPost && !request.body.empty();
  if (hasBody && request.body.size() > mLimits.maxBodyBytes) {
    refusal = Answer(ErrorAnswer(ZARK::WEBAPI_ERR_TOO_LARGE,
                                 Limit("body", mLimits.maxBodyBytes)),
                     413);
    return false;
  }
  if (hasBody && !IsFormType(request.contentType)) {
    Json::Value errors(Json::objectValue);
    errors["field"] = "Content-Type";
    refusal = Answer(ErrorAnswer(ZARK::WEBAPI_ERR_BAD_REQUEST, errors));
    return false;
  }
  // "api", "version" and "method" come on top of the parameters.
  const std::size_t maxFields = mLimits.maxParams + 3;
  FormResult result = DecodeForm(request.query, maxFields, fields);
  if (result == FormResult::Ok && hasBody) {
    result = DecodeForm(request.body, maxFields, fields);
  }
  switch (result) {
  case FormResult::Ok:
    return true;
  case FormResult::TooManyFields:
    refusal = Answer(ErrorAnswer(ZARK::WEBAPI_ERR_TOO_LARGE,
                                 Limit("parameters", mLimits.maxParams)));
    return false;
  case FormResult::BadEncoding:
    break;
  }
  refusal = Answer(
      ErrorAnswer(ZARK::WEBAPI_ERR_BAD_REQUEST, Reason("form_encoding")));
  return false;
}

bool RequestHandler::CheckSession(const WebRequest &request,
                                  SessionOwner &owner,
                                  WebAnswer &refusal) const {
  std::string_view id = FindCookie(request.cookies, kSessionCookie);
  switch (mSessions.Check(id, request.token, owner)) {
  case SessionCheck::Ok:
    return true;
  case SessionCheck::NoSession:
    refusal = Answer(ErrorAnswer(ZARK::WEBAPI_ERR_NOT_LOGGED_IN));
    return false;
  case SessionCheck::BadToken:
    break;
  }
  refusal = Answer(ErrorAnswer(ZARK::WEBAPI_ERR_BAD_TOKEN));
  return false;
}

WebAnswer RequestHandler::HandleEntry(const WebRequest &request,
                                      const FormFields &fields) const {
  SessionOwner owner;
  WebAnswer refusal;
  if (!CheckSession(request, owner, refusal)) {
    return refusal;
  }
  if (owner.group != kAdminGroup) {
    return Answer(
        ErrorAnswer(ZARK::WEBAPI_ERR_NOT_ALLOWED, Reason("admin_only")));
  }
  ApiCall call;
  WireError error;
  if (!ParseApiCall(fields, mLimits.maxParams, call, error)) {
    return Answer(ErrorAnswer(error));
  }
  ModuleRegistry::Target target;
  switch (mModules.Find(call.api, call.method, call.version, target)) {
  case ModuleRegistry::Lookup::Found:
    return Answer(RunMethod(call, target.handler, target.module, owner));
  case ModuleRegistry::Lookup::NoApi:
    return Answer(ErrorAnswer(ZARK::WEBAPI_ERR_NO_SUCH_API));
  case ModuleRegistry::Lookup::NoMethod:
    return Answer(ErrorAnswer(ZARK::WEBAPI_ERR_NO_SUCH_METHOD));
  case ModuleRegistry::Lookup::NoVersion:
    break;
  }
  return Answer(ErrorAnswer(ZARK::WEBAPI_ERR_BAD_VERSION));
}

Json::Value RequestHandler::RunMethod(const ApiCall &call,
                                      const ZARK_API_HANDLER handler,
                                      std::string_view module,
                                      const SessionOwner &owner) const {
  const std::string moduleName(module);
  ZARK::APIRequest apiRequest(call.params);
  apiRequest.SetUser(owner.account);
  ZARK::APIResponse apiResponse;
  // A method may throw (the module lets std::out_of_range of its port
  // bitsets pass); the host answers 100 and keeps serving.
  try {
    handler(&apiRequest, &apiResponse);
  } catch (const std::exception &exception) {
    HOST_LOG(LOG_ERR, "%s %s version %d of module %s threw: %s",
             call.api.c_str(), call.method.c_str(), call.version,
             moduleName.c_str(), exception.what());
    return ErrorAnswer(ZARK::WEBAPI_ERR_UNKNOWN);
  } catch (...) {
    HOST_LOG(LOG_ERR,
             "%s %s version %d of module %s threw a non-standard exception",
             call.api.c_str(), call.method.c_str(), call.version,
             moduleName.c_str());
    return ErrorAnswer(ZARK::WEBAPI_ERR_UNKNOWN);
  }
  if (!apiResponse.IsAnswered()) {
    HOST_LOG(LOG_WARNING, "%s %s version %d of module %s set no answer",
             call.api.c_str(), call.method.c_str(), call.version,
             moduleName.c_str());
  }
  return AnswerFromResponse(apiResponse);
}

WebAnswer RequestHandler::HandleQuery(const WebRequest &request) const {
  SessionOwner owner;
  WebAnswer refusal;
  if (!CheckSession(request, owner, refusal)) {
    return refusal;
  }
  return Answer(SuccessAnswer(mModules.Describe()));
}

WebAnswer RequestHandler::HandleAuth(const WebRequest &request,
                                     const FormFields &fields) const {
  FieldValues values;
  WebAnswer refusal;
  if (!IndexFields(fields, values, refusal)) {
    return refusal;
  }
  std::optional<std::string_view> method = NonEmptyField(values, "method");
  if (!method) {
    return MissingField("method");
  }
  if (*method == "logout") {
    return HandleLogout(request);
  }
  if (*method != "login") {
    return Answer(ErrorAnswer(ZARK::WEBAPI_ERR_NO_SUCH_METHOD));
  }
  // A password in a URL ends up in browser histories and proxy logs: a
  // login is a POST with the password in its body.
  if (!request.isPost || QueryHasField(request.query, kPasswordField)) {
    return Answer(
        ErrorAnswer(ZARK::WEBAPI_ERR_BAD_REQUEST, Reason("post_required")));
  }
  std::optional<std::string_view> account =
      NonEmptyField(values, kAccountField);
  if (!account) {
    return MissingField(kAccountField);
  }
  std::optional<std::string_view> password =
      NonEmptyField(values, kPasswordField);
  if (!password) {
    return MissingField(kPasswordField);
  }
  return LoginAnswer(mLogins.Login(*account, *password, request.clientAddress),
                     mSecureCookie);
}

WebAnswer RequestHandler::HandleLogout(const WebRequest &request) const {
  SessionOwner owner;
  WebAnswer refusal;
  if (!CheckSession(request, owner, refusal)) {
    return refusal;
  }
  mSessions.Drop(FindCookie(request.cookies, kSessionCookie));
  HOST_LOG(LOG_INFO, "logout of %s", owner.account.c_str());
  WebAnswer answer = Answer(SuccessAnswer(Json::Value()));
  answer.headers.emplace_back("Set-Cookie",
                              SessionCookie("", mSecureCookie, true));
  return answer;
}

} // namespace zark::host
