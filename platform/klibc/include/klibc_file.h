// Small file helpers shared by the platform libraries, the host and the
// probe (C++ only). They record nothing in the error state: a failure leaves
// errno set for the caller to report in its own way.
#ifndef ZARK_PLATFORM_KLIBC_FILE_H
#define ZARK_PLATFORM_KLIBC_FILE_H

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace zark::klibc {

// Writes all of data to fd, carrying on after short writes and EINTR.
// True when everything was written; false with errno from the failed
// write() otherwise (part of data may have been written).
[[nodiscard]] bool WriteAll(int fd, std::string_view data);

// byteCount bytes from the kernel's random source (getrandom, blocking until
// it is seeded, retried on EINTR), as 2 * byteCount lower-case hexadecimal
// digits. nullopt with errno set when getrandom fails. May throw
// std::bad_alloc.
[[nodiscard]] std::optional<std::string> RandomHex(std::size_t byteCount);

} // namespace zark::klibc

#endif
