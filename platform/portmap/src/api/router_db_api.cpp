// The C interface to the router database: listing it (KLibGetRouterDBList,
// KLibFreeRouterDBList) and updating it (KLibUpdateRouterDBList).
#include "libzarkportmap.h"

#include "base/portmap_log.h"
#include "base/record_text.h"
#include "catalog/router_db.h"
#include "catalog/router_db_update.h"

#include <cstdlib>
#include <cstring>
#include <exception>

namespace {} // namespace

extern "C" {

int KLibGetRouterDBList(ZARK_ROUTERDB_LIST **list) {
  using namespace zark::portmap;
  if (list == nullptr) {
    ZARK_PM_LOG_ERROR("KLibGetRouterDBList: list must not be NULL");
    return -1;
  }
  *list = nullptr;
  try {
    RouterDb db;
    int err = ZARK_PORTMAP_ERR_NONE;
    if (!ReadRouterDb(db, err)) {
      return -1;
    }
    // Built from the last entry backwards, so each node links to the one
    // made before it and the list comes out in the database's order.
    ZARK_ROUTERDB_LIST *first = nullptr;
    for (auto it = db.entries.rbegin(); it != db.entries.rend(); ++it) {
      // calloc: the caller frees with KLibFreeRouterDBList, which is C.
      auto *node = static_cast<ZARK_ROUTERDB_LIST *>(
          std::calloc(1, sizeof(ZARK_ROUTERDB_LIST)));
      if (node == nullptr) {
        ZARK_PM_LOG_ERROR("KLibGetRouterDBList: out of memory after %zu of "
                          "%zu entries",
                          static_cast<std::size_t>(it - db.entries.rbegin()),
                          db.entries.size());
        KLibFreeRouterDBList(first);
        return -1;
      }
      CopyText(node->brand, it->brand);
      CopyText(node->model, it->model);
      CopyText(node->version, it->version);
      node->generic = it->generic;
      node->next = first;
      first = node;
    }
    *list = first;
    return 0;
  } catch (const std::exception &e) {
    ZARK_PM_LOG_ERROR("KLibGetRouterDBList: %s", e.what());
    return -1;
  }
}

void KLibFreeRouterDBList(ZARK_ROUTERDB_LIST *list) {
  while (list != nullptr) {
    ZARK_ROUTERDB_LIST *next = list->next;
    std::free(list);
    list = next;
  }
}

// Installs a newer database from the source in the library configuration.
// 0 with *version the installed database's version; -1 on failure (logged;
// the installed database is then untouched). The C interface has no error
// record here, so a syntax version mismatch is told only by the log.
int KLibUpdateRouterDBList(int *version) {
  if (version == nullptr) {
    ZARK_PM_LOG_ERROR("KLibUpdateRouterDBList: version must not be NULL");
    return -1;
  }
  int installed = 0;
  int err = ZARK_PORTMAP_ERR_NONE;
  if (!zark::portmap::UpdateRouterDb(installed, err)) {
    return -1;
  }
  *version = installed;
  return 0;
}

} // extern "C"
