// The built module as the host sees it: loaded with dlopen, its table
// walked to the end row, and its exported symbols.
#include "ZARK.Core.PortForwarding.h"
#include "file_exist_probe.h"

#include <dlfcn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstdio>
#include <memory>
#include <set>
#include <string>
#include <utility>
#include <vector>

namespace {

using zark::moduletest::ClearFileExistCalls;
using zark::moduletest::FileExistCall;
using zark::moduletest::FileExistCalls;

const std::pair<const char *, const char *> kExpectedRows[] = {
    {"ZARK.Core.PortForwarding", "detect"},
    {"ZARK.Core.PortForwarding", "detect_status"},
    {"ZARK.Core.PortForwarding", "get_current_process"},
    {"ZARK.Core.PortForwarding.RouterConf", "set"},
    {"ZARK.Core.PortForwarding.RouterConf", "get"},
    {"ZARK.Core.PortForwarding.RouterList", "get"},
    {"ZARK.Core.PortForwarding.RouterList", "list"},
    {"ZARK.Core.PortForwarding.RouterList", "update"},
    {"ZARK.Core.PortForwarding.Rules", "save"},
    {"ZARK.Core.PortForwarding.Rules", "save_status"},
    {"ZARK.Core.PortForwarding.Rules", "load"},
    {"ZARK.Core.PortForwarding.Rules", "test"},
    {"ZARK.Core.PortForwarding.Rules", "test_status"},
    {"ZARK.Core.PortForwarding.Compatibility", "test"},
    {"ZARK.Core.PortForwarding.Rules.Serv", "check"},
    {"ZARK.Core.PortForwarding.Rules.Serv", "test"},
    {"ZARK.Core.PortForwarding.Rules.Serv", "test_status"},
    {"ZARK.Core.PortForwarding.Compatibility", "test_status"},
    {"ZARK.Core.PortForwarding.Compatibility", "stop"},
    {"ZARK.Core.PortForwarding.Compatibility", "upload"},
};

// Bounds the walk of a table that lost its end row.
constexpr int kMaxRows = 4096;

struct Unloader {
  void operator()(void *handle) const { dlclose(handle); }
};
using Module = std::unique_ptr<void, Unloader>;

Module Load() {
  void *handle = dlopen(ZARK_MODULE_PATH, RTLD_NOW | RTLD_LOCAL);
  EXPECT_NE(handle, nullptr) << dlerror();
  return Module(handle);
}

// Defined symbols of the dynamic symbol table, by name.
std::vector<std::string> DynamicSymbols() {
  std::string command =
      std::string(ZARK_NM) + " -D --defined-only '" ZARK_MODULE_PATH "'";
  std::vector<std::string> names;
  FILE *pipe = popen(command.c_str(), "r");
  if (!pipe) {
    ADD_FAILURE() << "cannot run " << command;
    return names;
  }
  char line[4096];
  while (fgets(line, sizeof(line), pipe)) {
    // "<address> <type> <name>[@version]"
    char address[64];
    char type[8];
    char name[2048];
    if (sscanf(line, "%63s %7s %2047s", address, type, name) == 3) {
      std::string symbol = name;
      symbol = symbol.substr(0, symbol.find('@'));
      names.push_back(symbol);
    }
  }
  EXPECT_EQ(pclose(pipe), 0) << command;
  return names;
}

TEST(ModuleSharedObject, TableHasTwentyRowsInOrderThenEndRow) {
  Module module = Load();
  ASSERT_TRUE(module);
  using GetTable = const ZARK_API_TABLE *(*)();
  auto getTable =
      reinterpret_cast<GetTable>(dlsym(module.get(), "GetAPITable"));
  ASSERT_NE(getTable, nullptr) << dlerror();
  const ZARK_API_TABLE *table = getTable();
  ASSERT_NE(table, nullptr);
  EXPECT_EQ(static_cast<const void *>(table), dlsym(module.get(), "gTable"))
      << "GetAPITable returns the first row of gTable";

  int rows = 0;
  while (rows < kMaxRows &&
         !(table[rows].szAPI == nullptr && table[rows].version == 0 &&
           table[rows].szMethod == nullptr && table[rows].handler == nullptr)) {
    ++rows;
  }
  ASSERT_EQ(rows, 20) << "methods before the all-zero row";
  for (int i = 0; i < rows; ++i) {
    ASSERT_NE(table[i].szAPI, nullptr) << "row " << i + 1;
    ASSERT_NE(table[i].szMethod, nullptr) << "row " << i + 1;
    EXPECT_STREQ(table[i].szAPI, kExpectedRows[i].first) << "row " << i + 1;
    EXPECT_STREQ(table[i].szMethod, kExpectedRows[i].second) << "row " << i + 1;
    EXPECT_EQ(table[i].version, 1) << "row " << i + 1;
    EXPECT_NE(table[i].handler, nullptr) << "row " << i + 1;
  }
}

TEST(ModuleSharedObject, ExportsOnlyTheTableAndItsGetter) {
  // Symbols that the linker itself defines in every shared object.
  const std::set<std::string> linkerSymbols = {"_init", "_fini", "_edata",
                                               "_end", "__bss_start"};
  std::set<std::string> own;
  for (const std::string &name : DynamicSymbols()) {
    if (!linkerSymbols.count(name)) {
      own.insert(name);
    }
  }
  EXPECT_EQ(own, (std::set<std::string>{"GetAPITable", "gTable"}));
}

// Loading the module asks once whether the UPnP test's debug archive exists.
// Run in a child process so that the load is certainly the first one.
TEST(ModuleSharedObject, LoadChecksTheDebugArchiveOnce) {
  for (bool present : {false, true}) {
    if (present) {
      FILE *archive = fopen("/etc/portforward/dbg_test.tgz", "w");
      ASSERT_NE(archive, nullptr);
      fclose(archive);
    }
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      ClearFileExistCalls();
      void *handle = dlopen(ZARK_MODULE_PATH, RTLD_NOW | RTLD_LOCAL);
      int checks = 0;
      int answer = -2;
      for (const FileExistCall &call : FileExistCalls()) {
        if (call.path == "/etc/portforward/dbg_test.tgz") {
          ++checks;
          answer = call.result;
        }
      }
      // Exit status: 0 when loaded with one check that saw the file as it
      // is; otherwise what went wrong.
      if (!handle) {
        _exit(10);
      }
      if (checks != 1) {
        _exit(20 + checks);
      }
      _exit(answer == (present ? 1 : 0) ? 0 : 30);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0) << "archive present: " << present;
  }
  remove("/etc/portforward/dbg_test.tgz");
}

} // namespace
