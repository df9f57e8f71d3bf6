#include "random_token.h"

#include "host_log.h"

#include "klibc_file.h"

#include <cerrno>
#include <cstring>

namespace zark::host {

std::optional<std::string> RandomHex128() {
  std::optional<std::string> hex = klibc::RandomHex(16);
  if (!hex) {
    const int error = errno;
    HOST_LOG(LOG_ERR, "getrandom failed: %s", std::strerror(error));
  }
  return hex;
}

bool ConstantTimeEquals(std::string_view a, std::string_view b) {
  // The lengths are not secret (every token has 32 digits); the contents
  // are compared without an early exit.
  if (a.size() != b.size()) {
    return false;
  }
  unsigned char difference = 0;
  for (std::size_t i = 0; i < a.size(); ++i) {
    difference |= static_cast<unsigned char>(a[i] ^ b[i]);
  }
  return difference == 0;
}

} // namespace zark::host
