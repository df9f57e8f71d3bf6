// Shared set-up of the PortForwarding operation tests: one PortForwarding
// owning a StatusReportor bound to a real APIResponse, a listener that keeps
// every answer the response receives in order, a timeline that interleaves
// those answers with chosen calls into the fake port-map library, and
// helpers for the log lines of src/PortForwarding.cpp.
#ifndef ZARK_TESTS_MODULE_OPS_SUPPORT_H
#define ZARK_TESTS_MODULE_OPS_SUPPORT_H

#include "PortForwarding.h"
#include "StatusReportor.h"
#include "fake_portmap.h"
#include "hermetic.h"
#include "syslog_capture.h"
#include "webapi.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <syslog.h>

#include <cstdio>
#include <functional>
#include <memory>
#include <mutex>
#include <regex>
#include <string>
#include <vector>

namespace zark::ops {

// One answer given to the response.
struct Answer {
  bool success;
  int code;         // error answers
  Json::Value data; // success data or error data
};

// Thread-safe list of names, in the order things happened.
class Timeline {
public:
  void Add(const std::string &entry) {
    std::lock_guard lock(mMutex);
    mEntries.push_back(entry);
  }
  std::vector<std::string> Entries() const {
    std::lock_guard lock(mMutex);
    return mEntries;
  }

private:
  mutable std::mutex mMutex;
  std::vector<std::string> mEntries;
};

// Short name of an answer on the timeline: "status <word> <percentage>" for
// a progress report, "success" for other success data, "error <code>".
inline std::string AnswerName(const Answer &answer) {
  if (!answer.success) {
    return "error " + std::to_string(answer.code);
  }
  if (answer.data.isObject() && answer.data.isMember("status") &&
      answer.data["status"].isString() && answer.data.isMember("percentage") &&
      answer.data["percentage"].isInt()) {
    return "status " + answer.data["status"].asString() + " " +
           std::to_string(answer.data["percentage"].asInt());
  }
  return "success";
}

class RecordingListener : public ZARK::APIResponse::Listener {
public:
  explicit RecordingListener(Timeline *timeline) : mTimeline(timeline) {}
  void OnSuccess(const Json::Value &data) override { Add({true, 0, data}); }
  void OnError(int code, const Json::Value &errors) override {
    Add({false, code, errors});
  }
  std::vector<Answer> Answers() const {
    std::lock_guard lock(mMutex);
    return mAnswers;
  }
  std::vector<std::string> Names() const {
    std::vector<std::string> names;
    for (const auto &answer : Answers()) {
      names.push_back(AnswerName(answer));
    }
    return names;
  }

private:
  void Add(const Answer &answer) {
    {
      std::lock_guard lock(mMutex);
      mAnswers.push_back(answer);
    }
    mTimeline->Add(AnswerName(answer));
  }
  mutable std::mutex mMutex;
  std::vector<Answer> mAnswers;
  Timeline *mTimeline;
};

// Texts (after the "src/PortForwarding.cpp:<line> " prefix) of the lines
// this class logged with the given priority, in order.
inline std::vector<std::string> PfLogs(int priority = LOG_ERR) {
  static const std::regex kLine(
      R"(^src/PortForwarding\.cpp:[0-9]+ ([\s\S]*)$)");
  std::vector<std::string> texts;
  for (const auto &line : zark::test::CapturedLogs()) {
    std::smatch match;
    if (line.priority == priority &&
        std::regex_match(line.message, match, kLine)) {
      texts.push_back(match[1]);
    }
  }
  return texts;
}

// Every line logged by anyone, for checks that a secret never appears.
inline std::string AllLogText() {
  std::string all;
  for (const auto &line : zark::test::CapturedLogs()) {
    all += line.message;
    all += '\n';
  }
  return all;
}

inline Json::Value ParseJson(const std::string &text) {
  Json::Value value;
  Json::CharReaderBuilder builder;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  std::string errors;
  EXPECT_TRUE(
      reader->parse(text.data(), text.data() + text.size(), &value, &errors))
      << errors;
  return value;
}

// A task record as the polling facility returns it.
inline Json::Value TaskRecord(const Json::Value &data, bool finish = false,
                              bool success = true) {
  Json::Value record(Json::objectValue);
  record["finish"] = finish;
  record["success"] = success;
  record["data"] = data;
  return record;
}

// One system service "svc" with the firewall section "svc_web" (TCP 5000),
// for the paths that go through RouterRuleServHandler.
inline void WriteSystemService() {
  zark::test::WriteFile("/usr/zark/etc.defaults/services.d/svc.sc",
                        "[svc_web]\nprotocol=tcp\nports=5000\n");
}

class OpsTest : public ::testing::Test {
protected:
  void SetUp() override {
    zark::fake::Reset();
    zark::test::ResetFixedPaths();
    zark::test::ClearLogs();
    listener = std::make_shared<RecordingListener>(&timeline);
    response.SetListener(listener);
    pf = std::make_unique<PortForwarding>(new StatusReportor(
        1500, "", "", &response, Json::Value(), false, false));
  }

  void TearDown() override {
    if (HasFailure()) {
      // What was logged helps to see why.
      for (const auto &line : zark::test::CapturedLogs()) {
        std::fprintf(stderr, "  log <%d> %s\n", line.priority,
                     line.message.c_str());
      }
    }
    pf.reset();
    zark::fake::Reset();
  }

  StatusReportor *Reporter() { return pf->GetStatusReportor(); }

  // Puts a call of the fake on the timeline, then lets it do what it did.
  template <typename R, typename... A>
  void Trace(std::function<R(A...)> &fn, const std::string &name) {
    auto inner = fn;
    Timeline *line = &timeline;
    fn = [inner, line, name](A... args) -> R {
      line->Add(name);
      return inner(args...);
    };
  }

  Timeline timeline;
  ZARK::APIResponse response;
  std::shared_ptr<RecordingListener> listener;
  std::unique_ptr<PortForwarding> pf;
};

} // namespace zark::ops

#endif
