// The library's file-descriptor owner is the core library's (klibc_fd.h);
// this name keeps it reachable as zark::portmap::UniqueFd.
#ifndef ZARK_PORTMAP_UNIQUE_FD_H
#define ZARK_PORTMAP_UNIQUE_FD_H

#include "klibc_fd.h"

namespace zark::portmap {

using klibc::UniqueFd;

} // namespace zark::portmap

#endif
