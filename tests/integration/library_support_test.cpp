// The library configuration file and the helper-program runner (private
// mount namespace).
#include "base/child_process.h"
#include "base/library_config.h"
#include "hermetic.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <sys/stat.h>

namespace {

using namespace zark::portmap;
using zark::test::ClearLogs;
using zark::test::HasLogContaining;
using zark::test::ResetFixedPaths;
using zark::test::WriteFile;

class PortMapDBLibraryConfig : public testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearLogs();
  }
};

TEST_F(PortMapDBLibraryConfig, MissingFileGivesTheDefaultQuietly) {
  EXPECT_EQ("fallback", GetLibraryConfig("routerdb_update_source", "fallback"));
  EXPECT_TRUE(zark::test::CapturedMessages().empty());
}

TEST_F(PortMapDBLibraryConfig, ReadsKeysAndDefaultsMissingOnes) {
  WriteFile(kLibraryConfigPath,
            "# library settings\n"
            "routerdb_update_source = http://127.0.0.1:8080/routerdb.tgz\n"
            "wan_probe_hosts=\n"
            "report_address=\" spaced \"\n");
  EXPECT_EQ("http://127.0.0.1:8080/routerdb.tgz",
            GetLibraryConfig(config_key::kRouterDbUpdateSource, ""));
  EXPECT_EQ("d", GetLibraryConfig(config_key::kWanProbeHosts, "d"));
  EXPECT_EQ(" spaced ", GetLibraryConfig(config_key::kReportAddress, ""));
  EXPECT_EQ("p", GetLibraryConfig(config_key::kProbeServiceAddress, "p"));
}

TEST_F(PortMapDBLibraryConfig, UnreadableFileIsLoggedAndDefaulted) {
  ASSERT_EQ(0, ::mkdir(kLibraryConfigPath, 0755)); // a folder, not a file
  EXPECT_EQ("x", GetLibraryConfig(config_key::kRouterDbUpdateSource, "x"));
  EXPECT_TRUE(HasLogContaining("cannot read /etc/portforward/portmap.conf"));
}

TEST(PortMapDBChildProcess, CapturesOutputAndExitStatus) {
  ChildOptions options;
  ChildResult result = RunProgram(
      "/bin/sh", {"sh", "-c", "echo out; echo err >&2; exit 3"}, options);
  EXPECT_TRUE(result.started);
  EXPECT_TRUE(result.exited);
  EXPECT_EQ(3, result.exitStatus);
  EXPECT_EQ("out\n", result.output);
  EXPECT_EQ("err\n", result.errors);
  EXPECT_FALSE(result.Succeeded());
}

TEST(PortMapDBChildProcess, GetsACleanEnvironmentAndNoArgumentParsing) {
  ::setenv("TAR_OPTIONS", "--to-stdout", 1);
  ChildOptions options;
  ChildResult result = RunProgram("/usr/bin/env", {"env"}, options);
  ::unsetenv("TAR_OPTIONS");
  EXPECT_TRUE(result.Succeeded());
  EXPECT_EQ("PATH=/usr/sbin:/usr/bin:/sbin:/bin\nLC_ALL=C\n", result.output);
  result = RunProgram("/bin/echo", {"echo", "a; rm -rf /", "$HOME"}, options);
  EXPECT_EQ("a; rm -rf / $HOME\n", result.output);
}

TEST(PortMapDBChildProcess, KilledAtTheDeadline) {
  ChildOptions options;
  options.timeout = std::chrono::milliseconds(200);
  ChildResult result = RunProgram("/bin/sleep", {"sleep", "30"}, options);
  EXPECT_TRUE(result.started);
  EXPECT_TRUE(result.timedOut);
  EXPECT_FALSE(result.exited);
  EXPECT_FALSE(result.Succeeded());
}

TEST(PortMapDBChildProcess, KilledForTooMuchOutput) {
  ChildOptions options;
  options.maxOutput = 1000;
  ChildResult result = RunProgram("/bin/cat", {"cat", "/dev/zero"}, options);
  EXPECT_TRUE(result.outputTooLarge);
  EXPECT_FALSE(result.Succeeded());
  EXPECT_LE(result.output.size(), 1000u);
}

TEST(PortMapDBChildProcess, FileSizeLimitStopsTheProgram) {
  ChildOptions options;
  options.maxFileSize = 4096;
  ChildResult result =
      RunProgram("/bin/sh",
                 {"sh", "-c",
                  "head -c 100000 /dev/zero > /tmp/zark-fsize-test; "
                  "r=$?; rm -f /tmp/zark-fsize-test; exit $r"},
                 options);
  EXPECT_TRUE(result.started);
  EXPECT_FALSE(result.Succeeded());
}

TEST(PortMapDBChildProcess, MissingProgramIsNotStarted) {
  ClearLogs();
  ChildOptions options;
  ChildResult result = RunProgram("/no/such/program", {"x"}, options);
  EXPECT_FALSE(result.started);
  EXPECT_FALSE(result.Succeeded());
  EXPECT_TRUE(HasLogContaining("execve failed"));
}

} // namespace
