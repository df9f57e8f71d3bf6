// Secrets handed to browsers (session ids, request tokens) and their
// comparison.
#ifndef ZARK_HOST_RANDOM_TOKEN_H
#define ZARK_HOST_RANDOM_TOKEN_H

#include <optional>
#include <string>
#include <string_view>

namespace zark::host {

// 128 bits from the kernel's random source (getrandom), as 32 lower-case hex
// digits. nullopt (after logging why) when the kernel gave no randomness.
[[nodiscard]] std::optional<std::string> RandomHex128();

// True when a and b are equal. Takes the same time for every pair of inputs
// of the same lengths, so that a guesser learns nothing from how long a
// comparison took.
[[nodiscard]] bool ConstantTimeEquals(std::string_view a, std::string_view b);

} // namespace zark::host

#endif
