// Reading a module's method table: the rows up to the all-zero end row,
// checked before the host serves any of them.
#ifndef ZARK_HOST_MODULE_TABLE_H
#define ZARK_HOST_MODULE_TABLE_H

#include "ZARK.Core.PortForwarding.h"

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <vector>

namespace zark::host {

// A table longer than this has lost its end row.
inline constexpr std::size_t kMaxTableRows = 4096;

// Longest API or method name served.
inline constexpr std::size_t kMaxNameLength = 128;

// One checked row.
struct MethodRow {
  std::string api;
  std::string method;
  int version = 0;
  ZARK_API_HANDLER handler = nullptr;
};

// A span of memory that a module has mapped readable: [begin, end).
struct MemoryRange {
  std::uintptr_t begin = 0;
  std::uintptr_t end = 0;
};

// Walks table up to its all-zero row and checks every row before it:
// API and method names present, 1 to kMaxNameLength characters of
// [A-Za-z0-9._-], a handler, version >= 1, and no (API, method, version)
// twice. When readable is not empty, every row must lie inside one of its
// ranges (the module's own loaded segments), so that a table without an end
// row is never read beyond the module.
//
// Returns true and fills rows (in table order) when the table is well
// formed. Returns false with reason set, one of:
//   "GetAPITable returned no table"
//   "no end row within 4096 rows"
//   "row N lies outside the module"
//   "row N has no API name" / "row N has no method name" /
//   "row N has no handler"
//   "row N has a bad API name" / "row N has a bad method name"
//   "row N has version V (below 1)"
//   "row N repeats API method version V"
// Row numbers count from 1.
[[nodiscard]] bool ReadMethodTable(const ZARK_API_TABLE *table,
                                   std::span<const MemoryRange> readable,
                                   std::vector<MethodRow> &rows,
                                   std::string &reason);

} // namespace zark::host

#endif
