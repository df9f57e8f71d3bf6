#include "base/library_config.h"

#include "base/portmap_log.h"
#include "klibc.h"

#include <array>

namespace zark::portmap {

std::string GetLibraryConfig(std::string_view key, std::string_view fallback) {
  const std::string keyText(key);
  std::array<char, ZARK_PORTMAP_TEXT_SIZE> value{};
  int got =
      KLIBCFileGetKeyValue(kLibraryConfigPath, keyText.c_str(), value.data(),
                           static_cast<int>(value.size()), 0);
  if (got < 0) {
    // A missing file simply means every default; anything else is worth a
    // line, because the administrator's settings are then being ignored.
    if (KLIBCErrGet() != KLIBC_ERR_FILE_NOT_FOUND) {
      ZARK_PM_LOG_ERROR("cannot read %s (klibc error 0x%04X), using the "
                        "default of %s",
                        kLibraryConfigPath, KLIBCErrGet(), keyText.c_str());
    }
    return std::string(fallback);
  }
  if (got == 0) {
    return std::string(fallback);
  }
  return std::string(value.data());
}

} // namespace zark::portmap
