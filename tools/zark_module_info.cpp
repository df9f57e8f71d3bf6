// zark-module-info: loads a web API module shared object and prints the rows
// of its method table, as the host would walk them. The module's smoke
// check: exit status 0 when the module loads and its table is well formed.
#include "ZARK.Core.PortForwarding.h"

#include <dlfcn.h>

#include <cstdio>
#include <set>
#include <string>
#include <utility>

namespace {

// A table longer than this has lost its end row.
constexpr int kMaxRows = 4096;

} // namespace

int main(int argc, char **argv) {
  if (argc != 2) {
    fprintf(stderr, "usage: %s MODULE.so\n", argv[0]);
    return 2;
  }
  void *handle = dlopen(argv[1], RTLD_NOW | RTLD_LOCAL);
  if (!handle) {
    fprintf(stderr, "cannot load %s: %s\n", argv[1], dlerror());
    return 1;
  }
  using GetTable = const ZARK_API_TABLE *(*)();
  auto getTable = reinterpret_cast<GetTable>(dlsym(handle, "GetAPITable"));
  if (!getTable) {
    fprintf(stderr, "%s exports no GetAPITable\n", argv[1]);
    dlclose(handle);
    return 1;
  }
  const ZARK_API_TABLE *table = getTable();
  std::set<std::pair<std::string, std::string>> seen;
  int rows = 0;
  int status = 0;
  for (; rows < kMaxRows; ++rows) {
    const ZARK_API_TABLE &row = table[rows];
    if (!row.szAPI && !row.szMethod && !row.handler && row.version == 0) {
      break;
    }
    if (!row.szAPI || !row.szMethod || !row.handler) {
      fprintf(stderr, "row %d is malformed\n", rows + 1);
      status = 1;
      continue;
    }
    if (!seen.emplace(row.szAPI, row.szMethod).second) {
      fprintf(stderr, "row %d repeats %s %s\n", rows + 1, row.szAPI,
              row.szMethod);
      status = 1;
    }
    printf("%2d  %-42s v%d  %s\n", rows + 1, row.szAPI, row.version,
           row.szMethod);
  }
  if (rows == kMaxRows) {
    fprintf(stderr, "no end row within %d rows\n", kMaxRows);
    status = 1;
  } else {
    printf("%d methods\n", rows);
  }
  dlclose(handle);
  return status;
}
