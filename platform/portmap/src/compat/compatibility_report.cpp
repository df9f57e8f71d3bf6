#include "compat/compatibility_report.h"

#include "base/conf_file.h"
#include "base/library_config.h"
#include "base/portmap_log.h"
#include "base/strict_json.h"
#include "compat/compatibility_files.h"
#include "net/http_download.h"

#include <httplib.h>
#include <syslog.h>

#include <ctime>
#include <exception>

namespace zark::portmap {
namespace {

constexpr int kReportVersion = 1;
constexpr std::size_t kMaxProgressBytes = 64 * 1024;
constexpr std::size_t kMaxReportBytes = 1024 * 1024;

httplib::Client MakeClient(const HttpUrl &url) {
  return httplib::Client((url.tls ? "https://" : "http://") + url.host + ":" +
                         std::to_string(url.port));
}

// The router's UPnP root description, bounded in time and size. Empty, with
// error set, when it cannot be had.
std::string FetchDescription(const std::string &location,
                             const UploadOptions &options, std::string &error) {
  HttpUrl url;
  if (location.empty()) {
    error = "the test found no UPnP description";
    return {};
  }
  if (!ParseHttpUrl(location, url) || url.tls) {
    error = "the description URL " + location + " is not an http:// URL";
    return {};
  }
  try {
    httplib::Client client = MakeClient(url);
    client.set_connection_timeout(options.descriptionTimeout);
    client.set_read_timeout(options.descriptionTimeout);
    client.set_write_timeout(options.descriptionTimeout);
    client.set_follow_location(false);
    std::string body;
    bool tooLarge = false;
    int status = 0;
    httplib::Result result = client.Get(
        url.target, httplib::Headers{},
        [&](const httplib::Response &response) {
          status = response.status;
          return status == 200;
        },
        [&](const char *data, std::size_t size) {
          if (body.size() + size > options.maxDescriptionBytes) {
            tooLarge = true;
            return false;
          }
          body.append(data, size);
          return true;
        });
    if (tooLarge) {
      error = "the description is larger than " +
              std::to_string(options.maxDescriptionBytes) + " bytes";
      return {};
    }
    if (status != 0 && status != 200) {
      error = "the router answered HTTP " + std::to_string(status);
      return {};
    }
    if (!result) {
      error = "the router did not send its description: " +
              httplib::to_string(result.error());
      return {};
    }
    return body;
  } catch (const std::exception &e) {
    error = e.what();
    return {};
  }
}

} // namespace

std::string UtcDateText(int64_t seconds) {
  std::time_t time = static_cast<std::time_t>(seconds);
  std::tm utc{};
  if (gmtime_r(&time, &utc) == nullptr) {
    return {};
  }
  char text[32] = {};
  std::strftime(text, sizeof(text), "%Y-%m-%dT%H:%M:%SZ", &utc);
  return text;
}

std::string SerializeUpnpTestReport(const UpnpTestReport &report) {
  Json::Value root(Json::objectValue);
  root["version"] = kReportVersion;
  root["result"] = report.failed ? "failed" : "success";
  root["error"] = report.error;
  root["reason"] = report.reason;
  root["date"] = report.date;
  root["mappings_asked"] = report.mappingsAsked;
  root["mappings_reached"] = report.mappingsReached;
  root["gateway"] = report.gateway;
  root["location"] = report.location;
  Json::Value router(Json::objectValue);
  router["brand"] = report.brand;
  router["model"] = report.model;
  router["version"] = report.version;
  router["support_upnp"] = report.supportUpnp;
  router["support_natpmp"] = report.supportNatpmp;
  root["router"] = router;
  Json::Value log(Json::arrayValue);
  for (const std::string &line : report.log) {
    log.append(line);
  }
  root["log"] = log;
  return WriteJsonText(root);
}

bool ParseUpnpTestReport(std::string_view text, UpnpTestReport &report,
                         std::string &why) noexcept {
  try {
    Json::Value root;
    if (!ParseStrictJson(text, root, why, 8)) {
      return false;
    }
    if (!root.isObject() || !root["router"].isObject() ||
        !root["log"].isArray()) {
      why = "not a report";
      return false;
    }
    UpnpTestReport parsed;
    std::string result;
    long long version = 0;
    long long error = 0;
    long long asked = 0;
    long long reached = 0;
    const Json::Value &router = root["router"];
    if (!ReadJsonInt(root, "version", kReportVersion, kReportVersion, version,
                     why) ||
        !ReadJsonString(root, "result", result, why) ||
        !ReadJsonInt(root, "error", INT32_MIN, INT32_MAX, error, why) ||
        !ReadJsonString(root, "reason", parsed.reason, why, 4096) ||
        !ReadJsonString(root, "date", parsed.date, why) ||
        !ReadJsonInt(root, "mappings_asked", 0, kMaxUpnpTestMappings, asked,
                     why) ||
        !ReadJsonInt(root, "mappings_reached", 0, kMaxUpnpTestMappings, reached,
                     why) ||
        !ReadJsonString(root, "gateway", parsed.gateway, why) ||
        !ReadJsonString(root, "location", parsed.location, why) ||
        !ReadJsonString(router, "brand", parsed.brand, why) ||
        !ReadJsonString(router, "model", parsed.model, why) ||
        !ReadJsonString(router, "version", parsed.version, why) ||
        !ReadJsonString(router, "support_upnp", parsed.supportUpnp, why) ||
        !ReadJsonString(router, "support_natpmp", parsed.supportNatpmp, why)) {
      return false;
    }
    if (result != "failed" && result != "success") {
      why = "\"result\" is neither \"failed\" nor \"success\"";
      return false;
    }
    parsed.failed = result == "failed";
    parsed.error = static_cast<int>(error);
    parsed.mappingsAsked = static_cast<int>(asked);
    parsed.mappingsReached = static_cast<int>(reached);
    const Json::Value &log = root["log"];
    if (log.size() > kMaxReportLogLines + 1) {
      why = "too many log lines";
      return false;
    }
    for (const Json::Value &line : log) {
      if (!line.isString()) {
        why = "a log line is not a string";
        return false;
      }
      parsed.log.push_back(line.asString());
    }
    report = std::move(parsed);
    return true;
  } catch (const std::exception &e) {
    why = e.what();
    return false;
  }
}

UploadOptions DefaultUploadOptions() {
  UploadOptions options;
  options.reportAddress = GetLibraryConfig(config_key::kReportAddress, "");
  options.reportPath = kUpnpTestReportPath;
  return options;
}

std::string UploadDocument(const UpnpTestReport &report,
                           std::string_view progress,
                           std::string_view description,
                           std::string_view descriptionError) {
  Json::Value root;
  std::string why;
  // Our own serialisation always parses back.
  (void)ParseStrictJson(SerializeUpnpTestReport(report), root, why);
  root["progress"] = std::string(progress);
  if (descriptionError.empty()) {
    root["root_description"] = std::string(description);
  } else {
    root["root_description_error"] = std::string(descriptionError);
  }
  return WriteJsonText(root);
}

int UploadUpnpTestReport(const UploadOptions &options) {
  if (options.reportAddress.empty()) {
    ZARK_PM_LOG_ERROR("no report address is configured (\"%s\" in %s); "
                      "nothing can be uploaded",
                      std::string(config_key::kReportAddress).c_str(),
                      kLibraryConfigPath);
    return -1;
  }
  HttpUrl url;
  if (!ParseHttpUrl(options.reportAddress, url)) {
    ZARK_PM_LOG_ERROR("the report address \"%.300s\" is not an http:// or "
                      "https:// URL",
                      options.reportAddress.c_str());
    return -1;
  }
  ReadResult read = ReadSmallFile(options.reportPath, kMaxReportBytes);
  if (read.status == ReadStatus::kMissing) {
    ZARK_PM_LOG_ERROR("no UPnP compatibility test has been run; nothing to "
                      "upload");
    return -1;
  }
  UpnpTestReport report;
  std::string why;
  if (read.status != ReadStatus::kRead ||
      !ParseUpnpTestReport(read.content, report, why)) {
    ZARK_PM_LOG_ERROR("the test report %s cannot be read: %s",
                      options.reportPath.c_str(), why.c_str());
    return -1;
  }
  if (!report.failed) {
    ZARK_PM_LOG_ERROR("the last UPnP compatibility test succeeded; there is "
                      "no failed result to upload");
    return -1;
  }
  ReadResult progress = ReadSmallFile(options.progressPath, kMaxProgressBytes);
  std::string descriptionError;
  const std::string description =
      FetchDescription(report.location, options, descriptionError);
  const std::string document =
      UploadDocument(report, progress.content, description, descriptionError);
  try {
    httplib::Client client = MakeClient(url);
    if (url.tls) {
      client.enable_server_certificate_verification(true);
    }
    client.set_connection_timeout(options.connectTimeout);
    client.set_read_timeout(options.transferTimeout);
    client.set_write_timeout(options.transferTimeout);
    client.set_follow_location(false);
    httplib::Result result =
        client.Post(url.target, document, "application/json");
    if (!result) {
      ZARK_PM_LOG_ERROR("uploading the test report to %s: %s",
                        options.reportAddress.c_str(),
                        httplib::to_string(result.error()).c_str());
      return -1;
    }
    if (result->status < 200 || result->status > 299) {
      ZARK_PM_LOG_ERROR("uploading the test report to %s: HTTP %d",
                        options.reportAddress.c_str(), result->status);
      return -1;
    }
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("uploading the test report to %s: %s",
                      options.reportAddress.c_str(), e.what());
    return -1;
  }
  syslog(LOG_INFO, "%s:%d uploaded the failed test's report (%zu bytes) to %s",
         __FILE__, __LINE__, document.size(), options.reportAddress.c_str());
  return 0;
}

} // namespace zark::portmap

extern "C" int KLibUploadTestUpnpCompatibilityFailResult(void) {
  using namespace zark::portmap;
  try {
    return UploadUpnpTestReport(DefaultUploadOptions());
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("KLibUploadTestUpnpCompatibilityFailResult: %s",
                      e.what());
    return -1;
  }
}
