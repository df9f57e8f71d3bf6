#include "module_table.h"

#include <cstring>
#include <set>
#include <tuple>

namespace zark::host {
namespace {

bool IsEndRow(const ZARK_API_TABLE &row) {
  return row.szAPI == nullptr && row.version == 0 && row.szMethod == nullptr &&
         row.handler == nullptr;
}

bool RowIsReadable(const ZARK_API_TABLE *row,
                   std::span<const MemoryRange> readable) {
  if (readable.empty()) {
    return true;
  }
  auto begin = reinterpret_cast<std::uintptr_t>(row);
  auto end = begin + sizeof(*row);
  for (const MemoryRange &range : readable) {
    if (begin >= range.begin && end <= range.end) {
      return true;
    }
  }
  return false;
}

// Names travel in URLs and log lines: keep them short and plain.
bool IsGoodName(const char *name) {
  std::size_t length = strnlen(name, kMaxNameLength + 1);
  if (length == 0 || length > kMaxNameLength) {
    return false;
  }
  for (std::size_t i = 0; i < length; ++i) {
    char c = name[i];
    bool good = (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') ||
                (c >= '0' && c <= '9') || c == '.' || c == '_' || c == '-';
    if (!good) {
      return false;
    }
  }
  return true;
}

std::string RowText(std::size_t index) {
  return "row " + std::to_string(index + 1);
}

} // namespace

bool ReadMethodTable(const ZARK_API_TABLE *table,
                     std::span<const MemoryRange> readable,
                     std::vector<MethodRow> &rows, std::string &reason) {
  rows.clear();
  if (table == nullptr) {
    reason = "GetAPITable returned no table";
    return false;
  }
  // First find the end row, so that a table that lost it is refused as a
  // whole, whatever its rows look like.
  std::size_t count = 0;
  for (;; ++count) {
    if (count == kMaxTableRows) {
      reason = "no end row within " + std::to_string(kMaxTableRows) + " rows";
      return false;
    }
    if (!RowIsReadable(table + count, readable)) {
      reason = RowText(count) + " lies outside the module";
      return false;
    }
    if (IsEndRow(table[count])) {
      break;
    }
  }

  std::set<std::tuple<std::string, std::string, int>> seen;
  std::vector<MethodRow> checked;
  checked.reserve(count);
  for (std::size_t i = 0; i < count; ++i) {
    const ZARK_API_TABLE &row = table[i];
    if (row.szAPI == nullptr) {
      reason = RowText(i) + " has no API name";
      return false;
    }
    if (row.szMethod == nullptr) {
      reason = RowText(i) + " has no method name";
      return false;
    }
    if (row.handler == nullptr) {
      reason = RowText(i) + " has no handler";
      return false;
    }
    if (!IsGoodName(row.szAPI)) {
      reason = RowText(i) + " has a bad API name";
      return false;
    }
    if (!IsGoodName(row.szMethod)) {
      reason = RowText(i) + " has a bad method name";
      return false;
    }
    if (row.version < 1) {
      reason = RowText(i) + " has version " + std::to_string(row.version) +
               " (below 1)";
      return false;
    }
    if (!seen.emplace(row.szAPI, row.szMethod, row.version).second) {
      reason = RowText(i) + " repeats " + row.szAPI + " " + row.szMethod +
               " version " + std::to_string(row.version);
      return false;
    }
    checked.push_back({row.szAPI, row.szMethod, row.version, row.handler});
  }
  rows = std::move(checked);
  return true;
}

} // namespace zark::host
