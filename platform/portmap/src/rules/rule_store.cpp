// The rule store: RouterRuleConfWriter and RouterRuleConfReader. The file
// format is in rule_conf_format.h, the file access in conf_file.h.
#include "RouterRuleConf.h"

#include "base/conf_file.h"
#include "base/portmap_log.h"
#include "base/record_text.h"
#include "rules/rule_conf_format.h"
#include "rules/rule_store_internal.h"

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

namespace zark::portmap {
namespace {

bool RuleFits(const RouterRule &rule) {
  return FitsRuleField(rule.ruleId) && FitsRuleField(rule.routerPort) &&
         FitsRuleField(rule.dsPort) && FitsRuleField(rule.protocol) &&
         FitsRuleField(rule.serviceId) && FitsRuleField(rule.serviceName);
}

} // namespace

bool RulesToArray(std::span<const RouterRule> source, int *count,
                  ZARK_ROUTER_RULE **rules) {
  if (count == nullptr || rules == nullptr) {
    return false;
  }
  *count = 0;
  *rules = nullptr;
  if (source.empty()) {
    return true;
  }
  if (source.size() > static_cast<std::size_t>(INT_MAX)) {
    ZARK_PM_LOG_ERROR("%zu rules do not fit an array", source.size());
    return false;
  }
  for (const RouterRule &rule : source) {
    if (!RuleFits(rule)) {
      ZARK_PM_LOG_ERROR("rule \"%.64s\" has a text that does not fit a record",
                        rule.ruleId.c_str());
      return false;
    }
  }
  auto *array = static_cast<ZARK_ROUTER_RULE *>(
      std::calloc(source.size(), sizeof(ZARK_ROUTER_RULE)));
  if (array == nullptr) {
    ZARK_PM_LOG_CALL("calloc", 0, errno);
    return false;
  }
  for (std::size_t i = 0; i < source.size(); ++i) {
    const RouterRule &rule = source[i];
    ZARK_ROUTER_RULE &record = array[i];
    CopyText(record.rule_id, rule.ruleId);
    record.enable = rule.enable ? 1 : 0;
    CopyText(record.router_protocol, rule.protocol);
    CopyText(record.router_port, rule.routerPort);
    CopyText(record.ds_port, rule.dsPort);
    CopyText(record.serviceid, rule.serviceId);
    CopyText(record.service_name, rule.serviceName);
  }
  *count = static_cast<int>(source.size());
  *rules = array;
  return true;
}

} // namespace zark::portmap

using namespace zark::portmap;

// --- RouterRuleConfWriter
// -----------------------------------------------------

RouterRuleConfWriter::RouterRuleConfWriter() = default;
RouterRuleConfWriter::~RouterRuleConfWriter() = default;

bool RouterRuleConfWriter::AddRule(int ruleId, bool enable,
                                   const std::string &routerPort,
                                   const std::string &dsPort,
                                   const std::string &protocol,
                                   const std::string &serviceId,
                                   const std::string &serviceName) {
  return AddRule(std::to_string(ruleId), enable, routerPort, dsPort, protocol,
                 serviceId, serviceName);
}

bool RouterRuleConfWriter::AddRule(const std::string &ruleId, bool enable,
                                   const std::string &routerPort,
                                   const std::string &dsPort,
                                   const std::string &protocol,
                                   const std::string &serviceId,
                                   const std::string &serviceName) {
  RouterRule rule{ruleId,   enable,    routerPort, dsPort,
                  protocol, serviceId, serviceName};
  if (!RuleFits(rule)) {
    ZARK_PM_LOG_ERROR("rule \"%.64s\" refused: a text is longer than %zu "
                      "bytes or holds a NUL byte",
                      ruleId.c_str(), kMaxRuleFieldBytes);
    return false;
  }
  mRules.push_back(std::move(rule));
  return true;
}

bool RouterRuleConfWriter::ToArray(int *count, ZARK_ROUTER_RULE **rules) const {
  return RulesToArray(mRules, count, rules);
}

bool RouterRuleConfWriter::Sync(const std::string &path) const {
  if (mRules.size() > kMaxRuleConfRules) {
    ZARK_PM_LOG_ERROR("%s not written: %zu rules, at most %zu", path.c_str(),
                      mRules.size(), kMaxRuleConfRules);
    return false;
  }
  std::string text = SerializeRuleConf(mRules);
  if (text.size() > kMaxRuleConfBytes) {
    ZARK_PM_LOG_ERROR("%s not written: %zu bytes, at most %zu", path.c_str(),
                      text.size(), kMaxRuleConfBytes);
    return false;
  }
  return ReplaceFileAtomically(path, text, 0600);
}

// --- RouterRuleConfReader
// -----------------------------------------------------

RouterRuleConfReader::RouterRuleConfReader(bool testRules)
    : RouterRuleConfReader(std::string(testRules ? ZARK_PORTMAP_TEST_RULE_CONF
                                                 : ZARK_PORTMAP_RULE_CONF)) {}

RouterRuleConfReader::RouterRuleConfReader(const std::string &path) {
  ReadResult file = ReadSmallFile(path, kMaxRuleConfBytes);
  switch (file.status) {
  case ReadStatus::kMissing:
    return;
  case ReadStatus::kTooLarge:
  case ReadStatus::kFailed:
    // ReadSmallFile has logged why.
    mValid = false;
    return;
  case ReadStatus::kRead:
    break;
  }
  ParsedRuleConf parsed = ParseRuleConf(file.content);
  if (!parsed.ok) {
    ZARK_PM_LOG_ERROR("rule configuration %s is malformed: %s", path.c_str(),
                      parsed.error.c_str());
    mValid = false;
    return;
  }
  mRules = std::move(parsed.rules);
}

RouterRuleConfReader::~RouterRuleConfReader() = default;

bool RouterRuleConfReader::StartNextRule() {
  mCurrent = 0;
  return mCurrent < mRules.size();
}

bool RouterRuleConfReader::NextRule() {
  if (mCurrent < mRules.size()) {
    ++mCurrent;
  }
  return mCurrent < mRules.size();
}

bool RouterRuleConfReader::GetRuleInfo(bool &enable, std::string &routerPort,
                                       std::string &dsPort,
                                       std::string &protocol,
                                       std::string &serviceId) const {
  if (mCurrent >= mRules.size()) {
    return false;
  }
  const RouterRule &rule = mRules[mCurrent];
  enable = rule.enable;
  routerPort = rule.routerPort;
  dsPort = rule.dsPort;
  protocol = rule.protocol;
  serviceId = rule.serviceId;
  return true;
}

bool RouterRuleConfReader::GetRuleInfo(RouterRule &rule) const {
  if (mCurrent >= mRules.size()) {
    return false;
  }
  rule = mRules[mCurrent];
  return true;
}
