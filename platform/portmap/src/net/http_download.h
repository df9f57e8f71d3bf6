// Fetching one file over HTTP or HTTPS (cpp-httplib's client, built by
// Debian with OpenSSL): the router database update's URL source. HTTPS
// checks the server's certificate against the system's trusted ones and its
// name.
#ifndef ZARK_PORTMAP_HTTP_DOWNLOAD_H
#define ZARK_PORTMAP_HTTP_DOWNLOAD_H

#include <chrono>
#include <cstddef>
#include <string>
#include <string_view>

namespace zark::portmap {

struct HttpUrl {
  bool tls = false;   // https
  std::string host;   // name or IPv4 address ("[v6]" is not taken)
  int port = 80;      // 443 for https unless given
  std::string target; // path and query, "/" at least
};

// Splits "http://host[:port][/target]" or "https://...". False for anything
// else: another scheme, user info, an empty host, a bad port, blanks or
// control characters. Pure.
[[nodiscard]] bool ParseHttpUrl(std::string_view url, HttpUrl &parsed);

struct DownloadLimits {
  std::size_t maxBytes = 16u * 1024u * 1024u;
  std::chrono::milliseconds connectTimeout{10000};
  // The whole transfer, however slowly the server sends.
  std::chrono::milliseconds deadline{60000};
};

// GETs url and writes the body to the file descriptor fd. True when the
// server answered 200 and the whole body (at most limits.maxBytes) was
// written before the deadline. Redirects are not followed. Failures are
// logged.
[[nodiscard]] bool DownloadToFd(const std::string &url, int fd,
                                const DownloadLimits &limits);

} // namespace zark::portmap

#endif
