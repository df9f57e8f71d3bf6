// Password hashes of the accounts file, made and checked with libcrypt.
#ifndef ZARK_HOST_PASSWORD_HASH_H
#define ZARK_HOST_PASSWORD_HASH_H

#include <optional>
#include <string>
#include <string_view>

namespace zark::host {

// Longest password accepted, in bytes.
inline constexpr std::size_t kMaxPasswordLength = 1024;

// A yescrypt hash ("$y$...") of password with a fresh random salt and
// libcrypt's default cost. nullopt (logged, without the password) when the
// password is empty, longer than kMaxPasswordLength or holds a NUL byte, or
// libcrypt fails.
[[nodiscard]] std::optional<std::string>
HashPassword(std::string_view password);

// True when password matches hash, in any method libcrypt knows. False for a
// hash that locks its account ("!...", "*...", empty) and for a password
// that HashPassword would refuse.
[[nodiscard]] bool VerifyPassword(std::string_view password,
                                  const std::string &hash);

// Spends about the time of one VerifyPassword on a hash that matches
// nothing, so that a login for an unknown account takes as long as one with
// a wrong password.
void VerifyAgainstDummy(std::string_view password);

} // namespace zark::host

#endif
