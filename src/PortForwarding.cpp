#include "PortForwarding.h"

#include "RouterRuleConf.h"
#include "RouterRuleServHandler.h"
#include "klibc.h"
#include "zarknet.h"

#include <strings.h>
#include <sys/stat.h>
#include <syslog.h>

#include <cerrno>
#include <climits>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>

// Files written by the port-map library and read here.
#define PF_APPLY_PROGRESS_FILE "/tmp/pfProgress"
#define PF_TEST_STATUS_FILE "/tmp/pfStatusRule"
#define UPNP_TEST_PROGRESS_FILE "/tmp/upnp_test.progress"

// Router database description files and the port-forward tool.
#define ROUTERDB_DIR "/etc.defaults/portforward/routerdb"
#define PORTFORWARD_TOOL_DIR "/usr/zark/bin/"
#define PORTFORWARD_TOOL "zarkportforward"

// Codes this class leaves in the reporter.
#define PF_ERR_NOT_CONFIGURED 1501 // lock not taken, router not configured
#define PF_ERR_NO_EXTERNAL_IP 1502 // external address unknown
#define PF_ERR_NO_GATEWAY 1503     // default gateway unknown
#define PF_ERR_ROUTERDB_UPDATE 1510
#define PF_ERR_MAX_PORT 1521      // library save error type 10
#define PF_ERR_MAX_PORTS 1522     // library save error type 11
#define PF_ERR_MAX_RANGE 1523     // library save error type 12
#define PF_ERR_MAX_RULES 1524     // library save error type 7
#define PF_ERR_BAD_PORT_TEXT 1525 // library save error type 8
#define PF_ERR_BAD_PROTOCOL 1526  // library save error type 9
#define PF_ERR_SERV_POLICY 1527   // service policy could not be written
#define PF_ERR_ROUTERDB_SYNTAX 1530

#define GATEWAY_IP_SIZE 1024
#define APPLY_PROGRESS_LINE_SIZE 128
#define UPNP_TEST_VALUE_SIZE 4096

namespace {

// Detection steps, in the order a run goes through them.
const char *const kDetectSteps[] = {
    "check_interface_enable_step", "check_gateway_setting_step",
    "check_connect_wan_step",      "check_hops_lan2wan_step",
    "check_dns_setting_step",      "detect_router_step",
};
const int kDetectStepCount = sizeof(kDetectSteps) / sizeof(kDetectSteps[0]);

// A text field of a library record: NUL-terminated inside its fixed size.
std::string FieldText(const char *field, size_t size) {
  return std::string(field, strnlen(field, size));
}

// The one conversion of a rule's JSON value: its text if it is a string,
// otherwise the empty text (ports given as numbers are deliberately refused
// this way).
std::string JsonTextOrEmpty(const Json::Value &value) {
  return value.isString() ? value.asString() : std::string();
}

bool JsonBoolOrFalse(const Json::Value &value) {
  return value.isBool() ? value.asBool() : false;
}

// Member of an object, or null when absent or when value is no object
// (JsonCpp asserts on member access of arrays and scalars).
Json::Value MemberOrNull(const Json::Value &value, const char *key) {
  if (!value.isObject()) {
    return Json::Value();
  }
  return value.get(key, Json::Value());
}

bool HasMember(const Json::Value &value, const char *key) {
  return value.isObject() && value.isMember(key);
}

// Copies text into a fixed field, cut to size - 1 characters.
void CopyField(char *field, size_t size, const std::string &text) {
  snprintf(field, size, "%s", text.c_str());
}

bool FileHasData(const char *path) {
  struct stat st;
  return 0 == stat(path, &st) && st.st_size > 0;
}

bool FileExists(const char *path) {
  struct stat st;
  return 0 == stat(path, &st);
}

} // namespace

PortForwarding::PortForwarding(StatusReportor *statusReportor)
    : mStatusReportor(statusReportor) {}

PortForwarding::~PortForwarding() {
  delete mStatusReportor;
  mStatusReportor = NULL;
}

int PortForwarding::GetErrorCode() {
  if (NULL == mStatusReportor) {
    syslog(LOG_ERR, "%s:%d status reportor shall not be NULL", __FILE__,
           __LINE__);
    return 1500;
  }
  return mStatusReportor->mErrorCode;
}

// ---------------------------------------------------------------------------
// Rules: loading.

bool PortForwarding::LoadPortForwardingRules(Json::Value &out) {
  bool ret = false;
  int count = 0;
  ZARK_ROUTER_RULE *rules = NULL;
  ZARK_LIBZARKPORTMAP_ERR err;
  Json::Value array(Json::arrayValue);
  Json::Value rule(Json::objectValue);

  memset(&err, 0, sizeof(err));
  if (NULL == mStatusReportor) {
    syslog(LOG_ERR, "%s:%d status reportor shall not be NULL", __FILE__,
           __LINE__);
  } else if (0 >
             KLibGetRulesArrFromRuleConf(&count, &rules, NULL, false, &err)) {
    if (ZARK_PORTMAP_ERR_NOT_CONFIGURED == err.err) {
      mStatusReportor->mErrorCode = PF_ERR_NOT_CONFIGURED;
    }
    syslog(LOG_ERR, "%s:%d KLibGetRulesByRuleConf() failed", __FILE__,
           __LINE__);
  } else {
    for (int i = 0; NULL != rules && i < count; i++) {
      const ZARK_ROUTER_RULE &r = rules[i];
      rule["enable"] = (0 != r.enable);
      rule["router_port"] = FieldText(r.router_port, sizeof(r.router_port));
      rule["ds_port"] = FieldText(r.ds_port, sizeof(r.ds_port));
      rule["router_protocol"] =
          FieldText(r.router_protocol, sizeof(r.router_protocol));
      rule["serviceid"] = FieldText(r.serviceid, sizeof(r.serviceid));
      rule["service_name"] = FieldText(r.service_name, sizeof(r.service_name));
      rule["rule_id"] = FieldText(r.rule_id, sizeof(r.rule_id));
      array.append(rule);
    }
    ret = true;
  }

  if (NULL != rules) {
    KLibFreeRulesArr(rules);
  }
  out = array;
  return ret;
}

// ---------------------------------------------------------------------------
// Rules: saving and apply progress.

void saveRuleProgressCB(ZARK_ROUTER_SAVE_RULE_RESULT *result, void *arg) {
  StatusReportor *statusReportor = static_cast<StatusReportor *>(arg);

  if (NULL == statusReportor) {
    syslog(LOG_ERR, "%s:%d statusReportor is NULL", __FILE__, __LINE__);
    return;
  }
  if (NULL == result) {
    syslog(LOG_ERR, "%s:%d saveResult is NULL", __FILE__, __LINE__);
    return;
  }
  statusReportor->ReportStatus("processing", result->percentage);
}

void PortForwarding::StartPortForwarding(const Json::Value &params,
                                         Json::Value &data) {
  bool ret = false;
  int count = 0;
  ZARK_ROUTER_RULE *rules = NULL;
  ZARK_ROUTER_SAVE_RULE_RESULT saveResult;
  char gatewayIP[GATEWAY_IP_SIZE];
  RouterRuleConfWriter writer;
  Json::Value jsRules;

  if (NULL == mStatusReportor) {
    syslog(LOG_ERR, "%s:%d status reportor shall not be NULL", __FILE__,
           __LINE__);
    return;
  }
  memset(&saveResult, 0, sizeof(saveResult));
  memset(gatewayIP, 0, sizeof(gatewayIP));

  mStatusReportor->ReportStatus("processing", 1);

  if (0 > KLibZarkPortMapLock()) {
    // Reported here and once more below, after an unlock that has nothing
    // to release: callers have always seen this sequence.
    mStatusReportor->mErrorCode = PF_ERR_NOT_CONFIGURED;
    mStatusReportor->ReportError();
    goto End;
  }

  jsRules = MemberOrNull(params, "rules");
  if (!jsRules.isNull()) {
    if (!jsRules.isArray()) {
      syslog(LOG_ERR, "%s:%d parameter: rules shall be array type", __FILE__,
             __LINE__);
      goto End;
    }
    for (Json::ArrayIndex i = 0; i < jsRules.size(); i++) {
      const Json::Value &jsRule = jsRules[i];
      std::string ruleId = JsonTextOrEmpty(MemberOrNull(jsRule, "rule_id"));
      bool enable = JsonBoolOrFalse(MemberOrNull(jsRule, "enable"));
      std::string protocol =
          JsonTextOrEmpty(MemberOrNull(jsRule, "router_protocol"));
      std::string routerPort =
          JsonTextOrEmpty(MemberOrNull(jsRule, "router_port"));
      std::string dsPort = JsonTextOrEmpty(MemberOrNull(jsRule, "ds_port"));
      std::string serviceId =
          JsonTextOrEmpty(MemberOrNull(jsRule, "serviceid"));
      std::string serviceName =
          JsonTextOrEmpty(MemberOrNull(jsRule, "service_name"));

      // Only a rule with nothing at all to forward is refused here; one
      // with a single field set goes on and the library judges it.
      if (protocol.empty() && routerPort.empty() && dsPort.empty()) {
        syslog(LOG_ERR, "%s:%d protocol, and port should not be empty",
               __FILE__, __LINE__);
        goto End;
      }
      if (!writer.AddRule(ruleId, enable, routerPort, dsPort, protocol,
                          serviceId, serviceName)) {
        syslog(LOG_ERR, "%s:%d add rule failed", __FILE__, __LINE__);
        goto End;
      }
    }
  } else {
    Json::Value policy = MemberOrNull(params, "pf_policy");
    if (policy.isNull()) {
      syslog(LOG_ERR, "%s:%d strange json value", __FILE__, __LINE__);
      goto End;
    }
    RouterRuleServHandler servHandler;
    if (0 > servHandler.SetServPfRules(policy, writer)) {
      syslog(LOG_ERR, "%s:%d write rules failed", __FILE__, __LINE__);
      mStatusReportor->mErrorCode = PF_ERR_SERV_POLICY;
      goto End;
    }
  }

  if (0 > KLibGetGatewayIP(gatewayIP, sizeof(gatewayIP))) {
    syslog(LOG_ERR, "%s:%d unable to get gateway ip", __FILE__, __LINE__);
    mStatusReportor->mErrorCode = PF_ERR_NO_GATEWAY;
    goto End;
  }

  mStatusReportor->ReportStatus("processing", 5);

  if (!writer.ToArray(&count, &rules)) {
    syslog(LOG_ERR, "%s:%d ruleConf to array failed", __FILE__, __LINE__);
    goto End;
  }

  if (0 > KLibSaveRules(gatewayIP, count, rules, false, &saveResult,
                        saveRuleProgressCB, mStatusReportor)) {
    switch (saveResult.errType) {
    case ZARK_SAVE_ERR_NOT_CONFIGURED:
      mStatusReportor->mErrorCode = PF_ERR_NOT_CONFIGURED;
      break;
    case ZARK_SAVE_ERR_TOO_MANY_RULES:
      mStatusReportor->mErrorCode = PF_ERR_MAX_RULES;
      data["max_port"] = saveResult.detail.limit.maxPort;
      mStatusReportor->SetAppendErrorData(data);
      break;
    case ZARK_SAVE_ERR_BAD_PORT_TEXT:
      mStatusReportor->mErrorCode = PF_ERR_BAD_PORT_TEXT;
      data = FieldText(saveResult.detail.text, sizeof(saveResult.detail.text));
      mStatusReportor->SetAppendErrorData(data);
      break;
    case ZARK_SAVE_ERR_BAD_PROTOCOL:
      mStatusReportor->mErrorCode = PF_ERR_BAD_PROTOCOL;
      data = FieldText(saveResult.detail.text, sizeof(saveResult.detail.text));
      mStatusReportor->SetAppendErrorData(data);
      break;
    case ZARK_SAVE_ERR_PORT_TOO_HIGH:
      mStatusReportor->mErrorCode = PF_ERR_MAX_PORT;
      data["max_port"] = saveResult.detail.limit.maxPort;
      mStatusReportor->SetAppendErrorData(data);
      break;
    case ZARK_SAVE_ERR_TOO_MANY_PORTS:
      mStatusReportor->mErrorCode = PF_ERR_MAX_PORTS;
      data["max_port"] = saveResult.detail.limit.maxPort;
      mStatusReportor->SetAppendErrorData(data);
      break;
    case ZARK_SAVE_ERR_RANGE_TOO_LONG:
      mStatusReportor->mErrorCode = PF_ERR_MAX_RANGE;
      data["max_port"] = saveResult.detail.limit.maxPort;
      data["max_range"] = saveResult.detail.limit.maxRange;
      mStatusReportor->SetAppendErrorData(data);
      break;
    default:
      syslog(LOG_ERR, "%s:%d unknown err enum type", __FILE__, __LINE__);
      break;
    }
    goto End;
  }

  ret = true;
End:
  if (NULL != rules) {
    KLibFreeRulesArr(rules);
  }
  KLibZarkPortMapUnLock();
  if (ret) {
    mStatusReportor->ReportStatus("success", 100);
  } else {
    mStatusReportor->ReportError();
  }
}

// "/tmp/pfProgress" holds one line per apply step, the last one current:
//   del=3/6      removing old rules, 3 of 6 done (first half of the work)
//   add=3/6      adding new rules, 3 of 6 done (second half)
// Lines are read with a 128-byte buffer: a longer line is taken in pieces
// of at most 127 characters and the last piece read is what is parsed.
bool PortForwarding::GetPortfwdApplyStatus(std::string &stage,
                                           int &percentage) {
  bool ret = false;
  FILE *fp = NULL;
  char *line = NULL;
  char *equal = NULL;
  char *slash = NULL;
  long done = 0;
  long total = 0;
  double fraction = 0.0;

  line = static_cast<char *>(calloc(1, APPLY_PROGRESS_LINE_SIZE));
  if (NULL == line) {
    goto End;
  }
  fp = fopen(PF_APPLY_PROGRESS_FILE, "r");
  if (NULL == fp) {
    goto End;
  }
  // At end of file fgets leaves the buffer as it was: the last line stays.
  while (NULL != fgets(line, APPLY_PROGRESS_LINE_SIZE, fp)) {
  }
  if (ferror(fp)) {
    goto End;
  }

  equal = strchr(line, '=');
  if ('\0' == line[0] || NULL == equal) {
    stage = "del";
    fraction = 0.0;
  } else {
    *equal = '\0';
    stage = line;
    slash = strchr(equal + 1, '/');
    if (NULL != slash) {
      *slash = '\0';
      done = strtol(equal + 1, NULL, 10);
      total = strtol(slash + 1, NULL, 10);
    } else {
      // No total given: nothing can be said about this stage's progress.
      done = strtol(equal + 1, NULL, 10);
      total = 0;
    }
    fraction = (0 == total) ? 0.0
                            : static_cast<double>(done) /
                                  static_cast<double>(total) * 0.5;
  }
  if (stage == "add") {
    fraction += 0.5;
  }
  if (fraction > 1.0) {
    fraction = 1.0;
  }
  // A negative count gives a negative percentage, as the formula says; one
  // so large that it has no int is the lowest int, so that the conversion
  // stays defined. fraction is at most 1.0, never NaN (total 0 is handled).
  fraction = std::trunc(fraction * 100);
  if (fraction < static_cast<double>(INT_MIN)) {
    fraction = static_cast<double>(INT_MIN);
  }
  percentage = static_cast<int>(fraction);
  ret = true;
End:
  if (NULL != fp) {
    fclose(fp);
  }
  free(line);
  return ret;
}

bool PortForwarding::StartPortForwardingStatus(Json::Value &out,
                                               const Json::Value &task) {
  std::string status;
  int percentage = 0;

  if (NULL == mStatusReportor) {
    // Nothing to report the error through.
    syslog(LOG_ERR, "%s:%d mStatusReportor is NULL", __FILE__, __LINE__);
    return false;
  }
  if (!GetStatusAndPercentage(status, percentage, task)) {
    syslog(LOG_ERR, "%s:%d get status and percentage failed", __FILE__,
           __LINE__);
    mStatusReportor->ReportError();
    return false;
  }

  if (!(status == "success" && 100 == percentage) &&
      FileHasData(PF_APPLY_PROGRESS_FILE)) {
    std::string stage;
    int applyPercentage = 0;
    errno = 0;
    if (GetPortfwdApplyStatus(stage, applyPercentage)) {
      out["stage"] = stage;
      status = "processing";
      percentage = applyPercentage;
    } else if (ENOENT != errno) {
      syslog(LOG_ERR, "%s:%d get pf apply status failed", __FILE__, __LINE__);
      mStatusReportor->ReportError();
      return false;
    }
    // ENOENT: the save ended and the library removed the file between the
    // check above and the open; the poll answers as if it had not been
    // there, not as a failed save.
  }

  out["status"] = status;
  out["percentage"] = percentage;
  return true;
}

// Readers of a task record: {"data": {"status": "...", "percentage": n}}.
bool PortForwarding::GetStatus(std::string &status, const Json::Value &task) {
  if (!HasMember(task, "data")) {
    syslog(LOG_ERR, "%s:%d data does not exist", __FILE__, __LINE__);
    return false;
  }
  const Json::Value &data = task["data"];
  if (!HasMember(data, "status")) {
    syslog(LOG_ERR, "%s:%d status does not exist", __FILE__, __LINE__);
    return false;
  }
  if (!data["status"].isString()) {
    syslog(LOG_ERR, "%s:%d status is not string type", __FILE__, __LINE__);
    return false;
  }
  status = data["status"].asString();
  if (status.empty()) {
    syslog(LOG_ERR, "%s:%d status shall not be empty", __FILE__, __LINE__);
    return false;
  }
  return true;
}

bool PortForwarding::GetPercentage(int &percentage, const Json::Value &task) {
  if (!HasMember(task, "data")) {
    syslog(LOG_ERR, "%s:%d data does not exist", __FILE__, __LINE__);
    return false;
  }
  const Json::Value &data = task["data"];
  if (!HasMember(data, "percentage")) {
    syslog(LOG_ERR, "%s:%d percentage does not exist", __FILE__, __LINE__);
    return false;
  }
  if (!data["percentage"].isInt()) {
    syslog(LOG_ERR, "%s:%d percentage is not int type", __FILE__, __LINE__);
    return false;
  }
  percentage = data["percentage"].asInt();
  if (percentage < 0) {
    syslog(LOG_ERR, "%s:%d percentage shall not be negative", __FILE__,
           __LINE__);
    return false;
  }
  return true;
}

bool PortForwarding::GetStatusAndPercentage(std::string &status,
                                            int &percentage,
                                            const Json::Value &task) {
  if (!HasMember(task, "data")) {
    syslog(LOG_ERR, "%s:%d data does not exist", __FILE__, __LINE__);
    return false;
  }
  const Json::Value &data = task["data"];
  if (!HasMember(data, "status")) {
    syslog(LOG_ERR, "%s:%d status does not exist", __FILE__, __LINE__);
    return false;
  }
  if (!HasMember(data, "percentage")) {
    syslog(LOG_ERR, "%s:%d percentage does not exist", __FILE__, __LINE__);
    return false;
  }
  if (!data["status"].isString()) {
    syslog(LOG_ERR, "%s:%d status is not string type", __FILE__, __LINE__);
    return false;
  }
  if (!data["percentage"].isInt()) {
    syslog(LOG_ERR, "%s:%d percentage is not int type", __FILE__, __LINE__);
    return false;
  }
  status = data["status"].asString();
  percentage = data["percentage"].asInt();
  if (status.empty()) {
    syslog(LOG_ERR, "%s:%d status shall not be empty", __FILE__, __LINE__);
    return false;
  }
  if (percentage < 0) {
    syslog(LOG_ERR, "%s:%d percentage shall not be negative", __FILE__,
           __LINE__);
    return false;
  }
  return true;
}

// ---------------------------------------------------------------------------
// Rules: port connection test.

void PortForwarding::TestPortConnection(const Json::Value &params) {
  bool ret = false;
  int count = 0;
  ZARK_ROUTER_RULE *rules = NULL;
  ZARK_LIBZARKPORTMAP_ERR err;
  char confPath[1024];
  char gatewayIP[GATEWAY_IP_SIZE];
  Json::Value selection;

  memset(&err, 0, sizeof(err));
  memset(confPath, 0, sizeof(confPath));
  memset(gatewayIP, 0, sizeof(gatewayIP));

  if (NULL == mStatusReportor) {
    syslog(LOG_ERR, "%s:%d status reportor shall not be NULL", __FILE__,
           __LINE__);
    goto End;
  }
  if (0 > KLibZarkPortMapLock()) {
    // The final step reports again and unlocks unconditionally.
    mStatusReportor->mErrorCode = PF_ERR_NOT_CONFIGURED;
    mStatusReportor->ReportError();
    goto End;
  }

  mStatusReportor->ReportStatus("prepare", 0);

  selection = MemberOrNull(params, "selection");
  if (!selection.isNull()) {
    std::string text = JsonTextOrEmpty(selection);
    char *path = NULL;
    if (!text.empty()) {
      CopyField(confPath, sizeof(confPath), text);
      path = confPath;
    }
    if (0 > KLibGetRulesArrFromRuleConf(&count, &rules, path, false, NULL)) {
      syslog(LOG_ERR, "%s:%d GetRulesFromRuleConf() failed", __FILE__,
             __LINE__);
      goto End;
    }
  } else {
    Json::Value serviceIds = MemberOrNull(params, "service_id");
    if (serviceIds.isNull()) {
      syslog(LOG_ERR, "%s:%d JSON::Value in foramt fail", __FILE__, __LINE__);
      goto End;
    }
    RouterRuleServHandler servHandler;
    if (0 > servHandler.SetServPfTestRules(serviceIds)) {
      syslog(LOG_ERR, "%s:%d SetServPfTestRules failed", __FILE__, __LINE__);
      goto End;
    }
    if (0 >
        KLibGetRulesArrFromTestRuleConf(&count, &rules, NULL, false, NULL)) {
      syslog(LOG_ERR, "%s:%d GetRulesFromTestRuleConf() failed", __FILE__,
             __LINE__);
      goto End;
    }
  }

  if (NULL == rules) {
    // Nothing to test.
    ret = true;
    goto End;
  }

  // Both addresses only have to be known; the library finds them itself.
  if (0 > KLibGetGatewayIP(gatewayIP, sizeof(gatewayIP))) {
    mStatusReportor->mErrorCode = PF_ERR_NO_GATEWAY;
    syslog(LOG_ERR, "%s:%d unable to get gateway ip", __FILE__, __LINE__);
    goto End;
  }
  if (0 == ZARKIGetExternalIP()) {
    mStatusReportor->mErrorCode = PF_ERR_NO_EXTERNAL_IP;
    syslog(LOG_ERR, "%s:%d unable to get external ip", __FILE__, __LINE__);
    goto End;
  }
  if (0 > KLibTestRulesInit()) {
    syslog(LOG_ERR, "%s:%d KLibTestRulesInit() failed", __FILE__, __LINE__);
    goto End;
  }

  mStatusReportor->ReportStatus("begin", 0);
  if (0 > KLibTestRules(count, rules, &err, false)) {
    syslog(LOG_ERR, "%s:%d KLibTestRules() failed", __FILE__, __LINE__);
    goto End;
  }

  ret = true;
End:
  if (NULL != rules) {
    KLibFreeRulesArr(rules);
  }
  if (NULL != mStatusReportor) {
    if (ret) {
      mStatusReportor->ReportStatus("finish", 0);
    } else {
      mStatusReportor->ReportError();
    }
  }
  KLibZarkPortMapUnLock();
}

// "/tmp/pfStatusRule" holds one line per tested rule, "<rule id>=<result>";
// an empty result means the rule is still being tested:
//   1=ok
//   2=
bool PortForwarding::TestPortConnectionStatus(Json::Value &out,
                                              const Json::Value &task) {
  std::string status;
  Json::Value rules(Json::objectValue);
  FILE *fp = NULL;
  char *line = NULL;
  size_t lineSize = 0;

  if (!GetStatus(status, task)) {
    syslog(LOG_ERR, "%s:%d get status and percentage failed", __FILE__,
           __LINE__);
    return false;
  }

  if (status == "prepare") {
    out["status"] = "wait";
    return true;
  } else if (status == "begin") {
    out["status"] = "update";
  } else if (status == "finish") {
    out["status"] = "success";
  } else {
    syslog(LOG_ERR, "%s:%d no supported status=%s", __FILE__, __LINE__,
           status.c_str());
    return false;
  }

  if (!FileExists(PF_TEST_STATUS_FILE)) {
    syslog(LOG_ERR, "%s:%d finished but no status file=%s", __FILE__, __LINE__,
           PF_TEST_STATUS_FILE);
    return false;
  }
  fp = fopen(PF_TEST_STATUS_FILE, "r");
  if (NULL == fp) {
    syslog(LOG_INFO, "%s:%d can't open status file=%s", __FILE__, __LINE__,
           PF_TEST_STATUS_FILE);
    return false;
  }

  while (-1 != getline(&line, &lineSize, fp)) {
    size_t len = strlen(line);
    if (len > 0 && '\n' == line[len - 1]) {
      line[len - 1] = '\0';
    }
    char *equal = strchr(line, '=');
    if (NULL == equal) {
      continue;
    }
    *equal = '\0';
    const char *result = equal + 1;
    rules[line] = ('\0' == result[0]) ? "testing" : result;
  }
  free(line);

  out["rules"] = rules;
  return 0 == fclose(fp);
}

// ---------------------------------------------------------------------------
// Router database and router list.

bool PortForwarding::UpdateRouterList(Json::Value &result) {
  int version = 0;

  if (NULL == mStatusReportor) {
    syslog(LOG_ERR, "%s:%d mStatusReportor is NULL", __FILE__, __LINE__);
  } else if (0 > KLibUpdateRouterDBList(&version)) {
    syslog(LOG_ERR, "%s:%d KLibUpdateRouterDBList() failed", __FILE__,
           __LINE__);
  } else {
    result["router_version"] = version;
    return true;
  }

  if (NULL != mStatusReportor) {
    mStatusReportor->mErrorCode = PF_ERR_ROUTERDB_UPDATE;
  }
  syslog(LOG_ERR, "%s:%d update routerdb failed", __FILE__, __LINE__);
  return false;
}

bool PortForwarding::ListRouterList(Json::Value &result) {
  bool ret = false;
  ZARK_ROUTERDB_LIST *routerDBList = NULL;
  Json::Value routers(Json::arrayValue);
  Json::Value router(Json::objectValue);

  if (0 > KLibGetRouterDBList(&routerDBList)) {
    syslog(LOG_ERR, "%s:%d KLibGetRouterDBList() failed", __FILE__, __LINE__);
  } else if (NULL == routerDBList) {
    // An empty database is a failure, not an empty list.
    syslog(LOG_ERR, "%s:%d plRouterDBList is NULL", __FILE__, __LINE__);
  } else {
    for (ZARK_ROUTERDB_LIST *node = routerDBList; NULL != node;
         node = node->next) {
      router["router_brand"] = FieldText(node->brand, sizeof(node->brand));
      router["router_model"] = FieldText(node->model, sizeof(node->model));
      router["router_version"] =
          FieldText(node->version, sizeof(node->version));
      router["generic"] = node->generic;
      routers.append(router);
    }
    result["routers"] = routers;
    ret = true;
  }

  if (NULL != routerDBList) {
    KLibFreeRouterDBList(routerDBList);
  }
  return ret;
}

bool PortForwarding::GetRouterDesc(Json::Value &result) {
  char gatewayIP[GATEWAY_IP_SIZE];
  ZARK_ROUTER_DESC desc;
  ZARK_LIBZARKPORTMAP_ERR err;

  if (NULL == mStatusReportor) {
    syslog(LOG_ERR, "%s:%d mStatusReportor is NULL", __FILE__, __LINE__);
    return false;
  }
  memset(gatewayIP, 0, sizeof(gatewayIP));
  memset(&desc, 0, sizeof(desc));
  memset(&err, 0, sizeof(err));

  if (0 > KLibGetGatewayIP(gatewayIP, sizeof(gatewayIP))) {
    mStatusReportor->mErrorCode = PF_ERR_NO_GATEWAY;
    syslog(LOG_ERR, "%s:%d unable to get gateway ip", __FILE__, __LINE__);
    return false;
  }
  if (0 <= KLibGetRouterDesc(gatewayIP, &desc, &err, true)) {
    result["support_change_port"] = desc.support_change_port;
    return true;
  }

  if (ZARK_PORTMAP_ERR_DB_SYNTAX == err.err) {
    syslog(LOG_ERR, "%s:%d routerdb syntax version error", __FILE__, __LINE__);
    mStatusReportor->mErrorCode = PF_ERR_ROUTERDB_SYNTAX;
  }
  syslog(LOG_ERR, "%s:%d get router desc failed err=%d", __FILE__, __LINE__,
         err.err);
  return false;
}

// ---------------------------------------------------------------------------
// Router configuration.

bool PortForwarding::GetRouterConf(Json::Value &result) {
  char gatewayIP[GATEWAY_IP_SIZE];
  ZARK_ROUTER_CONF conf;
  ZARK_LIBZARKPORTMAP_ERR err;

  memset(gatewayIP, 0, sizeof(gatewayIP));
  memset(&conf, 0, sizeof(conf));
  memset(&err, 0, sizeof(err));

  if (NULL == mStatusReportor) {
    syslog(LOG_ERR, "%s:%d mStatusReportor is NULL", __FILE__, __LINE__);
    return false;
  }
  if (0 > KLibGetGatewayIP(gatewayIP, sizeof(gatewayIP))) {
    mStatusReportor->mErrorCode = PF_ERR_NO_GATEWAY;
    syslog(LOG_ERR, "%s:%d unable to get gateway ip", __FILE__, __LINE__);
    return false;
  }
  if (0 <= KLibGetRouterConf(gatewayIP, &conf, &err, false)) {
    result["router_brand"] = FieldText(conf.brand, sizeof(conf.brand));
    result["router_model"] = FieldText(conf.model, sizeof(conf.model));
    result["router_version"] = FieldText(conf.version, sizeof(conf.version));
    result["support_upnp"] =
        FieldText(conf.support_upnp, sizeof(conf.support_upnp));
    result["support_natpmp"] =
        FieldText(conf.support_natpmp, sizeof(conf.support_natpmp));
    result["router_port"] = FieldText(conf.conn_port, sizeof(conf.conn_port));
    result["router_protocol"] =
        FieldText(conf.conn_type, sizeof(conf.conn_type));
    result["router_max_rule"] = FieldText(conf.max_rule, sizeof(conf.max_rule));
    return true;
  }

  if (ZARK_PORTMAP_ERR_NOT_CONFIGURED == err.err) {
    // Not configured yet is an ordinary answer, not worth a log line.
    mStatusReportor->mErrorCode = PF_ERR_NOT_CONFIGURED;
  } else if (ZARK_PORTMAP_ERR_DB_SYNTAX == err.err) {
    syslog(LOG_ERR, "%s:%d routerdb syntax version error", __FILE__, __LINE__);
    mStatusReportor->mErrorCode = PF_ERR_ROUTERDB_SYNTAX;
  } else {
    syslog(LOG_ERR, "%s:%d KLibGetRouterConf() failed", __FILE__, __LINE__);
  }
  return false;
}

bool PortForwarding::ApplyRouterConf(
    StatusReportor *statusReportor, const std::string &gatewayIP,
    const std::string &brand, const std::string &model,
    const std::string &version, const std::string &connType,
    const std::string &connPort, bool hasAccount, const std::string &account,
    const std::string &password, const std::string &supportUpnp,
    const std::string &supportNatpmp) {
  ZARK_ROUTER_CONF conf;
  ZARK_LIBZARKPORTMAP_ERR err;

  memset(&conf, 0, sizeof(conf));
  memset(&err, 0, sizeof(err));

  // A router driven by UPnP or NAT-PMP needs no login and no address of its
  // own pages; any other router is configured through those pages.
  if (supportUpnp != "yes" && supportNatpmp != "yes") {
    if (hasAccount) {
      if (account.empty()) {
        // An empty login drops the password too.
        CopyField(conf.account, sizeof(conf.account), "");
        CopyField(conf.password, sizeof(conf.password), "");
      } else {
        CopyField(conf.account, sizeof(conf.account), account);
        CopyField(conf.password, sizeof(conf.password), password);
      }
    }
    if (connType.empty()) {
      syslog(LOG_ERR, "%s:%d conntype shall not be empty", __FILE__, __LINE__);
      return false;
    }
    CopyField(conf.conn_type, sizeof(conf.conn_type), connType);
    if (connPort.empty()) {
      syslog(LOG_ERR, "%s:%d connport shall not be empty", __FILE__, __LINE__);
      return false;
    }
    CopyField(conf.conn_port, sizeof(conf.conn_port), connPort);
  }

  CopyField(conf.brand, sizeof(conf.brand), brand);
  CopyField(conf.model, sizeof(conf.model), model);
  CopyField(conf.version, sizeof(conf.version), version);
  CopyField(conf.support_upnp, sizeof(conf.support_upnp), supportUpnp);
  CopyField(conf.support_natpmp, sizeof(conf.support_natpmp), supportNatpmp);

  if (0 <= KLibSetRouterConf(gatewayIP.c_str(), &conf, &err, true)) {
    return true;
  }

  if (ZARK_PORTMAP_ERR_DB_SYNTAX == err.err) {
    syslog(LOG_ERR, "%s:%d routerdb syntax version error", __FILE__, __LINE__);
    if (NULL != statusReportor) {
      statusReportor->mErrorCode = PF_ERR_ROUTERDB_SYNTAX;
    }
  }
  // "get" in this line of the set path is what log watchers look for.
  syslog(LOG_ERR, "%s:%d get router conf failed err=%d", __FILE__, __LINE__,
         err.err);
  return false;
}

namespace {

// Splits the name of a router found by UPnP detection,
//   "<brand>: <model>(<version>)"   or   "<brand>: <model>",
// into brand and model (at most 511 characters each) and version (at most
// 1023). Without a version in the name it is the "version" of the model's
// generic description in the router database.
bool SplitRouterName(const std::string &pfpath, std::string &brand,
                     std::string &model, std::string &version) {
  char brandBuf[512];
  char modelBuf[512];
  char versionBuf[1024];
  char descPath[4096];

  memset(brandBuf, 0, sizeof(brandBuf));
  memset(modelBuf, 0, sizeof(modelBuf));
  memset(versionBuf, 0, sizeof(versionBuf));
  memset(descPath, 0, sizeof(descPath));

  size_t colon = pfpath.find(": ");
  if (std::string::npos == colon) {
    syslog(LOG_ERR, "%s:%d incorrect information", __FILE__, __LINE__);
    return false;
  }
  snprintf(brandBuf, sizeof(brandBuf), "%s", pfpath.substr(0, colon).c_str());

  size_t modelStart = colon + 2;
  size_t paren = pfpath.find('(', colon);
  if (std::string::npos != paren) {
    std::string modelText = paren > modelStart
                                ? pfpath.substr(modelStart, paren - modelStart)
                                : std::string();
    snprintf(modelBuf, sizeof(modelBuf), "%s", modelText.c_str());
    snprintf(versionBuf, sizeof(versionBuf), "%s",
             pfpath.substr(paren + 1).c_str());
    char *close = strrchr(versionBuf, ')');
    if (NULL != close) {
      *close = '\0';
    }
  } else {
    snprintf(modelBuf, sizeof(modelBuf), "%s",
             pfpath.substr(modelStart).c_str());
    snprintf(descPath, sizeof(descPath), "%s/%s/%s/%s", ROUTERDB_DIR, brandBuf,
             modelBuf, "generic");
    if (1 > KLIBCFileGetKeyValue(descPath, "version", versionBuf,
                                 sizeof(versionBuf), 0)) {
      syslog(LOG_ERR, "%s:%d incorrect information", __FILE__, __LINE__);
      return false;
    }
  }

  brand = brandBuf;
  model = modelBuf;
  version = versionBuf;
  return true;
}

} // namespace

bool PortForwarding::SetRouterConf(
    Json::Value &result, const std::string &brand, const std::string &model,
    const std::string &version, const std::string &connType,
    const std::string &connPort, bool hasAccount, const std::string &account,
    const std::string &password, const std::string &supportUpnp,
    const std::string &supportNatpmp) {
  ZARK_ROUTER_DETECT_RESULT detectResult;
  char gatewayIP[GATEWAY_IP_SIZE];
  char command[4096];
  std::string pfpath;

  (void)result; // a successful set answers an empty object
  memset(&detectResult, 0, sizeof(detectResult));
  memset(gatewayIP, 0, sizeof(gatewayIP));
  memset(command, 0, sizeof(command));

  if (NULL == mStatusReportor) {
    syslog(LOG_ERR, "%s:%d status reportor shall not be NULL", __FILE__,
           __LINE__);
    return false;
  }
  if (0 > KLibGetGatewayIP(gatewayIP, sizeof(gatewayIP))) {
    mStatusReportor->mErrorCode = PF_ERR_NO_GATEWAY;
    syslog(LOG_ERR, "%s:%d unable to get gateway ip", __FILE__, __LINE__);
    return false;
  }
  if (0 > KLibGetRouterDetectResult(&detectResult)) {
    syslog(LOG_ERR, "%s:%d KLibGetRouterDetectResult failed", __FILE__,
           __LINE__);
    return false;
  }

  // A UPnP router found by detection gets a configuration of its own under
  // its detected name, driven through its pages, before the user's choice
  // is stored; the port-forward tool picks that configuration up.
  pfpath =
      FieldText(detectResult.upnp_pfpath, sizeof(detectResult.upnp_pfpath));
  if (supportUpnp == "yes" && !pfpath.empty()) {
    std::string pfBrand;
    std::string pfModel;
    std::string pfVersion;

    if (!SplitRouterName(pfpath, pfBrand, pfModel, pfVersion)) {
      syslog(LOG_ERR, "%s:%d split router name failed", __FILE__, __LINE__);
      return false;
    }
    if (!ApplyRouterConf(mStatusReportor, gatewayIP, pfBrand, pfModel,
                         pfVersion, connType, connPort, hasAccount, account,
                         password, "no", "no")) {
      syslog(LOG_ERR, "%s:%d set pfpath router conf failed", __FILE__,
             __LINE__);
      return false;
    }
    snprintf(command, sizeof(command), "%s%s >/dev/null 2>&1",
             PORTFORWARD_TOOL_DIR, PORTFORWARD_TOOL);
    // Only a tool that could not be run at all fails the set; its own exit
    // status is its business.
    if (-1 == KLIBCSystem(command)) {
      syslog(LOG_ERR, "%s:%d execute %s failed", __FILE__, __LINE__,
             PORTFORWARD_TOOL);
      return false;
    }
  }

  if (!ApplyRouterConf(mStatusReportor, gatewayIP, brand, model, version,
                       connType, connPort, hasAccount, account, password,
                       supportUpnp, supportNatpmp)) {
    syslog(LOG_ERR, "%s:%d set router conf failed", __FILE__, __LINE__);
    return false;
  }
  return true;
}

// ---------------------------------------------------------------------------
// Detection.

void PortForwarding::InitDetectStep(Json::Value &progress, const char *step,
                                    int checkId) {
  Json::Value item(Json::objectValue);
  item["check_id"] = checkId;
  item["status"] = "initial";
  progress[step] = item;
}

void PortForwarding::SetDetectStepStatus(Json::Value &progress,
                                         const char *step, const char *status) {
  progress[step]["status"] = status;
}

void PortForwarding::FinishDetectStep(Json::Value &progress, const char *step,
                                      uint32_t warning) {
  Json::Value &item = progress[step];

  if (0 == strcmp(step, "check_gateway_setting_step") &&
      (warning & ZARK_DETECT_WARN_GATEWAY)) {
    item["status"] = "warning";
  } else if (0 == strcmp(step, "check_hops_lan2wan_step") &&
             (warning & ZARK_DETECT_WARN_HOPS_UNKNOWN)) {
    item["status"] = "warning";
    item["warning_type"] = "get_hops_fail";
  } else if (0 == strcmp(step, "check_hops_lan2wan_step") &&
             (warning & ZARK_DETECT_WARN_HOPS_OVER_ONE)) {
    item["status"] = "warning";
    item["warning_type"] = "hops_over_one";
  } else {
    item["status"] = "success";
  }
}

void PortForwarding::FinishDetectStepsUpTo(
    Json::Value &progress, const ZARK_ROUTER_DETECT_RESULT &record,
    const char *lastStep) {
  for (int i = 0; i < kDetectStepCount; i++) {
    const char *step = kDetectSteps[i];

    FinishDetectStep(progress, step, record.warning);
    if (0 == strcmp(step, "check_interface_enable_step")) {
      progress[step]["network_interface"] =
          FieldText(record.network_interface, sizeof(record.network_interface));
    } else if (0 == strcmp(step, "check_gateway_setting_step")) {
      progress[step]["gateway_ip"] =
          FieldText(record.gateway_ip, sizeof(record.gateway_ip));
    } else if (0 == strcmp(step, "check_hops_lan2wan_step")) {
      progress[step]["hops_number"] = record.hops;
    }
    if (0 == strcmp(step, lastStep)) {
      break;
    }
  }
}

// Stage numbers are the library's fixed identifiers, not a running
// percentage: the hops check (70) runs before the DNS check (50).
void PortForwarding::ApplyDetectProgress(
    Json::Value &progress, const ZARK_ROUTER_DETECT_RESULT &record) {
  switch (record.enProgress) {
  case ZARK_DETECT_STAGE_START:
  case ZARK_DETECT_STAGE_INTERFACE:
    SetDetectStepStatus(progress, "check_interface_enable_step", "processing");
    break;
  case ZARK_DETECT_STAGE_GATEWAY:
    FinishDetectStepsUpTo(progress, record, "check_interface_enable_step");
    SetDetectStepStatus(progress, "check_gateway_setting_step", "processing");
    break;
  case ZARK_DETECT_STAGE_WAN:
    FinishDetectStepsUpTo(progress, record, "check_gateway_setting_step");
    SetDetectStepStatus(progress, "check_connect_wan_step", "processing");
    break;
  case ZARK_DETECT_STAGE_HOPS:
    FinishDetectStepsUpTo(progress, record, "check_connect_wan_step");
    SetDetectStepStatus(progress, "check_hops_lan2wan_step", "processing");
    break;
  case ZARK_DETECT_STAGE_DNS:
    FinishDetectStepsUpTo(progress, record, "check_hops_lan2wan_step");
    SetDetectStepStatus(progress, "check_dns_setting_step", "processing");
    break;
  case ZARK_DETECT_STAGE_ROUTER:
    FinishDetectStepsUpTo(progress, record, "check_dns_setting_step");
    SetDetectStepStatus(progress, "detect_router_step", "processing");
    break;
  case ZARK_DETECT_STAGE_DONE:
    FinishDetectStepsUpTo(progress, record, "detect_router_step");
    break;
  default:
    syslog(LOG_ERR, "%s:%d non spport detect progress type=%d", __FILE__,
           __LINE__, record.enProgress);
    break;
  }
}

void DetectProgressCB(ZARK_ROUTER_DETECT_RESULT *result, void *arg) {
  StatusReportor *statusReportor = static_cast<StatusReportor *>(arg);
  Json::Value progress(Json::objectValue);
  Json::Value data(Json::objectValue);

  if (NULL == statusReportor) {
    syslog(LOG_ERR, "%s:%d statusReportor is NULL", __FILE__, __LINE__);
    return;
  }
  if (NULL == result) {
    syslog(LOG_ERR, "%s:%d detectResult is NULL", __FILE__, __LINE__);
    return;
  }
  for (int i = 0; i < kDetectStepCount; i++) {
    PortForwarding::InitDetectStep(progress, kDetectSteps[i], i + 1);
  }
  PortForwarding::ApplyDetectProgress(progress, *result);
  data["progress"] = progress;
  statusReportor->ReportStatus(data, "processing", result->enProgress);
}

// "yes" for 1, "no" for 0, "unknown" for anything else.
static const char *DetectSupportWord(int32_t support) {
  if (1 == support) {
    return "yes";
  }
  return (0 == support) ? "no" : "unknown";
}

void PortForwarding::SetDetectResult(Json::Value &result,
                                     const ZARK_ROUTER_DETECT_RESULT &record) {
  Json::Value progress(Json::objectValue);

  result["support_natpmp"] = DetectSupportWord(record.support_natpmp);
  result["support_upnp"] = DetectSupportWord(record.support_upnp);
  result["router_brand"] =
      FieldText(record.router_brand, sizeof(record.router_brand));
  result["router_model"] =
      FieldText(record.router_model, sizeof(record.router_model));
  result["router_version"] =
      FieldText(record.router_version, sizeof(record.router_version));
  result["upnp_pfpath"] =
      FieldText(record.upnp_pfpath, sizeof(record.upnp_pfpath));
  result["router_user_setting_name"] = FieldText(
      record.router_user_setting_name, sizeof(record.router_user_setting_name));
  result["router_max_rule"] = record.router_max_rule;
  FinishDetectStepsUpTo(progress, record, "detect_router_step");
  result["progress"] = progress;
}

void PortForwarding::Detect(Json::Value &result, bool autoSave) {
  ZARK_ROUTER_DETECT_RESULT detectResult;
  int rc = 0;

  // Detection never stores a router configuration by itself.
  (void)autoSave;
  memset(&detectResult, 0, sizeof(detectResult));
  if (NULL == mStatusReportor) {
    syslog(LOG_ERR, "%s:%d statusReportor is NULL", __FILE__, __LINE__);
    return;
  }

  rc = KLibDetectRouter(&detectResult, DetectProgressCB, mStatusReportor, true);
  if (0 == rc) {
    SetDetectResult(result, detectResult);
    mStatusReportor->ReportStatus(result, "success", 100);
    return;
  }
  if (0 < rc) {
    syslog(LOG_ERR, "%s:%d impossible here", __FILE__, __LINE__);
    mStatusReportor->ReportError();
    return;
  }

  if (ZARK_DETECT_STAGE_START == detectResult.enProgress) {
    // Detection could not start at all.
    mStatusReportor->mErrorCode = PF_ERR_NOT_CONFIGURED;
    mStatusReportor->ReportError();
    return;
  }

  // Stopped at a step: the run still ends as a finished task; the steps'
  // status words tell where it stopped.
  Json::Value progress(Json::objectValue);
  Json::Value stopped(Json::objectValue);
  const char *failedStep = NULL;

  stopped["status"] = "stop";
  for (int i = 0; i < kDetectStepCount; i++) {
    progress[kDetectSteps[i]] = stopped;
  }
  ApplyDetectProgress(progress, detectResult);

  switch (detectResult.enProgress) {
  case ZARK_DETECT_STAGE_INTERFACE:
    failedStep = "check_interface_enable_step";
    break;
  case ZARK_DETECT_STAGE_GATEWAY:
    failedStep = "check_gateway_setting_step";
    break;
  case ZARK_DETECT_STAGE_WAN:
    failedStep = "check_connect_wan_step";
    break;
  case ZARK_DETECT_STAGE_DNS:
    failedStep = "check_dns_setting_step";
    break;
  case ZARK_DETECT_STAGE_HOPS:
    failedStep = "check_hops_lan2wan_step";
    break;
  case ZARK_DETECT_STAGE_ROUTER:
    failedStep = "detect_router_step";
    break;
  default:
    syslog(LOG_ERR, "%s:%d Err detectResult.enProgress=%d", __FILE__, __LINE__,
           detectResult.enProgress);
    mStatusReportor->ReportError();
    return;
  }

  SetDetectStepStatus(progress, failedStep, "failed");
  result["progress"] = progress;
  mStatusReportor->ReportStatus(result, "success", 100);
}

// ---------------------------------------------------------------------------
// Detection status and current process.

bool PortForwarding::DetectStatus(Json::Value &out, const Json::Value &record) {
  std::string status;
  int percentage = -1;

  if (!GetStatusAndPercentage(status, percentage, record)) {
    syslog(LOG_ERR, "%s:%d get status and percentage failed", __FILE__,
           __LINE__);
    return false;
  }

  out["status"] = status;
  out["percentage"] = percentage;
  out["progress"] = MemberOrNull(record["data"], "progress");

  if (0 == strcasecmp(status.c_str(), "success") ||
      0 == strcasecmp(status.c_str(), "failed")) {
    GetDetectResult(out, record);
  }
  return true;
}

void PortForwarding::GetDetectResult(Json::Value &out,
                                     const Json::Value &record) {
  if (!HasMember(record, "data")) {
    syslog(LOG_ERR, "%s:%d data does not exist", __FILE__, __LINE__);
    return;
  }
  out = record["data"];
}

bool PortForwarding::GetCurrentProcess(Json::Value &result) {
  const char *process = "none";
  ZARK_LIBZARKPORTMAP_TASK task;

  memset(&task, 0, sizeof(task));
  if (0 > KLibGetLibZarkPortMapRunningTask(&task)) {
    syslog(LOG_ERR, "%s:%d KLibGetLibZarkPortMapRunningTask() failed", __FILE__,
           __LINE__);
    return false;
  }
  if (ZARK_PORTMAP_TASK_UPNP_TEST == task.task) {
    process = "autotest";
  } else if (ZARK_PORTMAP_TASK_APPLY_RULES == task.task) {
    process = "portforwarding";
  }
  result["process"] = process;
  return true;
}

// ---------------------------------------------------------------------------
// UPnP compatibility test.

void testUpnpCompatibilityProgressCB(
    const ZARK_ROUTER_TEST_COMPATIBILITY_RESULT *result, void *arg) {
  StatusReportor *statusReportor = static_cast<StatusReportor *>(arg);

  if (NULL == statusReportor) {
    syslog(LOG_ERR, "%s:%d statusReportor is NULL", __FILE__, __LINE__);
  } else if (NULL == result) {
    syslog(LOG_ERR, "%s:%d pCompatibilityResult is NULL", __FILE__, __LINE__);
  } else {
    statusReportor->ReportStatus("processing", result->progress);
  }
}

void PortForwarding::UPnPTestStart() {
  ZARK_ROUTER_TEST_COMPATIBILITY_RESULT result;
  int rc = 0;

  memset(&result, 0, sizeof(result));
  if (NULL == mStatusReportor) {
    // The task callback always supplies a reporter; without one there is
    // nobody to tell, not even the closing report below.
    syslog(LOG_ERR, "%s:%d status reportor is NULL", __FILE__, __LINE__);
    return;
  }

  rc = KLibTestUpnpCompatibility(60, &result, testUpnpCompatibilityProgressCB,
                                 mStatusReportor, true);
  if (0 != rc) {
    if (2 == result.error) {
      mStatusReportor->mErrorCode = PF_ERR_NOT_CONFIGURED;
    } else if (13 <= result.error && result.error <= 20) {
      // Failures the progress file already describes.
    } else {
      syslog(LOG_ERR, "%s:%d Unknown compatibility test err=%d", __FILE__,
             __LINE__, result.error);
    }
  } else if (0 > KLibWriteRecordIntoUpnpDB(&result.record)) {
    syslog(LOG_ERR, "%s:%d KLibWriteRecordIntoUpnpDB() failed", __FILE__,
           __LINE__);
  }

  // The outcome is read from the progress file by "test_status"; the task
  // itself always ends the same way.
  mStatusReportor->ReportStatus("success", 0);
}

void SetUPnPTestStatus(Json::Value &answer, const std::string &status,
                       int percentage) {
  answer["status"] = status;
  answer["percentage"] = percentage;
}

bool PortForwarding::UPnPTestStartStatus(Json::Value &answer,
                                         const Json::Value &record) {
  // The answer comes from the progress file, not from the task record.
  (void)record;
  int passed = ParseUPnPTestProgress(answer);

  if (passed < 0) {
    SetUPnPTestStatus(answer, "failed", -1);
  } else if (passed < 5) {
    SetUPnPTestStatus(answer, "processing",
                      static_cast<int>(passed / 5.0 * 90.0));
  } else if (5 == passed) {
    SetUPnPTestStatus(answer, "success", 100);
  } else {
    syslog(LOG_ERR, "%s:%d get status failed", __FILE__, __LINE__);
    SetUPnPTestStatus(answer, "failed", -1);
  }
  return true;
}

namespace {

bool IsWord(const char *value, const char *word) {
  return 0 == strcasecmp(value, word);
}

Json::Value UPnPTestItem(const char *name, const std::string &status) {
  Json::Value item(Json::objectValue);
  item["test_item"] = name;
  item["status"] = status;
  return item;
}

} // namespace

// "/tmp/upnp_test.progress" is a key/value file the library fills as the
// test goes on, for example:
//   upnp_init=success
//   upnp_add=finished
//   upnp_max=12
//   upnp_delete=finished
//   upnp_connection_failed=success
//   upnp_readd1=success
//   upnp_readd2=finished
//   upnp_connection_success=success
//   upnp_terminal=finished
// Returns the number of items passed (0 to 5), or -1 once an item failed.
int ParseUPnPTestProgress(Json::Value &answer) {
  static const struct {
    const char *key;
    const char *emptyMessage;
  } kKeys[] = {
      {"upnp_init", "init empty"},
      {"upnp_add", "add empty"},
      {"upnp_max", "max empty"},
      {"upnp_delete", "delete empty"},
      {"upnp_connection_failed", "con_f empty"},
      {"upnp_readd1", "readd1 empty"},
      {"upnp_readd2", "readd2 empty"},
      {"upnp_connection_success", "con_s empty"},
      {"upnp_terminal", "term empty"},
  };
  enum { INIT, ADD, MAX, DEL, CON_F, READD1, READD2, CON_S, TERM, KEY_COUNT };
  static char emptyValue[1] = {'\0'};
  char *values[KEY_COUNT];
  Json::Value tests(Json::arrayValue);
  std::string state;
  int passed = 0;
  int ret = 0;

  for (int i = 0; i < KEY_COUNT; i++) {
    values[i] = emptyValue;
  }
  for (int i = 0; i < KEY_COUNT; i++) {
    char *buf = static_cast<char *>(calloc(1, UPNP_TEST_VALUE_SIZE));
    if (NULL == buf) {
      break;
    }
    values[i] = buf;
    if (0 > KLIBCFileGetKeyValue(UPNP_TEST_PROGRESS_FILE, kKeys[i].key, buf,
                                 UPNP_TEST_VALUE_SIZE, 0)) {
      // The values not read yet stay empty.
      buf[0] = '\0';
      syslog(LOG_ERR, "%s:%d %s[0x%04X %s:%d]", __FILE__, __LINE__,
             kKeys[i].emptyMessage, KLIBCErrGet(), KLIBCErrorGetFile(),
             KLIBCErrorGetLine());
      break;
    }
  }
  const char *init = values[INIT];
  const char *add = values[ADD];
  const char *max = values[MAX];
  const char *del = values[DEL];
  const char *conF = values[CON_F];
  const char *readd1 = values[READD1];
  const char *readd2 = values[READD2];
  const char *conS = values[CON_S];
  const char *term = values[TERM];

  // Item "add": the first mappings, and whether the maximum was found.
  if ('\0' == add[0]) {
    state = "not_test";
  } else if (IsWord(add, "failed") || IsWord(init, "failed")) {
    tests.append(UPnPTestItem("add", "failed"));
    ret = -1;
    goto End;
  } else if (IsWord(add, "finished") && '\0' != max[0]) {
    long maxMappings = strtol(max, NULL, 10);
    if (maxMappings >= 1) {
      state = "success";
      passed = 1;
    } else if (-1 == maxMappings) {
      tests.append(UPnPTestItem("add", "failed"));
      ret = -1;
      goto End;
    } else {
      state = "processing";
    }
  } else {
    state = "processing";
  }
  tests.append(UPnPTestItem("add", state));

  // Item "max": the number of mappings the router took.
  if ('\0' == max[0]) {
    state = (1 == passed) ? "processing" : "unknown";
  } else {
    long maxMappings = strtol(max, NULL, 10);
    if (maxMappings >= 1) {
      state = max;
      passed++;
    } else if (-1 == maxMappings) {
      tests.append(UPnPTestItem("max", "failed"));
      ret = -1;
      goto End;
    } else {
      state = "processing";
    }
  }
  tests.append(UPnPTestItem("max", state));

  // Item "del": deleting the mappings, and the port closing again.
  if ('\0' == del[0]) {
    state = (2 == passed) ? "processing" : "unknown";
  } else if (IsWord(del, "failed") || IsWord(conF, "failed")) {
    tests.append(UPnPTestItem("del", "failed"));
    ret = -1;
    goto End;
  } else if ('\0' == conF[0] || IsWord(conF, "processing")) {
    state = "processing";
  } else if (IsWord(del, "finished") && IsWord(conF, "success")) {
    state = "success";
    passed++;
  } else {
    syslog(LOG_ERR, "%s:%d ==del:[%s] con_f:[%s][0x%04X %s:%d]", __FILE__,
           __LINE__, del, conF, KLIBCErrGet(), KLIBCErrorGetFile(),
           KLIBCErrorGetLine());
    tests.append(UPnPTestItem("del", "failed"));
    ret = -1;
    goto End;
  }
  tests.append(UPnPTestItem("del", state));

  // Item "readd": adding mappings again after the delete.
  if ('\0' == readd1[0]) {
    state = (3 == passed) ? "processing" : "unknown";
  } else if (IsWord(readd1, "failed")) {
    tests.append(UPnPTestItem("readd", "failed"));
    ret = -1;
    goto End;
  } else if ('\0' == readd2[0]) {
    state = "processing";
  } else if (IsWord(readd2, "failed")) {
    tests.append(UPnPTestItem("readd", "failed"));
    ret = -1;
    goto End;
  } else if (IsWord(readd2, "finished") && IsWord(readd1, "success")) {
    state = "success";
    passed++;
  } else {
    state = readd2;
  }
  tests.append(UPnPTestItem("readd", state));

  // Item "con_s": a mapped port answering from outside.
  if ('\0' == conS[0]) {
    state = (4 == passed) ? "processing" : "unknown";
  } else if (IsWord(conS, "failed")) {
    tests.append(UPnPTestItem("con_s", "failed"));
    ret = -1;
    goto End;
  } else if (IsWord(conS, "success") && IsWord(term, "finished")) {
    state = conS;
    passed++;
  } else {
    state = "processing";
  }
  tests.append(UPnPTestItem("con_s", state));
  ret = passed;

End:
  answer["test"] = tests;
  for (int i = 0; i < KEY_COUNT; i++) {
    if (values[i] != emptyValue) {
      free(values[i]);
    }
  }
  return ret;
}

bool PortForwarding::UPnPTestStop(Json::Value &result) {
  // A successful stop answers a null result.
  (void)result;
  if (0 > KLibStopTestUpnpCompatibility()) {
    syslog(LOG_ERR, "%s:%d KLibStopTestUpnpCompatibility() failed", __FILE__,
           __LINE__);
    return false;
  }
  return true;
}

bool PortForwarding::UploadUPnPTestStartResult(Json::Value &result) {
  (void)result;
  return 0 <= KLibUploadTestUpnpCompatibilityFailResult();
}
