#include "port_list.h"

#include "klibc_text.h"

#include <charconv>

namespace zark::fw {
namespace {

// Reads a decimal port of 1 to 5 digits that fills text; false otherwise.
bool ReadPort(std::string_view text, int &port) {
  if (text.empty() || text.size() > 5) {
    return false;
  }
  for (char c : text) {
    if (c < '0' || c > '9') {
      return false;
    }
  }
  int value = 0;
  auto [end, ec] =
      std::from_chars(text.data(), text.data() + text.size(), value);
  if (ec != std::errc() || end != text.data() + text.size() ||
      value > kMaxPort) {
    return false;
  }
  port = value;
  return true;
}

bool CheckItem(std::string_view item, std::string &problem) {
  size_t dash = item.find('-');
  int first = 0;
  if (dash == std::string_view::npos) {
    if (!ReadPort(item, first)) {
      problem = "bad port \"" + std::string(item) + "\"";
      return false;
    }
    return true;
  }
  std::string_view firstText = item.substr(0, dash);
  std::string_view lastText = item.substr(dash + 1);
  int last = 0;
  if (!ReadPort(firstText, first) ||
      (!lastText.empty() && !ReadPort(lastText, last))) {
    problem = "bad port range \"" + std::string(item) + "\"";
    return false;
  }
  if (!lastText.empty() && last < first) {
    problem = "port range \"" + std::string(item) + "\" runs backwards";
    return false;
  }
  return true;
}

} // namespace

PortListParse ParsePortList(std::string_view text) {
  PortListParse result;
  std::string_view rest = klibc::Trim(text, klibc::kWhiteSpace);
  if (rest.empty()) {
    result.ok = true;
    return result;
  }
  while (true) {
    size_t comma = rest.find(',');
    std::string_view item =
        klibc::Trim(rest.substr(0, comma), klibc::kWhiteSpace);
    if (item.empty()) {
      result.items.clear();
      result.problem = "empty port item";
      return result;
    }
    if (!CheckItem(item, result.problem)) {
      result.items.clear();
      return result;
    }
    result.items.emplace_back(item);
    if (comma == std::string_view::npos) {
      break;
    }
    rest = rest.substr(comma + 1);
  }
  result.ok = true;
  return result;
}

} // namespace zark::fw
