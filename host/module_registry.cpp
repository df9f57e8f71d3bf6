#include "module_registry.h"

#include "host_log.h"

#include <dlfcn.h>
#include <elf.h>
#include <link.h>

#include <algorithm>
#include <cstring>
#include <system_error>

namespace zark::host {
namespace {

struct DlClose {
  void operator()(void *handle) const { dlclose(handle); }
};
using ModuleHandle = std::unique_ptr<void, DlClose>;

using GetAPITableFunction = const ZARK_API_TABLE *(*)();

struct SegmentSearch {
  std::uintptr_t base = 0;
  const char *name = nullptr;
  std::vector<MemoryRange> ranges;
  bool found = false;
};

int CollectSegments(dl_phdr_info *info, std::size_t, void *data) {
  auto *search = static_cast<SegmentSearch *>(data);
  if (info->dlpi_addr != search->base || info->dlpi_name == nullptr ||
      std::strcmp(info->dlpi_name, search->name) != 0) {
    return 0;
  }
  search->found = true;
  for (int i = 0; i < info->dlpi_phnum; ++i) {
    const ElfW(Phdr) &header = info->dlpi_phdr[i];
    if (header.p_type == PT_LOAD && (header.p_flags & PF_R) != 0) {
      std::uintptr_t begin = info->dlpi_addr + header.p_vaddr;
      search->ranges.push_back({begin, begin + header.p_memsz});
    }
  }
  return 1;
}

// The readable loaded segments of the module behind handle. Empty when the
// dynamic linker does not know it.
std::vector<MemoryRange> ModuleSegments(void *handle) {
  link_map *map = nullptr;
  if (dlinfo(handle, RTLD_DI_LINKMAP, &map) != 0 || map == nullptr) {
    return {};
  }
  SegmentSearch search;
  search.base = map->l_addr;
  search.name = map->l_name;
  dl_iterate_phdr(CollectSegments, &search);
  return search.found ? std::move(search.ranges) : std::vector<MemoryRange>{};
}

} // namespace

struct ModuleRegistry::LoadedModule {
  std::string path;
  std::vector<MethodRow> rows; // copies: nothing points into the module
  ZARK_MODULE_START start = nullptr;
  ZARK_MODULE_STOP stop = nullptr;
  bool started = false;
  ModuleHandle handle;
};

ModuleRegistry::ModuleRegistry() = default;

ModuleRegistry::~ModuleRegistry() {
  StopModules();
  mApis.clear();
  // Unload in the reverse order of loading.
  while (!mModules.empty()) {
    mModules.pop_back();
  }
}

std::size_t ModuleRegistry::LoadFolder(const std::filesystem::path &folder) {
  std::error_code error;
  std::filesystem::directory_iterator it(folder, error);
  if (error) {
    HOST_LOG(LOG_ERR, "modules folder %s cannot be listed: %s", folder.c_str(),
             error.message().c_str());
    return 0;
  }
  std::vector<std::filesystem::path> files;
  for (const auto &entry : it) {
    const std::string name = entry.path().filename().string();
    if (name.size() > 3 && name.ends_with(".so") &&
        entry.is_regular_file(error)) {
      files.push_back(entry.path());
    }
  }
  std::sort(files.begin(), files.end());
  std::size_t accepted = 0;
  for (const auto &file : files) {
    if (LoadModule(file)) {
      ++accepted;
    }
  }
  HOST_LOG(LOG_INFO, "modules folder %s: %zu of %zu modules loaded",
           folder.c_str(), accepted, files.size());
  return accepted;
}

bool ModuleRegistry::LoadModule(const std::filesystem::path &file) {
  const std::string path = file.string();
  auto reject = [&path](const std::string &reason) {
    HOST_LOG(LOG_ERR, "module %s rejected: %s", path.c_str(), reason.c_str());
    return false;
  };

  dlerror();
  ModuleHandle handle(dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL));
  if (!handle) {
    const char *why = dlerror();
    return reject(std::string("cannot load: ") + (why ? why : "unknown"));
  }
  auto getTable =
      reinterpret_cast<GetAPITableFunction>(dlsym(handle.get(), "GetAPITable"));
  if (getTable == nullptr) {
    return reject("no GetAPITable");
  }
  const ZARK_API_TABLE *table = nullptr;
  try {
    table = getTable();
  } catch (...) {
    return reject("GetAPITable threw");
  }
  std::vector<MemoryRange> segments = ModuleSegments(handle.get());
  if (segments.empty()) {
    return reject("cannot find its segments");
  }

  auto module = std::make_unique<LoadedModule>();
  module->path = path;
  std::string reason;
  if (!ReadMethodTable(table, segments, module->rows, reason)) {
    return reject(reason);
  }
  // A module is served whole or not at all: check every row against the
  // modules accepted before, then add them.
  for (std::size_t i = 0; i < module->rows.size(); ++i) {
    const MethodRow &row = module->rows[i];
    auto api = mApis.find(row.api);
    if (api == mApis.end()) {
      continue;
    }
    auto method = api->second.find(row.method);
    if (method == api->second.end() || method->second.empty()) {
      continue;
    }
    const LoadedModule *owner = method->second.begin()->second.module;
    return reject("row " + std::to_string(i + 1) + ": " + row.api + " " +
                  row.method + " is served by " + owner->path + " already");
  }
  module->start = reinterpret_cast<ZARK_MODULE_START>(
      dlsym(handle.get(), ZARK_MODULE_START_SYMBOL));
  module->stop = reinterpret_cast<ZARK_MODULE_STOP>(
      dlsym(handle.get(), ZARK_MODULE_STOP_SYMBOL));
  if ((module->start == nullptr) != (module->stop == nullptr)) {
    return reject("exports only one of " ZARK_MODULE_START_SYMBOL
                  " and " ZARK_MODULE_STOP_SYMBOL);
  }
  module->handle = std::move(handle);
  for (const MethodRow &row : module->rows) {
    mApis[row.api][row.method][row.version] = {row.handler, module.get()};
  }
  HOST_LOG(LOG_INFO, "module %s loaded: %zu methods", path.c_str(),
           module->rows.size());
  mModules.push_back(std::move(module));
  return true;
}

std::size_t ModuleRegistry::StartModules(const ZARK_MODULE_SETTINGS &settings) {
  if (mStarted) {
    return 0;
  }
  mStarted = true;
  std::size_t started = 0;
  for (const auto &module : mModules) {
    if (module->start == nullptr) {
      continue;
    }
    int code = -1;
    try {
      code = module->start(&settings);
    } catch (...) {
      HOST_LOG(LOG_ERR, "module %s start threw", module->path.c_str());
    }
    // Stop runs even after a failed start: it may have started a part.
    module->started = true;
    if (code != 0) {
      HOST_LOG(LOG_ERR, "module %s start failed: %d", module->path.c_str(),
               code);
      continue;
    }
    HOST_LOG(LOG_INFO, "module %s started", module->path.c_str());
    ++started;
  }
  return started;
}

void ModuleRegistry::StopModules() {
  for (auto it = mModules.rbegin(); it != mModules.rend(); ++it) {
    LoadedModule &module = **it;
    if (!module.started) {
      continue;
    }
    module.started = false;
    try {
      module.stop();
    } catch (...) {
      HOST_LOG(LOG_ERR, "module %s stop threw", module.path.c_str());
      continue;
    }
    HOST_LOG(LOG_INFO, "module %s stopped", module.path.c_str());
  }
}

ModuleRegistry::Lookup ModuleRegistry::Find(std::string_view api,
                                            std::string_view method,
                                            int version, Target &target) const {
  auto apiIt = mApis.find(api);
  if (apiIt == mApis.end()) {
    return Lookup::NoApi;
  }
  auto methodIt = apiIt->second.find(method);
  if (methodIt == apiIt->second.end()) {
    return Lookup::NoMethod;
  }
  auto versionIt = methodIt->second.find(version);
  if (versionIt == methodIt->second.end()) {
    return Lookup::NoVersion;
  }
  target.handler = versionIt->second.handler;
  target.module = versionIt->second.module->path;
  return Lookup::Found;
}

Json::Value ModuleRegistry::Describe() const {
  Json::Value apis(Json::objectValue);
  for (const auto &[apiName, methods] : mApis) {
    Json::Value api(Json::objectValue);
    Json::Value methodList(Json::objectValue);
    for (const auto &[methodName, versions] : methods) {
      Json::Value versionList(Json::arrayValue);
      for (const auto &[version, served] : versions) {
        versionList.append(version);
        api["module"] =
            std::filesystem::path(served.module->path).filename().string();
      }
      methodList[methodName] = versionList;
    }
    api["methods"] = methodList;
    apis[apiName] = api;
  }
  return apis;
}

} // namespace zark::host
