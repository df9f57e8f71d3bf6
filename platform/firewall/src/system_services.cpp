// The server's system services: one service definition file per service in
// ZARK_FW_SYSTEM_SERVICE_DIR, named after the service's identifier.
#include "zarkfw.h"

#include "fw_log.h"
#include "service_dir.h"
#include "service_file.h"

#include <cerrno>
#include <cstring>
#include <new>
#include <string>

namespace {

int ErrorOfErrno(int err) {
  return err == ENOENT ? KLIBC_ERR_FILE_NOT_FOUND : KLIBC_ERR_FILE_OPEN;
}

} // namespace

extern "C" int KLIBServiceEnum(KLIBSZLIST **list) {
  if (list == nullptr || *list == nullptr) {
    KLIBCErrSetEx(KLIBC_ERR_BAD_PARAMETER, __FILE__, __LINE__);
    return -1;
  }
  try {
    zark::fw::ServiceDirListing listing =
        zark::fw::ListServiceDir(ZARK_FW_SYSTEM_SERVICE_DIR);
    if (listing.err != 0) {
      // Without the folder the server's own services cannot be told.
      KLIBCErrSetEx(ErrorOfErrno(listing.err), __FILE__, __LINE__);
      ZARKFW_LOG(LOG_ERR, "cannot list system services in %s: %s",
                 ZARK_FW_SYSTEM_SERVICE_DIR, std::strerror(listing.err));
      return -1;
    }
    for (const std::string &serviceId : listing.serviceIds) {
      if (KLIBCSzListPush(list, serviceId.c_str()) < 0) {
        return -1;
      }
    }
    return 0;
  } catch (const std::bad_alloc &) {
    KLIBCErrSetEx(KLIBC_ERR_OUT_OF_MEMORY, __FILE__, __LINE__);
    return -1;
  }
}

extern "C" int KLIBServicecfgInfoGet(const char *serviceId, int kind,
                                     KLIBSZLIST **list) {
  if (serviceId == nullptr || list == nullptr || *list == nullptr ||
      kind != KLIB_SERVICE_INFO_FW_SECTIONS) {
    KLIBCErrSetEx(KLIBC_ERR_BAD_PARAMETER, __FILE__, __LINE__);
    return -1;
  }
  try {
    if (!zark::fw::IsServiceId(serviceId)) {
      KLIBCErrSetEx(KLIBC_ERR_BAD_PARAMETER, __FILE__, __LINE__);
      return -1;
    }
    std::string path = std::string(ZARK_FW_SYSTEM_SERVICE_DIR) + "/" +
                       serviceId + std::string(zark::fw::kServiceFileSuffix);
    zark::fw::FileText file = zark::fw::ReadServiceFile(path);
    if (file.err != 0) {
      KLIBCErrSetEx(ErrorOfErrno(file.err), __FILE__, __LINE__);
      if (file.err != ENOENT) {
        ZARKFW_LOG(LOG_ERR, "cannot read service file %s: %s", path.c_str(),
                   std::strerror(file.err));
      }
      return -1;
    }
    // Every section the file names, also refused ones: they are not in the
    // firewall-section table, so its users drop them there.
    zark::fw::ServiceFileParse parsed = zark::fw::ParseServiceFile(file.text);
    for (const std::string &name : parsed.sectionNames) {
      if (KLIBCSzListPush(list, name.c_str()) < 0) {
        return -1;
      }
    }
    return 0;
  } catch (const std::bad_alloc &) {
    KLIBCErrSetEx(KLIBC_ERR_OUT_OF_MEMORY, __FILE__, __LINE__);
    return -1;
  }
}
