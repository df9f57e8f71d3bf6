#include "api_client.h"

#include <httplib.h>

#include <memory>

namespace zark::load {
namespace {

using Clock = std::chrono::steady_clock;

// The session id in a Set-Cookie value ("id=<hex>; Path=/; ..."), or "".
std::string SessionCookie(const std::string &setCookie) {
  if (setCookie.rfind("id=", 0) != 0) {
    return "";
  }
  std::string::size_type end = setCookie.find(';');
  return setCookie.substr(0, end);
}

// Reads the answer shape {"success": bool, "data": ..., "error": {...}}.
void ReadAnswer(const httplib::Result &result, ApiAnswer &answer) {
  if (!result) {
    answer.failure = "no answer: " + httplib::to_string(result.error());
    return;
  }
  answer.httpStatus = result->status;
  answer.body = result->body;
  Json::Value root;
  if (!ParseJson(result->body, root) || !root.isObject() ||
      !root["success"].isBool()) {
    answer.failure =
        "HTTP " + std::to_string(result->status) +
        " without an answer object: " + result->body.substr(0, 200);
    return;
  }
  answer.answered = true;
  answer.success = root["success"].asBool();
  if (answer.success) {
    answer.data = root["data"];
    return;
  }
  const Json::Value &error = root["error"];
  if (error.isObject() && error["code"].isInt()) {
    answer.code = error["code"].asInt();
  }
  if (error.isObject() && error.isMember("errors")) {
    answer.hasErrors = true;
    answer.errors = error["errors"];
  }
}

} // namespace

std::string JsonText(const Json::Value &value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  return Json::writeString(builder, value);
}

bool ParseJson(const std::string &text, Json::Value &value) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  return reader->parse(text.data(), text.data() + text.size(), &value, nullptr);
}

ApiClient::ApiClient(int port, std::chrono::seconds timeout)
    : mClient(std::make_unique<httplib::Client>("127.0.0.1", port)) {
  mClient->set_connection_timeout(timeout);
  mClient->set_read_timeout(timeout);
  mClient->set_write_timeout(timeout);
}

ApiClient::~ApiClient() = default;

bool ApiClient::Login(const std::string &account, const std::string &password,
                      std::string &why) {
  httplib::Params fields = {
      {"method", "login"}, {"account", account}, {"passwd", password}};
  httplib::Result result = mClient->Post("/webapi/auth.cgi", fields);
  ApiAnswer answer;
  ReadAnswer(result, answer);
  if (!answer.answered || !answer.success || !answer.data["token"].isString()) {
    why = answer.answered ? "login refused: " + answer.body : answer.failure;
    return false;
  }
  mToken = answer.data["token"].asString();
  mCookie = SessionCookie(result->get_header_value("Set-Cookie"));
  if (mCookie.empty()) {
    why = "login answered no session cookie";
    return false;
  }
  return true;
}

ApiAnswer ApiClient::Call(const std::string &api, const std::string &method,
                          const Json::Value &params) {
  httplib::Params fields = {{"api", api}, {"version", "1"}, {"method", method}};
  for (const std::string &name : params.getMemberNames()) {
    fields.emplace(name, JsonText(params[name]));
  }
  httplib::Headers headers = {{"Cookie", mCookie}, {"X-ZARK-Token", mToken}};
  const Clock::time_point start = Clock::now();
  httplib::Result result = mClient->Post("/webapi/entry.cgi", headers, fields);
  ApiAnswer answer;
  answer.latency = std::chrono::duration_cast<std::chrono::microseconds>(
      Clock::now() - start);
  ReadAnswer(result, answer);
  return answer;
}

} // namespace zark::load
