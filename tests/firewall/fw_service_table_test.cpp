// The firewall-section table over service definition files.
#include "firewall_test_files.h"
#include "hermetic.h"
#include "syslog_capture.h"
#include "zarkfw.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <syslog.h>

#include <filesystem>
#include <memory>
#include <regex>

namespace {

using namespace zark::test;

struct TableDeleter {
  void operator()(ZARK_FW_SERVICE_TABLE *table) const {
    ZARKFwServiceFree(table);
  }
};
using Table = std::unique_ptr<ZARK_FW_SERVICE_TABLE, TableDeleter>;

// Builds the table; count gets ZARKFwServiceEnum's result.
Table Enum(int &count) {
  ZARK_FW_SERVICE_TABLE *table = nullptr;
  count = ZARKFwServiceEnum(&table);
  return Table(table);
}

bool HasLogMatching(int priority, const std::string &pattern) {
  std::regex re(pattern);
  for (const LogLine &line : CapturedLogs()) {
    if (line.priority == priority && std::regex_search(line.message, re)) {
      return true;
    }
  }
  return false;
}

class FirewallTable : public ::testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearLogs();
  }
};

TEST_F(FirewallTable, HoldsTheSectionsOfSystemAndPackageFiles) {
  WriteSystemService("ftp", Section("ftp", "tcp", "21") +
                                Section("ftp_passive", "tcp", "55536-55899"));
  WritePackageFile("media.sc", Section("media_dlna", "both", "1900,8200") +
                                   Section("media_lan", "udp", "", false));
  int count = 0;
  Table table = Enum(count);
  ASSERT_NE(table, nullptr);
  EXPECT_EQ(count, 4);

  const ZARK_FW_SERVICE *ftp = ZARKFWServiceFind(table.get(), "ftp_passive");
  ASSERT_NE(ftp, nullptr);
  EXPECT_STREQ(ftp->szName, "ftp_passive");
  EXPECT_EQ(ftp->blUsable, 1);
  EXPECT_EQ(ftp->protoMask, ZARK_FW_PROTO_TCP);
  EXPECT_EQ(Items(ftp->pslPorts), (std::vector<std::string>{"55536-55899"}));

  const ZARK_FW_SERVICE *dlna = ZARKFWServiceFind(table.get(), "media_dlna");
  ASSERT_NE(dlna, nullptr);
  EXPECT_EQ(dlna->protoMask, ZARK_FW_PROTO_BOTH);
  EXPECT_EQ(Items(dlna->pslPorts), (std::vector<std::string>{"1900", "8200"}));

  const ZARK_FW_SERVICE *lan = ZARKFWServiceFind(table.get(), "media_lan");
  ASSERT_NE(lan, nullptr);
  EXPECT_EQ(lan->blUsable, 0);
  ASSERT_NE(lan->pslPorts, nullptr);
  EXPECT_EQ(lan->pslPorts->nItem, 0);

  EXPECT_EQ(ZARKFWServiceFind(table.get(), "nosuch"), nullptr);
  EXPECT_EQ(ZARKFWServiceFind(table.get(), nullptr), nullptr);
  EXPECT_EQ(ZARKFWServiceFind(nullptr, "ftp"), nullptr);
}

TEST_F(FirewallTable, SectionWithoutPortsKeyHasNoPortList) {
  WritePackageFile("p.sc", "[noports]\nprotocol=tcp\n");
  int count = 0;
  Table table = Enum(count);
  EXPECT_EQ(count, 1);
  const ZARK_FW_SERVICE *section = ZARKFWServiceFind(table.get(), "noports");
  ASSERT_NE(section, nullptr);
  EXPECT_EQ(section->pslPorts, nullptr);
}

TEST_F(FirewallTable, NoDefinitionsAtAllIsAnEmptyTable) {
  int count = -1;
  Table table = Enum(count);
  EXPECT_EQ(count, 0);
  EXPECT_NE(table, nullptr);
}

TEST_F(FirewallTable, NullArgumentFails) {
  EXPECT_EQ(ZARKFwServiceEnum(nullptr), -1);
  EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_BAD_PARAMETER);
  ZARKFwServiceFree(nullptr); // accepted
}

TEST_F(FirewallTable, MalformedSectionsAreSkippedWithALogAndTheRestUsed) {
  WriteSystemService("mixed", Section("good", "tcp", "22") +
                                  Section("badports", "tcp", "22,x") +
                                  "[badproto]\nprotocol=icmp\nports=1\n" +
                                  Section("good2", "udp", "1194"));
  int count = 0;
  Table table = Enum(count);
  EXPECT_EQ(count, 2);
  EXPECT_NE(ZARKFWServiceFind(table.get(), "good"), nullptr);
  EXPECT_NE(ZARKFWServiceFind(table.get(), "good2"), nullptr);
  EXPECT_EQ(ZARKFWServiceFind(table.get(), "badports"), nullptr);
  EXPECT_EQ(ZARKFWServiceFind(table.get(), "badproto"), nullptr);
  EXPECT_TRUE(HasLogMatching(
      LOG_WARNING, R"(^platform/firewall/src/fw_service_table\.cpp:\d+ )"
                   R"(/usr/zark/etc\.defaults/services\.d/mixed\.sc: line 5: )"
                   R"(section \[badports\] skipped: bad port "x"$)"));
  EXPECT_TRUE(HasLogMatching(LOG_WARNING,
                             R"(mixed\.sc: line 9: section \[badproto\] )"
                             R"(skipped: bad protocol "icmp")"));
}

TEST_F(FirewallTable, FileWithoutSectionHeaderIsLoggedAndOthersUsed) {
  WritePackageFile("a.sc", "protocol=tcp\nports=80\n");
  WritePackageFile("b.sc", Section("b", "tcp", "81"));
  int count = 0;
  Table table = Enum(count);
  EXPECT_EQ(count, 1);
  EXPECT_NE(ZARKFWServiceFind(table.get(), "b"), nullptr);
  EXPECT_TRUE(
      HasLogMatching(LOG_WARNING, R"(services\.d/a\.sc: no section header$)"));
}

TEST_F(FirewallTable, UnreadableFileIsLoggedAndOthersUsed) {
  // A folder named like a service file cannot be read as one.
  WritePackageFile("dir.sc/inner", "x");
  WritePackageFile("big.sc", "[big]\nprotocol=tcp\nports=1\n# " +
                                 std::string(2 << 20, 'x') + "\n");
  WritePackageFile("ok.sc", Section("ok", "tcp", "81"));
  int count = 0;
  Table table = Enum(count);
  EXPECT_EQ(count, 1);
  EXPECT_NE(ZARKFWServiceFind(table.get(), "ok"), nullptr);
  // A folder is not a regular file and is not listed at all; the oversized
  // file is read and refused.
  EXPECT_FALSE(HasLogContaining("dir.sc"));
  EXPECT_TRUE(HasLogMatching(
      LOG_ERR,
      R"(cannot read service file /usr/local/etc/services\.d/big\.sc: )"));
}

TEST_F(FirewallTable, OnlyScFilesCount) {
  WritePackageFile("notes.txt", Section("txt", "tcp", "1"));
  WritePackageFile(".hidden.sc", Section("hidden", "tcp", "2"));
  WritePackageFile("x.sc~", Section("backup", "tcp", "3"));
  WritePackageFile("real.sc", Section("real", "tcp", "4"));
  int count = 0;
  Table table = Enum(count);
  EXPECT_EQ(count, 1);
  EXPECT_NE(ZARKFWServiceFind(table.get(), "real"), nullptr);
}

TEST_F(FirewallTable, SymbolicLinksAreFollowed) {
  WriteFile("/usr/zark/elsewhere/real.txt", Section("linked", "tcp", "1"));
  std::filesystem::create_directories(ZARK_FW_PACKAGE_SERVICE_DIR);
  std::filesystem::create_symlink("/usr/zark/elsewhere/real.txt",
                                  std::string(ZARK_FW_PACKAGE_SERVICE_DIR) +
                                      "/linked.sc");
  std::filesystem::create_directory_symlink(
      "/usr/zark/elsewhere",
      std::string(ZARK_FW_PACKAGE_SERVICE_DIR) + "/folder.sc");
  int count = 0;
  Table table = Enum(count);
  EXPECT_EQ(count, 1);
  EXPECT_NE(ZARKFWServiceFind(table.get(), "linked"), nullptr);
}

TEST_F(FirewallTable, SystemSectionWinsOverAPackageOfTheSameName) {
  WriteSystemService("ssh", Section("ssh", "tcp", "22"));
  WritePackageFile("evil.sc", Section("ssh", "udp", "2222"));
  int count = 0;
  Table table = Enum(count);
  EXPECT_EQ(count, 1);
  const ZARK_FW_SERVICE *ssh = ZARKFWServiceFind(table.get(), "ssh");
  ASSERT_NE(ssh, nullptr);
  EXPECT_EQ(ssh->protoMask, ZARK_FW_PROTO_TCP);
  EXPECT_TRUE(HasLogMatching(LOG_WARNING,
                             R"(evil\.sc: line 1: section \[ssh\] skipped: )"
                             R"(already defined by another service file)"));
}

TEST_F(FirewallTable, RecordsLiveAsLongAsTheTable) {
  std::string text;
  for (int i = 0; i < 300; ++i) {
    text += Section("s" + std::to_string(i), "tcp", std::to_string(1000 + i));
  }
  WritePackageFile("many.sc", text);
  int count = 0;
  Table table = Enum(count);
  ASSERT_EQ(count, 300);
  const ZARK_FW_SERVICE *first = ZARKFWServiceFind(table.get(), "s0");
  for (int i = 0; i < 300; ++i) {
    const ZARK_FW_SERVICE *section =
        ZARKFWServiceFind(table.get(), ("s" + std::to_string(i)).c_str());
    ASSERT_NE(section, nullptr);
    EXPECT_EQ(Items(section->pslPorts),
              std::vector<std::string>{std::to_string(1000 + i)});
  }
  EXPECT_EQ(first, ZARKFWServiceFind(table.get(), "s0"));
}

} // namespace
