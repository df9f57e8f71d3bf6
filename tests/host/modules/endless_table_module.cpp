// Malformed: 4097 method rows before its end row, one more than a host
// walks. The end row exists, so that a host reading too far stays inside
// the array.
#include "ZARK.Core.PortForwarding.h"

#include <array>
#include <cstddef>

namespace {

void Answer(ZARK::APIRequest *, ZARK::APIResponse *response) {
  response->SetSuccess();
}

constexpr std::size_t kMethodRows = 4097;

constexpr std::array<ZARK_API_TABLE, kMethodRows + 1> MakeTable() {
  std::array<ZARK_API_TABLE, kMethodRows + 1> table{};
  for (std::size_t i = 0; i < kMethodRows; ++i) {
    table[i] = {"Test.Endless", 1, "spin", Answer};
  }
  table[kMethodRows] = {nullptr, 0, nullptr, nullptr};
  return table;
}

const std::array<ZARK_API_TABLE, kMethodRows + 1> kTable = MakeTable();

} // namespace

extern "C" const ZARK_API_TABLE *GetAPITable(void) {
  return kTable.data();
}
