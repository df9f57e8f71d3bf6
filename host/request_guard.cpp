#include "request_guard.h"

#include "klibc_text.h"

#include <arpa/inet.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <climits>

namespace zark::host {
namespace {

bool AllDigits(std::string_view text) {
  return !text.empty() && std::all_of(text.begin(), text.end(), [](char c) {
    return c >= '0' && c <= '9';
  });
}

bool IsAddressLiteral(std::string_view name, int family) {
  const std::string text(name);
  std::array<unsigned char, 16> bytes{};
  return inet_pton(family, text.c_str(), bytes.data()) == 1;
}

} // namespace

bool IsAllowedHost(std::string_view host, std::span<const std::string> names) {
  if (host.empty()) {
    return true;
  }
  if (host.front() == '[') {
    std::size_t close = host.find(']');
    if (close == std::string_view::npos) {
      return false;
    }
    std::string_view rest = host.substr(close + 1);
    if (!rest.empty() && !(rest.front() == ':' && AllDigits(rest.substr(1)))) {
      return false;
    }
    return IsAddressLiteral(host.substr(1, close - 1), AF_INET6);
  }
  std::string_view name = host;
  std::size_t colon = host.rfind(':');
  if (colon != std::string_view::npos) {
    if (!AllDigits(host.substr(colon + 1))) {
      return false;
    }
    name = host.substr(0, colon);
  }
  if (IsAddressLiteral(name, AF_INET)) {
    return true;
  }
  if (!name.empty() && name.back() == '.') {
    name.remove_suffix(1);
  }
  return !name.empty() &&
         std::any_of(names.begin(), names.end(), [name](const std::string &n) {
           return klibc::EqualsIgnoringCase(n, name);
         });
}

bool IsSameOrigin(std::string_view origin, std::string_view host) {
  for (std::string_view scheme : {"http://", "https://"}) {
    if (origin.size() > scheme.size() &&
        klibc::EqualsIgnoringCase(origin.substr(0, scheme.size()), scheme)) {
      return !host.empty() &&
             klibc::EqualsIgnoringCase(origin.substr(scheme.size()), host);
    }
  }
  return false;
}

bool HasControlCharacter(std::string_view path) {
  return std::any_of(path.begin(), path.end(), [](char c) {
    const auto byte = static_cast<unsigned char>(c);
    return byte < 0x20 || byte == 0x7f;
  });
}

std::vector<std::string> LocalHostNames() {
  std::vector<std::string> names{"localhost"};
  char name[HOST_NAME_MAX + 1] = {};
  if (gethostname(name, sizeof name - 1) == 0 && name[0] != '\0') {
    names.emplace_back(name);
    names.emplace_back(std::string(name) + ".local");
  }
  return names;
}

} // namespace zark::host
