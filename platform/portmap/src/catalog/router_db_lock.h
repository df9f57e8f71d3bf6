// The router database's locks, flock on files in /etc/portforward:
// - "routerdb.lock": readers of the installed database hold it shared, an
//   update holds it exclusive while it swaps the database in;
// - "routerdb-update.lock": held exclusive for a whole update, so that two
//   updates do not race (the later one could install an older database).
// Waits are bounded.
#ifndef ZARK_PORTMAP_ROUTER_DB_LOCK_H
#define ZARK_PORTMAP_ROUTER_DB_LOCK_H

#include "base/unique_fd.h"
#include "libzarkportmap.h"

#include <chrono>

namespace zark::portmap {

inline constexpr const char *kRouterDbLockFile =
    ZARK_PORTMAP_CONF_DIR "/routerdb.lock";
inline constexpr const char *kRouterDbUpdateLockFile =
    ZARK_PORTMAP_CONF_DIR "/routerdb-update.lock";

class RouterDbLock {
public:
  enum class Mode { kShared, kExclusive };

  // Takes the lock on path (one of the files above), waiting at most
  // timeout. Check Held(): false when the lock file cannot be opened or the
  // wait ran out (both logged).
  RouterDbLock(
      const char *path, Mode mode,
      std::chrono::milliseconds timeout = std::chrono::milliseconds(10000));
  RouterDbLock(const RouterDbLock &) = delete;
  RouterDbLock &operator=(const RouterDbLock &) = delete;
  ~RouterDbLock() = default; // closing the descriptor releases the lock

  [[nodiscard]] bool Held() const { return mFd.Valid(); }

private:
  UniqueFd mFd;
};

} // namespace zark::portmap

#endif
