#include "StatusReportor.h"

#include <string.h>
#include <syslog.h>

namespace {

// The member `key` of value, or NULL when value is not an object or has no
// such member. Task records come from the host and may have any shape; a
// plain operator[] on a non-object would throw.
const Json::Value *FindMember(const Json::Value &value, const char *key) {
  if (!value.isObject()) {
    return NULL;
  }
  return value.find(key, key + strlen(key));
}

} // namespace

StatusReportor::StatusReportor(int errorCode, const std::string &section,
                               const std::string &key,
                               ZARK::APIResponse *response,
                               const Json::Value &appendData, bool success,
                               bool finished)
    : mErrorCode(errorCode), mSection(section), mKey(key), mResponse(response),
      mAppendData(appendData), mSuccess(success), mFinished(finished) {}

// The response belongs to the host; only the reporter's own data goes.
StatusReportor::~StatusReportor() {}

bool StatusReportor::GetSuccess() const {
  return mSuccess;
}

bool StatusReportor::IsFinished() const {
  return mFinished;
}

bool StatusReportor::ReportStatus(const Json::Value &data) {
  if (NULL == mResponse) {
    syslog(LOG_ERR, "%s:%d status reponser shall not be NULL", __FILE__,
           __LINE__);
    return false;
  }
  mResponse->SetSuccess(data);
  return true;
}

bool StatusReportor::ReportStatus(int percentage) {
  if (NULL == mResponse) {
    syslog(LOG_ERR, "%s:%d status reportor shall not be NULL", __FILE__,
           __LINE__);
    return false;
  }
  Json::Value data(Json::objectValue);
  data["percentage"] = percentage;
  ReportStatus(data);
  return true;
}

bool StatusReportor::ReportStatus(const char *status, int percentage) {
  if (NULL == mResponse) {
    syslog(LOG_ERR, "%s:%d status reportor shall not be NULL", __FILE__,
           __LINE__);
    return false;
  }
  Json::Value data(Json::objectValue);
  data["status"] = status;
  data["percentage"] = percentage;
  ReportStatus(data);
  return true;
}

bool StatusReportor::ReportStatus(const Json::Value &data, const char *status,
                                  int percentage) {
  if (NULL == mResponse) {
    syslog(LOG_ERR, "%s:%d status reportor shall not be NULL", __FILE__,
           __LINE__);
    return false;
  }
  // The caller's keys stay, except that "status" and "percentage" are ours.
  Json::Value report(data);
  report["status"] = status;
  report["percentage"] = percentage;
  ReportStatus(report);
  return true;
}

bool StatusReportor::SetAppendErrorData(const Json::Value &data) {
  if (NULL == mResponse) {
    syslog(LOG_ERR, "%s:%d status reportor shall not be NULL", __FILE__,
           __LINE__);
    return false;
  }
  mAppendData = data;
  return true;
}

bool StatusReportor::ReportError() {
  if (NULL == mResponse) {
    syslog(LOG_ERR, "%s:%d status reponser shall not be NULL", __FILE__,
           __LINE__);
    return false;
  }
  Json::Value errors(Json::objectValue);
  errors["sec"] = mSection;
  errors["key"] = mKey;
  errors["append"] = mAppendData;
  mResponse->SetError(mErrorCode, errors);
  return true;
}

bool StatusReportor::LoadFinished(const Json::Value &record) {
  const Json::Value *finish = FindMember(record, "finish");
  if (NULL == finish) {
    syslog(LOG_ERR, "%s:%d finish does not exist", __FILE__, __LINE__);
    return false;
  }
  if (!finish->isBool()) {
    syslog(LOG_ERR, "%s:%d finish shall be bool type", __FILE__, __LINE__);
    return false;
  }
  mFinished = finish->asBool();
  return true;
}

bool StatusReportor::LoadSuccess(const Json::Value &record) {
  const Json::Value *success = FindMember(record, "success");
  if (NULL == success) {
    syslog(LOG_ERR, "%s:%d success does not exist", __FILE__, __LINE__);
    return false;
  }
  if (!success->isBool()) {
    syslog(LOG_ERR, "%s:%d success shall be bool type", __FILE__, __LINE__);
    return false;
  }
  mSuccess = success->asBool();
  return true;
}

bool StatusReportor::LoadErrorCode(const Json::Value &record) {
  const Json::Value *error = FindMember(record, "error");
  if (NULL == error) {
    syslog(LOG_ERR, "%s:%d error does not exist", __FILE__, __LINE__);
    return false;
  }
  const Json::Value *code = FindMember(*error, "code");
  if (NULL == code) {
    syslog(LOG_ERR, "%s:%d error code does not exist", __FILE__, __LINE__);
    return false;
  }
  if (!code->isInt()) {
    syslog(LOG_ERR, "%s:%d error code shall be int type", __FILE__, __LINE__);
    return false;
  }
  mErrorCode = code->asInt();
  return true;
}

bool StatusReportor::LoadErrorAppendData(const Json::Value &record) {
  const Json::Value *error = FindMember(record, "error");
  if (NULL == error) {
    syslog(LOG_ERR, "%s:%d error does not exist", __FILE__, __LINE__);
    return false;
  }
  const Json::Value *errors = FindMember(*error, "errors");
  if (NULL == errors) {
    // Same text as a missing code: readers of the log know it by this line.
    syslog(LOG_ERR, "%s:%d error code does not exist", __FILE__, __LINE__);
    return false;
  }
  const Json::Value *append = FindMember(*errors, "append");
  if (NULL == append) {
    syslog(LOG_ERR, "%s:%d key does not exist", __FILE__, __LINE__);
    return false;
  }
  mAppendData = *append;
  return true;
}

// Section and key are not restored: an error passed on from a task record
// always carries empty "sec" and "key".
bool StatusReportor::LoadError(const Json::Value &record) {
  if (!LoadErrorCode(record)) {
    syslog(LOG_ERR, "%s:%d can not get error code", __FILE__, __LINE__);
    return false;
  }
  if (!LoadErrorAppendData(record)) {
    syslog(LOG_ERR, "%s:%d can not get error append data", __FILE__, __LINE__);
    return false;
  }
  return true;
}
