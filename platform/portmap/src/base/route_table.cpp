#include "base/route_table.h"

#include "libzarkportmap.h"

#include "base/conf_file.h"
#include "base/local_network.h"
#include "base/portmap_log.h"

#include <arpa/inet.h>
#include <net/route.h>

#include <algorithm>
#include <charconv>
#include <cstring>
#include <vector>

namespace zark::portmap {
namespace {

// Columns of /proc/net/route.
enum Column : std::size_t {
  kInterface = 0,
  kDestination = 1,
  kGateway = 2,
  kFlags = 3,
  kMetric = 6,
  kMask = 7,
  kColumnsNeeded = 8,
};

std::vector<std::string_view> SplitFields(std::string_view line) {
  std::vector<std::string_view> fields;
  std::size_t pos = 0;
  while (pos < line.size()) {
    std::size_t start = line.find_first_not_of(" \t\r", pos);
    if (start == std::string_view::npos) {
      break;
    }
    std::size_t end = line.find_first_of(" \t\r", start);
    if (end == std::string_view::npos) {
      end = line.size();
    }
    fields.push_back(line.substr(start, end - start));
    pos = end;
  }
  return fields;
}

template <typename T>
bool ParseNumber(std::string_view text, int base, T &out) {
  if (text.empty()) {
    return false;
  }
  auto [end, ec] =
      std::from_chars(text.data(), text.data() + text.size(), out, base);
  return ec == std::errc() && end == text.data() + text.size();
}

} // namespace

std::vector<DefaultRoute> ParseDefaultRoutes(std::string_view routeTable) {
  std::vector<DefaultRoute> routes;
  bool titleLine = true;
  while (!routeTable.empty()) {
    std::size_t newline = routeTable.find('\n');
    std::string_view line = routeTable.substr(0, newline);
    routeTable.remove_prefix(
        newline == std::string_view::npos ? routeTable.size() : newline + 1);
    if (titleLine) {
      titleLine = false;
      continue;
    }
    std::vector<std::string_view> fields = SplitFields(line);
    if (fields.size() < kColumnsNeeded) {
      continue;
    }
    uint32_t destination = 0;
    uint32_t gateway = 0;
    uint32_t mask = 0;
    unsigned flags = 0;
    unsigned long metric = 0;
    if (!ParseNumber(fields[kDestination], 16, destination) ||
        !ParseNumber(fields[kGateway], 16, gateway) ||
        !ParseNumber(fields[kFlags], 16, flags) ||
        !ParseNumber(fields[kMetric], 10, metric) ||
        !ParseNumber(fields[kMask], 16, mask)) {
      continue;
    }
    const unsigned wanted = RTF_UP | RTF_GATEWAY;
    if (destination != 0 || mask != 0 || gateway == 0 ||
        (flags & wanted) != wanted) {
      continue;
    }
    // The kernel prints the raw 32-bit value, whose bytes in memory are the
    // address in network byte order.
    routes.push_back({std::string(fields[kInterface]), ntohl(gateway), metric});
  }
  std::stable_sort(routes.begin(), routes.end(),
                   [](const DefaultRoute &a, const DefaultRoute &b) {
                     return a.metric < b.metric;
                   });
  return routes;
}

std::optional<uint32_t> ParseDefaultGateway(std::string_view routeTable) {
  const std::vector<DefaultRoute> routes = ParseDefaultRoutes(routeTable);
  if (routes.empty()) {
    return std::nullopt;
  }
  return htonl(routes.front().gateway);
}

} // namespace zark::portmap

extern "C" int KLibGetGatewayIP(char *buf, int size) {
  using namespace zark::portmap;
  if (buf == nullptr || size <= 0) {
    ZARK_PM_LOG_ERROR("KLibGetGatewayIP: no buffer");
    return -1;
  }
  try {
    ReadResult table = ReadSmallFile(kRouteTablePath, kMaxRouteTableBytes);
    if (table.status != ReadStatus::kRead) {
      ZARK_PM_LOG_ERROR("KLibGetGatewayIP: cannot read %s", kRouteTablePath);
      return -1;
    }
    std::optional<uint32_t> gateway = ParseDefaultGateway(table.content);
    if (!gateway) {
      ZARK_PM_LOG_ERROR("KLibGetGatewayIP: no default IPv4 route");
      return -1;
    }
    std::string text = FormatIpv4(ntohl(*gateway));
    if (text.empty() || text.size() >= static_cast<std::size_t>(size)) {
      ZARK_PM_LOG_ERROR("KLibGetGatewayIP: buffer of %d bytes too small", size);
      return -1;
    }
    std::memcpy(buf, text.c_str(), text.size() + 1);
    return 0;
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("KLibGetGatewayIP: %s", e.what());
    return -1;
  }
}
