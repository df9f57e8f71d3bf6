#include "random_token.h"

#include "host_log.h"

#include <sys/random.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <cstring>

namespace zark::host {
namespace {

// getrandom returns at most what it was asked and may be interrupted; a few
// tries are plenty for 16 bytes.
constexpr int kMaxTries = 8;

} // namespace

std::optional<std::string> RandomHex128() {
  std::array<unsigned char, 16> bytes{};
  std::size_t filled = 0;
  for (int tries = 0; tries < kMaxTries && filled < bytes.size(); ++tries) {
    ssize_t got = getrandom(bytes.data() + filled, bytes.size() - filled, 0);
    if (got < 0) {
      int error = errno;
      if (error == EINTR) {
        continue;
      }
      HOST_LOG(LOG_ERR, "getrandom failed: %s", std::strerror(error));
      return std::nullopt;
    }
    filled += static_cast<std::size_t>(got);
  }
  if (filled < bytes.size()) {
    HOST_LOG(LOG_ERR, "getrandom gave %zu of %zu bytes", filled, bytes.size());
    return std::nullopt;
  }
  static constexpr char kDigits[] = "0123456789abcdef";
  std::string hex;
  hex.reserve(bytes.size() * 2);
  for (unsigned char byte : bytes) {
    hex.push_back(kDigits[byte >> 4]);
    hex.push_back(kDigits[byte & 0x0f]);
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
