#include "fuzz_host.h"

#include "fuzz_support.h"
#include "hermetic.h"
#include "webapi.h"
#include "wire_protocol.h"

#include <crypt.h>

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <optional>

namespace zark::fuzz {
namespace {

constexpr const char *kAccountsFile = "/tmp/host-fuzz/webapid.accounts";

zark::host::ModuleRegistry &Modules() {
  static zark::host::ModuleRegistry modules;
  return modules;
}

// A yescrypt hash of the lowest cost: logins stay quick.
std::string QuickHash(const char *password) {
  char salt[CRYPT_GENSALT_OUTPUT_SIZE];
  if (crypt_gensalt_rn("$y$", 1, nullptr, 0, salt, sizeof(salt)) == nullptr) {
    std::fprintf(stderr, "crypt_gensalt_rn failed\n");
    std::abort();
  }
  auto data = std::make_unique<crypt_data>();
  const char *hash = crypt_rn(password, salt, data.get(),
                              static_cast<int>(sizeof(crypt_data)));
  if (hash == nullptr || hash[0] == '*') {
    std::fprintf(stderr, "crypt_rn failed\n");
    std::abort();
  }
  return hash;
}

zark::host::SessionPolicy Policy() {
  zark::host::SessionPolicy policy;
  policy.maxSessions = 16;
  return policy;
}

void RemoveAllTasks() {
  ZARK::APIPolling polling;
  Json::Value groups(Json::arrayValue);
  groups.append("admin");
  Json::Value result;
  if (polling.List("", groups, result)) {
    for (const Json::Value &id : result["admin"]) {
      polling.Stop(id.asString(), true);
    }
  }
  ZARK::APIPolling::JoinAll();
}

} // namespace

void FuzzHost::Prepare() {
  zark::test::WriteFile(kAccountsFile,
                        std::string("# fuzz accounts\n") + kHostAdmin + ":" +
                            QuickHash(kHostAdminPassword) + ":admin\n" +
                            kHostViewer + ":" + QuickHash(kHostViewerPassword) +
                            ":users\n",
                        0600);
  if (!Modules().LoadModule(ZARK_FUZZ_HOST_MODULE)) {
    std::fprintf(stderr, "cannot load %s\n", ZARK_FUZZ_HOST_MODULE);
    std::abort();
  }
}

FuzzHost::FuzzHost()
    : mSessions(mClock, Policy()),
      mThrottle(mClock, zark::host::ThrottlePolicy{}),
      mLogins(kAccountsFile, mSessions, mThrottle),
      mHandler(Modules(), mSessions, mLogins, zark::host::RequestLimits{},
               false) {
  RenewSessions();
}

void FuzzHost::RenewSessions() {
  (void)mSessions.Drop(mOpen.admin.id);
  (void)mSessions.Drop(mOpen.viewer.id);
  std::optional<zark::host::NewSession> admin =
      mSessions.Create({kHostAdmin, "admin"});
  std::optional<zark::host::NewSession> viewer =
      mSessions.Create({kHostViewer, "users"});
  if (!admin || !viewer) {
    std::fprintf(stderr, "cannot open the fuzz host's sessions\n");
    std::abort();
  }
  mOpen.admin = *admin;
  mOpen.viewer = *viewer;
}

FuzzHost::~FuzzHost() {
  RemoveAllTasks();
}

bool IsHostAnswerCode(int code) {
  return (code >= ZARK::WEBAPI_ERR_UNKNOWN &&
          code <= ZARK::WEBAPI_ERR_TASK_START) ||
         code == 1598 || code == 1599;
}

void CheckHostAnswer(int httpStatus, const Json::Value &body) {
  Require(httpStatus == 200 || httpStatus == 413 || httpStatus == 431,
          "HTTP status " + std::to_string(httpStatus));
  Require(body.isObject() && body["success"].isBool(),
          "an answer without \"success\"");
  if (!body["success"].asBool()) {
    const Json::Value &code = body["error"]["code"];
    Require(code.isInt() && IsHostAnswerCode(code.asInt()),
            "an error answer with code " + code.toStyledString());
    if (httpStatus != 200) {
      Require(code.asInt() == ZARK::WEBAPI_ERR_TOO_LARGE,
              "HTTP " + std::to_string(httpStatus) + " without code 108");
    }
  } else {
    Require(httpStatus == 200,
            "success with HTTP " + std::to_string(httpStatus));
  }
  const std::string text = zark::host::SerializeAnswer(body);
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  // JsonCpp writes text that is not UTF-8 lossily (0xC8 'n' comes out as
  // \u022e), so two parameter names a client sent in broken UTF-8 can come
  // back as the same key twice, which a browser reads as the last one.
  builder.settings_["rejectDupKeys"] = false;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value again;
  std::string errors;
  Require(
      reader->parse(text.data(), text.data() + text.size(), &again, &errors) &&
          again.isObject(),
      "an answer text that does not read back: " + errors);
}

} // namespace zark::fuzz
