#include "net/http_download.h"

#include "base/portmap_log.h"

#include "klibc_file.h"

#include <httplib.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <exception>

namespace zark::portmap {
namespace {

using Clock = std::chrono::steady_clock;

} // namespace

bool ParseHttpUrl(std::string_view url, HttpUrl &parsed) {
  constexpr std::string_view kHttp = "http://";
  constexpr std::string_view kHttps = "https://";
  HttpUrl result;
  std::string_view rest;
  if (url.substr(0, kHttp.size()) == kHttp) {
    rest = url.substr(kHttp.size());
  } else if (url.substr(0, kHttps.size()) == kHttps) {
    rest = url.substr(kHttps.size());
    result.tls = true;
    result.port = 443;
  } else {
    return false;
  }
  for (char c : url) {
    if (static_cast<unsigned char>(c) <= ' ' || c == 0x7f) {
      return false;
    }
  }
  std::size_t slash = rest.find('/');
  std::string_view authority = rest.substr(0, slash);
  std::string_view target =
      slash == std::string_view::npos ? "/" : rest.substr(slash);
  if (authority.empty() || authority.find('@') != std::string_view::npos ||
      authority.front() == '[') {
    return false;
  }
  std::size_t colon = authority.find(':');
  if (colon != std::string_view::npos) {
    std::string_view port = authority.substr(colon + 1);
    int value = 0;
    auto [end, ec] =
        std::from_chars(port.data(), port.data() + port.size(), value);
    if (port.empty() || ec != std::errc() || end != port.data() + port.size() ||
        value < 1 || value > 65535) {
      return false;
    }
    result.port = value;
    authority = authority.substr(0, colon);
  }
  if (authority.empty()) {
    return false;
  }
  result.host = std::string(authority);
  result.target = std::string(target);
  parsed = std::move(result);
  return true;
}

bool DownloadToFd(const std::string &url, int fd,
                  const DownloadLimits &limits) {
  HttpUrl parsed;
  if (!ParseHttpUrl(url, parsed)) {
    ZARK_PM_LOG_ERROR("\"%.300s\" is not an http:// or https:// URL",
                      url.c_str());
    return false;
  }
  try {
    httplib::Client client((parsed.tls ? "https://" : "http://") + parsed.host +
                           ":" + std::to_string(parsed.port));
    if (parsed.tls) {
      client.enable_server_certificate_verification(true);
    }
    client.set_connection_timeout(limits.connectTimeout);
    client.set_read_timeout(limits.connectTimeout);
    client.set_write_timeout(limits.connectTimeout);
    client.set_follow_location(false);
    const Clock::time_point deadline = Clock::now() + limits.deadline;
    int status = 0;
    std::size_t received = 0;
    bool tooLarge = false;
    bool tooSlow = false;
    bool writeFailed = false;
    int writeErrno = 0;
    httplib::Result result = client.Get(
        parsed.target, httplib::Headers{},
        [&](const httplib::Response &response) {
          status = response.status;
          return status == 200;
        },
        [&](const char *data, std::size_t size) {
          received += size;
          if (received > limits.maxBytes) {
            tooLarge = true;
            return false;
          }
          if (Clock::now() > deadline) {
            tooSlow = true;
            return false;
          }
          if (!klibc::WriteAll(fd, std::string_view(data, size))) {
            writeErrno = errno;
            writeFailed = true;
            return false;
          }
          return true;
        });
    if (tooLarge) {
      ZARK_PM_LOG_ERROR("%s: body larger than %zu bytes", url.c_str(),
                        limits.maxBytes);
      return false;
    }
    if (tooSlow) {
      ZARK_PM_LOG_ERROR("%s: not received within %lld ms", url.c_str(),
                        static_cast<long long>(limits.deadline.count()));
      return false;
    }
    if (writeFailed) {
      ZARK_PM_LOG_CALL("write", -1, writeErrno, url.c_str());
      return false;
    }
    if (status != 0 && status != 200) {
      ZARK_PM_LOG_ERROR("%s: server answered HTTP %d", url.c_str(), status);
      return false;
    }
    if (!result) {
      ZARK_PM_LOG_ERROR("%s: %s", url.c_str(),
                        httplib::to_string(result.error()).c_str());
      return false;
    }
    return true;
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("%s: %s", url.c_str(), e.what());
    return false;
  }
}

} // namespace zark::portmap
