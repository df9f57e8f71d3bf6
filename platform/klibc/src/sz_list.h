// Internal operations on KLIBSZLIST shared by the splitting and key/value
// functions.
#ifndef ZARK_PLATFORM_KLIBC_SZ_LIST_H
#define ZARK_PLATFORM_KLIBC_SZ_LIST_H

#include "klibc.h"

#include <cstdint>
#include <string_view>

namespace zark::klibc {

// Hard upper bound on the items of one list, so that hostile input cannot
// make a list exhaust memory (KLIBC_ERR_TOO_LARGE past it).
inline constexpr int32_t kSzListMaxItems = 1 << 20;

// Appends a copy of text (which may lack a terminating NUL). Returns the new
// item's index, or -1 with the error state set (KLIBC_ERR_BAD_PARAMETER,
// KLIBC_ERR_TOO_LARGE, KLIBC_ERR_OUT_OF_MEMORY); the list is then unchanged.
[[nodiscard]] int SzListPush(KLIBSZLIST **list, std::string_view text);

// Frees the items past the first count, so that a call which appended
// several items and then failed leaves the list as it found it.
void SzListTruncate(KLIBSZLIST *list, int32_t count);

} // namespace zark::klibc

#endif
