// The modules the host serves: shared objects loaded from a folder, their
// method tables checked and merged into one lookup by API, method and
// version.
#ifndef ZARK_HOST_MODULE_REGISTRY_H
#define ZARK_HOST_MODULE_REGISTRY_H

#include "module_lifecycle.h"
#include "module_table.h"

#include <json/json.h>

#include <cstddef>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace zark::host {

// Loading happens before serving starts; once serving, the registry is only
// read, from any number of threads. Destroying it unloads every module: the
// caller must have joined every thread that may still run module code
// (request threads and APIPolling tasks) before that.
class ModuleRegistry {
public:
  ModuleRegistry();
  ~ModuleRegistry();
  ModuleRegistry(const ModuleRegistry &) = delete;
  ModuleRegistry &operator=(const ModuleRegistry &) = delete;

  // Loads every file whose name ends in ".so" directly inside folder, in
  // name order, with LoadModule. Returns how many were accepted; a folder
  // that cannot be listed is logged and gives 0.
  std::size_t LoadFolder(const std::filesystem::path &folder);

  // Loads one module: dlopen(RTLD_NOW | RTLD_LOCAL), dlsym("GetAPITable"),
  // ReadMethodTable over the module's own segments, and a check that no
  // (API, method) of it is served by a module accepted before. Returns true
  // when accepted (logged at info level with its method count). Otherwise
  // logs "module <path> rejected: <reason>" at error level, unloads it, and
  // returns false; the modules accepted so far stay. Reasons besides those
  // of ReadMethodTable: "cannot load: <dlerror>", "no GetAPITable",
  // "GetAPITable threw", "cannot find its segments",
  // "row N: API method is served by <path> already".
  bool LoadModule(const std::filesystem::path &file);

  enum class Lookup {
    Found,     // target is set
    NoApi,     // no module serves the API
    NoMethod,  // the API has no such method
    NoVersion, // the method is not served in this version
  };
  struct Target {
    ZARK_API_HANDLER handler = nullptr;
    std::string_view module; // path of the module that serves it
  };
  [[nodiscard]] Lookup Find(std::string_view api, std::string_view method,
                            int version, Target &target) const;

  // What is served, for query.cgi:
  //   {"<API>": {"module": "<file name>",
  //              "methods": {"<method>": [<version>, ...], ...}}, ...}
  // with versions in increasing order.
  [[nodiscard]] Json::Value Describe() const;

  [[nodiscard]] std::size_t ModuleCount() const { return mModules.size(); }

  // Calls the start function (module_lifecycle.h) of every loaded module
  // that has one, in loading order, once; later calls do nothing. A start
  // that fails is logged ("module <path> start failed: <code>"). Returns
  // how many modules were started.
  std::size_t StartModules(const ZARK_MODULE_SETTINGS &settings);
  // Calls the stop function of every started module, in the reverse order,
  // once. The destructor does it too, before unloading.
  void StopModules();

private:
  struct LoadedModule;
  struct Served {
    ZARK_API_HANDLER handler = nullptr;
    const LoadedModule *module = nullptr;
  };
  using Versions = std::map<int, Served>;
  using Methods = std::map<std::string, Versions, std::less<>>;

  std::vector<std::unique_ptr<LoadedModule>> mModules;
  bool mStarted = false;
  std::map<std::string, Methods, std::less<>> mApis;
};

} // namespace zark::host

#endif
