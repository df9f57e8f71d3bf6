#include "password_hash.h"

#include "host_log.h"
#include "random_token.h"

#include <crypt.h>
#include <string.h>

#include <cerrno>
#include <memory>
#include <mutex>

namespace zark::host {
namespace {

// The method prefix of yescrypt, Debian's default password hash.
constexpr const char *kYescryptPrefix = "$y$";

bool IsAcceptablePassword(std::string_view password) {
  return !password.empty() && password.size() <= kMaxPasswordLength &&
         password.find('\0') == std::string_view::npos;
}

// crypt_data is large (tens of KiB): one on the heap per call, wiped after.
class CryptScratch {
public:
  CryptScratch() : mData(std::make_unique<crypt_data>()) {}
  ~CryptScratch() { explicit_bzero(mData.get(), sizeof(crypt_data)); }
  CryptScratch(const CryptScratch &) = delete;
  CryptScratch &operator=(const CryptScratch &) = delete;
  crypt_data *Get() { return mData.get(); }

private:
  std::unique_ptr<crypt_data> mData;
};

// Hashes password with setting (a salt, or a whole stored hash). Empty when
// libcrypt refuses: it answers NULL or a string beginning with "*".
std::string Crypt(std::string_view password, const char *setting) {
  std::string phrase(password);
  CryptScratch scratch;
  const char *out = crypt_rn(phrase.c_str(), setting, scratch.Get(),
                             static_cast<int>(sizeof(crypt_data)));
  explicit_bzero(phrase.data(), phrase.size());
  if (out == nullptr || out[0] == '*') {
    return std::string();
  }
  return std::string(out); // copied before the scratch is wiped
}

} // namespace

std::optional<std::string> HashPassword(std::string_view password) {
  if (!IsAcceptablePassword(password)) {
    HOST_LOG(LOG_ERR,
             "password refused: empty, longer than %zu bytes or "
             "holding a NUL byte",
             kMaxPasswordLength);
    return std::nullopt;
  }
  char salt[CRYPT_GENSALT_OUTPUT_SIZE];
  // No random bytes given: libcrypt draws them from the kernel itself.
  errno = 0;
  if (crypt_gensalt_rn(kYescryptPrefix, 0, nullptr, 0, salt,
                       static_cast<int>(sizeof(salt))) == nullptr) {
    int error = errno;
    HOST_LOG(LOG_ERR, "crypt_gensalt_rn(%s) failed: %s", kYescryptPrefix,
             strerror(error));
    return std::nullopt;
  }
  std::string hash = Crypt(password, salt);
  if (hash.empty()) {
    HOST_LOG(LOG_ERR, "crypt_rn failed for a %s salt", kYescryptPrefix);
    return std::nullopt;
  }
  return hash;
}

bool VerifyPassword(std::string_view password, const std::string &hash) {
  if (!IsAcceptablePassword(password) || hash.empty() || hash[0] == '!' ||
      hash[0] == '*') {
    return false;
  }
  std::string computed = Crypt(password, hash.c_str());
  return !computed.empty() && ConstantTimeEquals(computed, hash);
}

void VerifyAgainstDummy(std::string_view password) {
  // A hash of a random password, made once.
  static std::once_flag once;
  static std::string dummy;
  std::call_once(once, [] {
    std::optional<std::string> secret = RandomHex128();
    std::optional<std::string> hash =
        HashPassword(secret ? *secret : std::string("unused-dummy"));
    dummy = hash ? *hash : std::string();
  });
  if (!dummy.empty()) {
    (void)VerifyPassword(password, dummy);
  }
}

} // namespace zark::host
