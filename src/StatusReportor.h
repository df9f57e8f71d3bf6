// StatusReportor: the one object through which an operation reports its
// outcome (an error code with error data) or its progress (status word and
// percentage) into the host response it holds, and reads a background
// task's record back.
#ifndef ZARK_CORE_PORTFORWARDING_STATUSREPORTOR_H
#define ZARK_CORE_PORTFORWARDING_STATUSREPORTOR_H

#include "webapi.h"

#include <json/json.h>

#include <string>

class StatusReportor {
public:
  StatusReportor(int errorCode, const std::string &section,
                 const std::string &key, ZARK::APIResponse *response,
                 const Json::Value &appendData, bool success, bool finished);
  virtual ~StatusReportor();

  bool GetSuccess() const;
  bool IsFinished() const;

  bool ReportStatus(const Json::Value &data);
  bool ReportStatus(int percentage);
  bool ReportStatus(const char *status, int percentage);
  bool ReportStatus(const Json::Value &data, const char *status,
                    int percentage);
  bool SetAppendErrorData(const Json::Value &data);
  bool ReportError();

  bool LoadFinished(const Json::Value &record);
  bool LoadSuccess(const Json::Value &record);
  bool LoadErrorCode(const Json::Value &record);
  bool LoadErrorAppendData(const Json::Value &record);
  bool LoadError(const Json::Value &record);

  // Set directly by the operations, right before they return false.
  int mErrorCode;
  std::string mSection;
  std::string mKey;
  ZARK::APIResponse *mResponse; // not owned
  Json::Value mAppendData;
  bool mSuccess;
  bool mFinished;
};

#endif
