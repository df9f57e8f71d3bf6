// Fuzz target of the module's readers of the progress files the port-map
// library writes while it works: "/tmp/pfProgress" (rules being applied),
// "/tmp/pfStatusRule" (rules being tested) and "/tmp/upnp_test.progress"
// (the UPnP compatibility test). Runs in a private mount namespace: the
// input is written to the file, then the status operation that reads it
// runs, as a status method would run it.
//
// Input: byte 0 chooses the file (modulo 3), byte 1 the task record's state
// (for the apply and test readers; the record is the module's own, so it
// stays well-formed), the rest is the file's content.
//
// Besides not crashing:
// - apply progress: a percentage of at most 100 (below 0 only when the file
//   holds a negative count, as the progress formula gives it), read
//   directly and through the save status operation;
// - test status: "status" is "wait", "update" or "success", and "rules"
//   (when present) is an object of strings;
// - compatibility test: ParseUPnPTestProgress answers -1 to 5, the answer's
//   percentage is -1 (failed) or 0 to 100 and its status is "failed",
//   "processing" or "success".
#include "PortForwarding.h"
#include "StatusReportor.h"
#include "fuzz_support.h"
#include "hermetic.h"
#include "syslog_capture.h"
#include "webapi.h"

#include <cstddef>
#include <cstdint>
#include <string>

#include <unistd.h>

namespace {

using zark::fuzz::Require;

constexpr const char *kApplyProgress = "/tmp/pfProgress";
constexpr const char *kTestStatus = "/tmp/pfStatusRule";
constexpr const char *kUpnpTestProgress = "/tmp/upnp_test.progress";

// The object a status method runs the operation on.
struct Operation {
  ZARK::APIResponse response;
  PortForwarding portForwarding{
      new StatusReportor(1500, "", "", &response, Json::Value(), false, false)};
};

Json::Value Record(const char *status, int percentage) {
  Json::Value record(Json::objectValue);
  record["data"]["status"] = status;
  record["data"]["percentage"] = percentage;
  record["finish"] = false;
  record["success"] = true;
  return record;
}

void CheckApplyProgress(uint8_t state) {
  Operation operation;
  std::string stage;
  int percentage = -1;
  if (operation.portForwarding.GetPortfwdApplyStatus(stage, percentage)) {
    Require(percentage <= 100,
            "apply percentage " + std::to_string(percentage));
  }
  Operation status;
  Json::Value out(Json::objectValue);
  // The record is the save task's own (0 to 100), the file the library's.
  const Json::Value record = (state & 1) != 0
                                 ? Record("success", 100)
                                 : Record("processing", (state >> 1) % 101);
  if (status.portForwarding.StartPortForwardingStatus(out, record) &&
      out.isMember("percentage")) {
    Require(out["percentage"].isInt() && out["percentage"].asInt() <= 100,
            "status percentage " + out["percentage"].toStyledString());
  }
}

void CheckTestStatus(uint8_t state) {
  static const char *const kStates[] = {"prepare", "begin", "finish", "other"};
  Operation operation;
  Json::Value out(Json::objectValue);
  if (!operation.portForwarding.TestPortConnectionStatus(
          out, Record(kStates[state % 4], 0))) {
    return;
  }
  const std::string status = out["status"].asString();
  Require(status == "wait" || status == "update" || status == "success",
          "test status \"" + status + "\"");
  if (out.isMember("rules")) {
    Require(out["rules"].isObject(), "rules not an object");
    for (const Json::Value &result : out["rules"]) {
      Require(result.isString(), "a rule result that is not a string");
    }
  }
}

void CheckUpnpTestProgress() {
  Json::Value items(Json::objectValue);
  const int passed = ParseUPnPTestProgress(items);
  Require(passed >= -1 && passed <= 5, "passed " + std::to_string(passed));

  Operation operation;
  Json::Value answer(Json::objectValue);
  Require(operation.portForwarding.UPnPTestStartStatus(answer, Json::Value()),
          "UPnPTestStartStatus answered false");
  const std::string status = answer["status"].asString();
  const int percentage = answer["percentage"].asInt();
  Require(status == "failed" || status == "processing" || status == "success",
          "compatibility status \"" + status + "\"");
  Require(percentage == -1 || (percentage >= 0 && percentage <= 100),
          "compatibility percentage " + std::to_string(percentage));
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int *, char ***) {
  zark::fuzz::EnterHermeticOrDie();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  zark::test::ClearLogs();
  zark::fuzz::InputReader input(zark::fuzz::AsText(data, size));
  const uint8_t which = input.Byte() % 3;
  const uint8_t state = input.Byte();
  const std::string content(input.Rest());
  const char *const files[] = {kApplyProgress, kTestStatus, kUpnpTestProgress};
  for (const char *file : files) {
    ::unlink(file);
  }
  zark::test::WriteFile(files[which], content);
  switch (which) {
  case 0:
    CheckApplyProgress(state);
    break;
  case 1:
    CheckTestStatus(state);
    break;
  default:
    CheckUpnpTestProgress();
    break;
  }
  return 0;
}
