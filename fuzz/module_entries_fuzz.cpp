// Fuzz target of the module's entry functions: a random request through a
// row of gTable, as the host would call it, against the fake port-map
// library (tests/fakes/fake_portmap.h) and the real core library, host
// framework and firewall, in a private mount namespace. A background
// method's task is waited for and its status method polled with the task's
// id; every task is then stopped, removed and joined.
//
// Input: pieces separated by kPieceSeparator.
//   piece 0: byte 0 the table row (modulo the row count); byte 1 failures
//            of the fake (bit 0 lock, 1 gateway, 2 rule arrays, 3 save,
//            4 router configuration, 5 detection, 6 empty router database,
//            7 a library job running); byte 2 the saved rules (a subset of
//            a fixed set, odd ports included); byte 3 the save failure's
//            type; byte 4 the parameter name a non-object value is sent as;
//   piece 1: the parameters, JSON text: an object is sent as it is, any
//            other JSON value or text as the one parameter named by byte 4;
//   piece 2: lines of text the fake hands back as the library's data
//            (detection result, router configuration, router database).
//
// Besides not crashing, leaking or hanging:
// - no exception leaves an entry function but the port bitsets'
//   std::out_of_range (which the host turns into an error answer);
// - an error answer carries one of the module's codes (114, 117, 1500 to
//   1530, 9999) or one of the host framework's (100 to 111);
// - a started task is answered with a "task_id" string;
// - the router password sent to RouterConf set appears in no log line.
#include "ZARK.Core.PortForwarding.h"
#include "fake_portmap.h"
#include "fuzz_support.h"
#include "hermetic.h"
#include "syslog_capture.h"
#include "webapi.h"

#include <json/json.h>

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

namespace {

using zark::fuzz::Require;

constexpr const char *kTaskGroups[] = {"admin", "other"};
constexpr const char *kPassword = "Fuzz-R0uter-Passw0rd";

const char *const kParamNames[] = {
    "rules",          "pf_policy",       "task_id",        "task_id_suffix",
    "selection",      "service_id",      "router_brand",   "router_model",
    "router_version", "router_protocol", "router_port",    "router_account",
    "router_pass",    "support_upnp",    "support_natpmp", "auto_save"};

std::size_t RowCount() {
  std::size_t rows = 0;
  while (gTable[rows].szAPI != nullptr) {
    ++rows;
  }
  return rows;
}

const ZARK_API_TABLE *FindRow(const std::string &api,
                              const std::string &method) {
  for (const ZARK_API_TABLE *row = gTable; row->szAPI != nullptr; ++row) {
    if (api == row->szAPI && method == row->szMethod) {
      return row;
    }
  }
  return nullptr;
}

Json::Value Params(std::string_view text, uint8_t nameChoice) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  builder.settings_["failIfExtra"] = true;
  builder.settings_["stackLimit"] = 64;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value value;
  std::string errors;
  const bool parsed =
      reader->parse(text.data(), text.data() + text.size(), &value, &errors);
  if (parsed && value.isObject()) {
    return value;
  }
  Json::Value params(Json::objectValue);
  const char *name = kParamNames[nameChoice % std::size(kParamNames)];
  params[name] = parsed ? value : Json::Value(std::string(text));
  return params;
}

void CopyText(char (&field)[ZARK_PORTMAP_TEXT_SIZE], std::string_view text) {
  const std::size_t length = std::min(text.size(), sizeof(field) - 1);
  if (length > 0) {
    std::memcpy(field, text.data(), length);
  }
  field[length] = '\0';
}

// The fake's behaviour for this input.
void ScriptFake(uint8_t failures, uint8_t ruleChoice, uint8_t saveError,
                std::string_view texts) {
  zark::fake::Reset();
  zark::fake::PortMap &fake = zark::fake::Fake();

  // Port texts as a user or a service file may hold them, odd ones too.
  const ZARK_ROUTER_RULE kRules[] = {
      zark::fake::MakeRule("1", true, "tcp", "8080", "80", "", ""),
      zark::fake::MakeRule("2", false, "udp", "5000-5010", "5000-5010"),
      zark::fake::MakeRule("3", true, "tcp,udp", "65535", "70000", "svc"),
      zark::fake::MakeRule("4", true, "both", "0", "1-65536", "", "name"),
      zark::fake::MakeRule("5", true, "tcp", "99999999999", "-1"),
      zark::fake::MakeRule("", true, "", "", ""),
  };
  for (std::size_t i = 0; i < std::size(kRules); ++i) {
    if ((ruleChoice >> i) & 1) {
      fake.savedRules.push_back(kRules[i]);
      fake.testRules.push_back(kRules[i]);
    }
  }

  std::vector<std::string_view> lines;
  zark::fuzz::InputReader reader(texts);
  while (!reader.Empty()) {
    lines.push_back(reader.Piece("\n"));
  }
  std::size_t next = 0;
  const auto text = [&]() -> std::string_view {
    return next < lines.size() ? lines[next++] : std::string_view();
  };
  ZARK_ROUTER_DETECT_RESULT &detect = fake.detectResult;
  CopyText(detect.gateway_ip, text());
  CopyText(detect.network_interface, text());
  CopyText(detect.router_brand, text());
  CopyText(detect.router_model, text());
  CopyText(detect.router_version, text());
  CopyText(detect.upnp_pfpath, text());
  CopyText(detect.router_user_setting_name, text());
  detect.support_upnp = saveError % 3;
  detect.support_natpmp = (saveError >> 2) % 3;
  detect.router_max_rule = saveError;
  detect.warning = ruleChoice;
  ZARK_ROUTER_CONF &conf = fake.routerConf;
  CopyText(conf.brand, text());
  CopyText(conf.model, text());
  CopyText(conf.version, text());
  CopyText(conf.support_upnp, text());
  CopyText(conf.support_natpmp, text());
  CopyText(conf.conn_type, text());
  CopyText(conf.conn_port, text());
  CopyText(conf.max_rule, text());
  if ((failures & 64) == 0) {
    const std::string_view brand = text();
    const std::string_view model = text();
    const std::string_view version = text();
    fake.routerDB.push_back(zark::fake::MakeRouterDBNode(
        std::string(brand), std::string(model), std::string(version),
        (saveError & 1) != 0));
  }

  if (failures & 1) {
    fake.KLibZarkPortMapLock = [] { return -1; };
  }
  if (failures & 2) {
    fake.KLibGetGatewayIP = [](char *, int) { return -1; };
  }
  if (failures & 4) {
    const auto fail = [saveError](int *count, ZARK_ROUTER_RULE **rules, char *,
                                  bool, ZARK_LIBZARKPORTMAP_ERR *err) {
      *count = 0;
      *rules = nullptr;
      if (err != nullptr) {
        err->err = saveError % 8;
      }
      return -1;
    };
    fake.KLibGetRulesArrFromRuleConf = fail;
    fake.KLibGetRulesArrFromTestRuleConf = fail;
  }
  if (failures & 8) {
    fake.KLibSaveRules = [saveError](const char *, int, ZARK_ROUTER_RULE *,
                                     bool, ZARK_ROUTER_SAVE_RULE_RESULT *result,
                                     ZARK_SAVE_RULE_PROGRESS_CB, void *) {
      if (result != nullptr) {
        result->errType = saveError % 14;
        if (result->errType == 8 || result->errType == 9) {
          CopyText(result->detail.text, "70000");
        } else {
          result->detail.limit.maxPort = 65535;
          result->detail.limit.maxRange = saveError;
        }
      }
      return -1;
    };
  }
  if (failures & 16) {
    fake.KLibGetRouterConf = [saveError](const char *, ZARK_ROUTER_CONF *,
                                         ZARK_LIBZARKPORTMAP_ERR *err, bool) {
      if (err != nullptr) {
        err->err = saveError % 8;
      }
      return -1;
    };
  }
  if (failures & 32) {
    fake.KLibDetectRouter = [](ZARK_ROUTER_DETECT_RESULT *,
                               ZARK_DETECT_PROGRESS_CB, void *,
                               bool) { return -1; };
  }
  if (failures & 128) {
    fake.KLibGetLibZarkPortMapRunningTask =
        [saveError](ZARK_LIBZARKPORTMAP_TASK *task) {
          task->task = 1 + saveError % 2;
          return 0;
        };
  }
}

// Calls one entry; only the bitsets' std::out_of_range may leave it.
ZARK::APIResponse::State Call(const ZARK_API_TABLE &row,
                              const Json::Value &params, Json::Value &data) {
  ZARK::APIRequest request(params);
  ZARK::APIResponse response;
  try {
    row.handler(&request, &response);
  } catch (const std::out_of_range &) {
    return ZARK::APIResponse::State::None;
  } catch (const std::exception &e) {
    zark::fuzz::Broken(std::string(row.szAPI) + " " + row.szMethod +
                       " threw: " + e.what());
  } catch (...) {
    zark::fuzz::Broken(std::string(row.szAPI) + " " + row.szMethod +
                       " threw a non-exception");
  }
  const ZARK::APIResponse::State state = response.GetState();
  if (state == ZARK::APIResponse::State::Error) {
    const int code = response.GetErrorCode();
    Require(code == 114 || code == 117 || code == 9999 ||
                (code >= 1500 && code <= 1530) || (code >= 100 && code <= 111),
            std::string(row.szAPI) + " " + row.szMethod + " answered code " +
                std::to_string(code));
  }
  data = response.GetData();
  return state;
}

void RemoveAllTasks() {
  for (const char *group : kTaskGroups) {
    ZARK::APIPolling polling;
    Json::Value groups(Json::arrayValue);
    groups.append(group);
    Json::Value result;
    if (!polling.List("", groups, result)) {
      continue;
    }
    for (const Json::Value &id : result[group]) {
      polling.Stop(id.asString(), true);
    }
  }
  ZARK::APIPolling::JoinAll();
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int *, char ***) {
  zark::fuzz::EnterHermeticOrDie();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  const std::vector<std::string_view> pieces =
      zark::fuzz::SplitPieces(zark::fuzz::AsText(data, size));
  const auto piece = [&](std::size_t i) {
    return i < pieces.size() ? pieces[i] : std::string_view();
  };
  zark::fuzz::InputReader header(piece(0));
  const uint8_t rowChoice = header.Byte();
  const uint8_t failures = header.Byte();
  const uint8_t ruleChoice = header.Byte();
  const uint8_t saveError = header.Byte();
  const uint8_t nameChoice = header.Byte();

  zark::test::ResetFixedPaths();
  zark::test::ClearLogs();
  ScriptFake(failures, ruleChoice, saveError, piece(2));

  const ZARK_API_TABLE &row = gTable[rowChoice % RowCount()];
  Json::Value params = Params(piece(1), nameChoice);
  const bool setsRouterConf =
      std::string(row.szAPI) == "ZARK.Core.PortForwarding.RouterConf" &&
      std::string(row.szMethod) == "set" && params.isMember("router_pass");
  if (setsRouterConf) {
    params["router_pass"] = kPassword;
  }

  Json::Value answer;
  const ZARK::APIResponse::State state = Call(row, params, answer);

  // A background method answers its task's id; poll it once the task ended.
  const ZARK_API_TABLE *status =
      FindRow(row.szAPI, std::string(row.szMethod) + "_status");
  if (status != nullptr && state == ZARK::APIResponse::State::Success &&
      answer.isMember("task_id")) {
    Require(answer["task_id"].isString(), "a task id that is not a string");
    ZARK::APIPolling::JoinAll();
    Json::Value poll(Json::objectValue);
    poll["task_id"] = answer["task_id"];
    Json::Value ignored;
    (void)Call(*status, poll, ignored);
    (void)Call(*status, poll, ignored);
  }
  RemoveAllTasks();

  if (setsRouterConf) {
    for (const zark::test::LogLine &line : zark::test::CapturedLogs()) {
      Require(line.message.find(kPassword) == std::string::npos,
              "the router password in a log line: " + line.message);
    }
  }
  return 0;
}
