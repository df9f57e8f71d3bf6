// The library configuration file (private mount namespace).
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

} // namespace
