// Loading modules from a folder: accepted and rejected modules, the log
// line naming each rejected module and its reason, lookups and the list of
// what is served.
#include "hermetic.h"
#include "host_test_support.h"
#include "module_registry.h"
#include "syslog_capture.h"

#include <dlfcn.h>
#include <syslog.h>

#include <gtest/gtest.h>

namespace zark::host {
namespace {

namespace fs = std::filesystem;
using test::ModuleFolder;

class HostLoader : public ::testing::Test {
protected:
  void SetUp() override {
    zark::test::ResetFixedPaths();
    zark::test::ClearLogs();
  }

  static bool IsLoaded(const fs::path &file) {
    void *handle = dlopen(file.c_str(), RTLD_NOW | RTLD_NOLOAD);
    if (handle == nullptr) {
      return false;
    }
    dlclose(handle);
    return true;
  }

  // The rejection is an error line of the loader naming the module.
  static bool Rejected(const fs::path &file, const std::string &reason) {
    return test::HasLogFrom(LOG_ERR, "host/module_registry.cpp",
                            "module " + file.string() + " rejected: " + reason);
  }

  static ModuleRegistry::Lookup Find(const ModuleRegistry &modules,
                                     const char *api, const char *method,
                                     int version) {
    ModuleRegistry::Target target;
    return modules.Find(api, method, version, target);
  }
};

TEST_F(HostLoader, GoodModuleServesItsRows) {
  fs::path folder = ModuleFolder("good", {"good_module"});
  ModuleRegistry modules;
  EXPECT_EQ(modules.LoadFolder(folder), 1u);
  EXPECT_EQ(modules.ModuleCount(), 1u);
  ModuleRegistry::Target target;
  ASSERT_EQ(modules.Find("Test.Echo", "echo", 1, target),
            ModuleRegistry::Lookup::Found);
  EXPECT_NE(target.handler, nullptr);
  EXPECT_EQ(target.module, (folder / "good_module.so").string());
  EXPECT_TRUE(zark::test::HasLogContaining(
      "module " + (folder / "good_module.so").string() +
      " loaded: 10 methods"));
}

TEST_F(HostLoader, LookupTellsApiMethodAndVersionApart) {
  ModuleRegistry modules;
  ASSERT_TRUE(modules.LoadModule(test::BuiltModule("good_module")));
  EXPECT_EQ(Find(modules, "Test.Echo", "echo", 2),
            ModuleRegistry::Lookup::Found);
  EXPECT_EQ(Find(modules, "Test.Echo", "echo", 3),
            ModuleRegistry::Lookup::NoVersion);
  EXPECT_EQ(Find(modules, "Test.Echo", "nope", 1),
            ModuleRegistry::Lookup::NoMethod);
  EXPECT_EQ(Find(modules, "Test.Nope", "echo", 1),
            ModuleRegistry::Lookup::NoApi);
  // Names are matched exactly.
  EXPECT_EQ(Find(modules, "test.echo", "echo", 1),
            ModuleRegistry::Lookup::NoApi);
}

TEST_F(HostLoader, DescribeListsApisMethodsAndVersions) {
  ModuleRegistry modules;
  ASSERT_TRUE(modules.LoadModule(test::BuiltModule("good_module")));
  ASSERT_TRUE(modules.LoadModule(test::BuiltModule("other_module")));
  Json::Value served = modules.Describe();
  EXPECT_EQ(served.size(), 3u);
  EXPECT_EQ(served["Test.Echo"]["module"].asString(), "good_module.so");
  Json::Value versions(Json::arrayValue);
  versions.append(1);
  versions.append(2);
  EXPECT_EQ(served["Test.Echo"]["methods"]["echo"], versions);
  EXPECT_EQ(served["Test.Echo"]["methods"].size(), 7u);
  EXPECT_EQ(served["Test.Task"]["methods"].size(), 2u);
  EXPECT_EQ(served["Test.Other"]["module"].asString(), "other_module.so");
  EXPECT_EQ(served["Test.Other"]["methods"]["ping"][0].asInt(), 1);
}

struct Malformed {
  const char *module;
  const char *reason;
};

void PrintTo(const Malformed &c, std::ostream *out) {
  *out << c.module;
}

class HostLoaderMalformed : public HostLoader,
                            public ::testing::WithParamInterface<Malformed> {};

// Each malformed module is refused with its reason and unloaded; the good
// modules beside it, before and after it in name order, still load.
TEST_P(HostLoaderMalformed, IsRejectedAndOthersStillLoad) {
  const Malformed &c = GetParam();
  fs::path folder =
      ModuleFolder("mixed", {"good_module", c.module, "other_module"});
  fs::path bad = folder / (std::string(c.module) + ".so");
  ModuleRegistry modules;
  EXPECT_EQ(modules.LoadFolder(folder), 2u);
  EXPECT_TRUE(Rejected(bad, c.reason))
      << ::testing::PrintToString(zark::test::CapturedMessages());
  EXPECT_FALSE(IsLoaded(bad));
  EXPECT_EQ(Find(modules, "Test.Echo", "echo", 1),
            ModuleRegistry::Lookup::Found);
  EXPECT_EQ(Find(modules, "Test.Other", "ping", 1),
            ModuleRegistry::Lookup::Found);
  EXPECT_EQ(modules.Describe().size(), 3u);
}

INSTANTIATE_TEST_SUITE_P(
    HostModules, HostLoaderMalformed,
    ::testing::Values(
        Malformed{"null_handler_module", "row 2 has no handler"},
        Malformed{"duplicate_row_module",
                  "row 3 repeats Test.Duplicate get version 1"},
        Malformed{"endless_table_module", "no end row within 4096 rows"},
        Malformed{"no_table_module", "no GetAPITable"},
        Malformed{"heap_table_module", "row 1 lies outside the module"}),
    [](const ::testing::TestParamInfo<Malformed> &info) {
      return std::string(info.param.module);
    });

TEST_F(HostLoader, ApiMethodOfAnotherModuleRejectsTheLaterModule) {
  ModuleRegistry modules;
  ASSERT_TRUE(modules.LoadModule(test::BuiltModule("good_module")));
  EXPECT_FALSE(modules.LoadModule(test::BuiltModule("clash_module")));
  EXPECT_TRUE(Rejected(test::BuiltModule("clash_module"),
                       "row 2: Test.Echo echo is served by " +
                           test::BuiltModule("good_module").string() +
                           " already"));
  // Nothing of the rejected module is served, not even its own API.
  EXPECT_EQ(Find(modules, "Test.Clash", "own", 1),
            ModuleRegistry::Lookup::NoApi);
  EXPECT_EQ(Find(modules, "Test.Echo", "echo", 3),
            ModuleRegistry::Lookup::NoVersion);
  EXPECT_EQ(modules.ModuleCount(), 1u);
}

TEST_F(HostLoader, FolderIsLoadedInNameOrder) {
  // "clash_module.so" comes before "good_module.so": it wins.
  fs::path folder = ModuleFolder("order", {"good_module", "clash_module"});
  ModuleRegistry modules;
  EXPECT_EQ(modules.LoadFolder(folder), 1u);
  EXPECT_TRUE(Rejected(folder / "good_module.so",
                       "row 1: Test.Echo echo is served by " +
                           (folder / "clash_module.so").string() + " already"));
  EXPECT_EQ(Find(modules, "Test.Clash", "own", 1),
            ModuleRegistry::Lookup::Found);
}

TEST_F(HostLoader, FileThatIsNoSharedObjectIsRejected) {
  fs::path folder = ModuleFolder("junk", {"other_module"});
  zark::test::WriteFile((folder / "junk.so").string(), "not an ELF file\n");
  ModuleRegistry modules;
  EXPECT_EQ(modules.LoadFolder(folder), 1u);
  EXPECT_TRUE(Rejected(folder / "junk.so", "cannot load: "));
}

TEST_F(HostLoader, OnlyFilesEndingInSoAreLoaded) {
  fs::path folder = ModuleFolder("names", {});
  fs::copy_file(test::BuiltModule("good_module"),
                folder / "good_module.so.disabled");
  fs::copy_file(test::BuiltModule("other_module"), folder / "other_module");
  fs::create_directories(folder / "folder.so");
  zark::test::WriteFile((folder / "README").string(), "text\n");
  ModuleRegistry modules;
  EXPECT_EQ(modules.LoadFolder(folder), 0u);
  EXPECT_FALSE(zark::test::HasLogContaining("rejected"));
}

TEST_F(HostLoader, MissingFolderLoadsNothing) {
  ModuleRegistry modules;
  EXPECT_EQ(modules.LoadFolder("/tmp/host-modules/none"), 0u);
  EXPECT_TRUE(zark::test::HasLogContaining(
      "modules folder /tmp/host-modules/none cannot be listed"));
}

TEST_F(HostLoader, ModulesAreUnloadedWithTheRegistry) {
  fs::path folder = ModuleFolder("unload", {"good_module"});
  {
    ModuleRegistry modules;
    ASSERT_EQ(modules.LoadFolder(folder), 1u);
    EXPECT_TRUE(IsLoaded(folder / "good_module.so"));
  }
  EXPECT_FALSE(IsLoaded(folder / "good_module.so"));
}

TEST_F(HostLoader, PortForwardingModuleLoadsWithItsTwentyMethods) {
  ModuleRegistry modules;
  ASSERT_TRUE(modules.LoadModule(HOST_PORTFORWARDING_MODULE))
      << ::testing::PrintToString(zark::test::CapturedMessages());
  Json::Value served = modules.Describe();
  EXPECT_EQ(served.size(), 6u);
  std::size_t methods = 0;
  for (const Json::Value &api : served) {
    for (const Json::Value &versions : api["methods"]) {
      methods += versions.size();
    }
  }
  EXPECT_EQ(methods, 20u);
  EXPECT_EQ(Find(modules, "ZARK.Core.PortForwarding.Rules", "save", 1),
            ModuleRegistry::Lookup::Found);
  EXPECT_EQ(Find(modules, "ZARK.Core.PortForwarding.Compatibility", "stop", 1),
            ModuleRegistry::Lookup::Found);
}

// What the lifecycle module noted so far.
std::string LifecycleLog() {
  return fs::exists("/tmp/host/lifecycle.log")
             ? zark::test::ReadFile("/tmp/host/lifecycle.log")
             : std::string();
}

ZARK_MODULE_SETTINGS Settings(int interval) {
  ZARK_MODULE_SETTINGS settings = DefaultModuleSettings();
  settings.keeper_interval_seconds = interval;
  return settings;
}

TEST_F(HostLoader, StartAndStopRunOnceEach) {
  fs::create_directories("/tmp/host");
  ModuleRegistry modules;
  ASSERT_EQ(modules.LoadFolder(
                ModuleFolder("lifecycle", {"good_module", "lifecycle_module"})),
            2u);
  // Loading alone starts nothing.
  EXPECT_EQ(LifecycleLog(), "");
  EXPECT_EQ(modules.StartModules(Settings(7)), 1u);
  EXPECT_EQ(modules.StartModules(Settings(7)), 0u);
  EXPECT_EQ(LifecycleLog(), "start 7\n");
  modules.StopModules();
  modules.StopModules();
  EXPECT_EQ(LifecycleLog(), "start 7\nstop\n");
}

TEST_F(HostLoader, UnloadingStopsAStartedModule) {
  fs::create_directories("/tmp/host");
  {
    ModuleRegistry modules;
    ASSERT_EQ(modules.LoadFolder(
                  ModuleFolder("lifecycle-unload", {"lifecycle_module"})),
              1u);
    modules.StartModules(Settings(300));
  }
  EXPECT_EQ(LifecycleLog(), "start 300\nstop\n");
}

TEST_F(HostLoader, UnloadingANeverStartedModuleStopsNothing) {
  fs::create_directories("/tmp/host");
  {
    ModuleRegistry modules;
    ASSERT_EQ(modules.LoadFolder(
                  ModuleFolder("lifecycle-idle", {"lifecycle_module"})),
              1u);
  }
  EXPECT_EQ(LifecycleLog(), "");
}

TEST_F(HostLoader, FailedStartIsLoggedAndStillStopped) {
  fs::create_directories("/tmp/host");
  fs::path folder = ModuleFolder("lifecycle-fail", {"lifecycle_module"});
  ModuleRegistry modules;
  ASSERT_EQ(modules.LoadFolder(folder), 1u);
  EXPECT_EQ(modules.StartModules(Settings(13)), 0u);
  EXPECT_TRUE(test::HasLogFrom(LOG_ERR, "host/module_registry.cpp",
                               "module " +
                                   (folder / "lifecycle_module.so").string() +
                                   " start failed: -13"));
  // Still served.
  EXPECT_EQ(Find(modules, "Test.Lifecycle", "ping", 1),
            ModuleRegistry::Lookup::Found);
  modules.StopModules();
  EXPECT_EQ(LifecycleLog(), "start 13\nstop\n");
}

TEST_F(HostLoader, StartWithoutStopIsRejected) {
  fs::path folder = ModuleFolder("half", {"half_lifecycle_module"});
  ModuleRegistry modules;
  EXPECT_EQ(modules.LoadFolder(folder), 0u);
  EXPECT_TRUE(Rejected(folder / "half_lifecycle_module.so",
                       "exports only one of ZarkModuleStart and "
                       "ZarkModuleStop"));
  EXPECT_FALSE(IsLoaded(folder / "half_lifecycle_module.so"));
}

} // namespace
} // namespace zark::host
