// KLIBCFileExist.
#include "error_state.h"

#include <sys/stat.h>

#include <cerrno>

extern "C" {

int KLIBCFileExist(const char *path) {
  if (path == nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  struct stat status {};
  if (stat(path, &status) == 0) {
    return 1;
  }
  if (errno == ENOENT || errno == ENOTDIR) {
    return 0;
  }
  // EACCES on a folder of the path, ELOOP, ENAMETOOLONG...: whether the file
  // is there cannot be told.
  KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_OPEN);
  return -1;
}

} // extern "C"
