// The server's system services: KLIBServiceEnum and KLIBServicecfgInfoGet.
#include "firewall_test_files.h"
#include "hermetic.h"
#include "syslog_capture.h"
#include "zarkfw.h"

#include <gtest/gtest.h>

#include <filesystem>

namespace {

using namespace zark::test;
using Names = std::vector<std::string>;

class FirewallSystemServices : public ::testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearLogs();
  }
};

TEST_F(FirewallSystemServices, EnumListsServiceFilesSortedAndAppends) {
  WriteSystemService("ssh", Section("ssh", "tcp", "22"));
  WriteSystemService("ftp", Section("ftp", "tcp", "21"));
  WriteSystemService("webadmin", Section("webadmin_http", "tcp", "5000"));
  WriteFile(std::string(ZARK_FW_SYSTEM_SERVICE_DIR) + "/README", "x");
  SzList list = NewList({"already"});
  KLIBSZLIST *raw = list.release();
  EXPECT_EQ(KLIBServiceEnum(&raw), 0);
  list.reset(raw);
  EXPECT_EQ(Items(list.get()), (Names{"already", "ftp", "ssh", "webadmin"}));
}

TEST_F(FirewallSystemServices, EnumOfAnEmptyFolderSucceedsWithNothing) {
  std::filesystem::create_directories(ZARK_FW_SYSTEM_SERVICE_DIR);
  SzList list = NewList();
  KLIBSZLIST *raw = list.release();
  EXPECT_EQ(KLIBServiceEnum(&raw), 0);
  list.reset(raw);
  EXPECT_EQ(list->nItem, 0);
}

TEST_F(FirewallSystemServices, EnumWithoutTheFolderFails) {
  SzList list = NewList();
  KLIBSZLIST *raw = list.release();
  EXPECT_LT(KLIBServiceEnum(&raw), 0);
  list.reset(raw);
  EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_FILE_NOT_FOUND);
  EXPECT_EQ(list->nItem, 0);
  EXPECT_TRUE(HasLogContaining("cannot list system services in "
                               "/usr/zark/etc.defaults/services.d"));
}

TEST_F(FirewallSystemServices, EnumRefusesANullList) {
  EXPECT_LT(KLIBServiceEnum(nullptr), 0);
  EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_BAD_PARAMETER);
  KLIBSZLIST *none = nullptr;
  EXPECT_LT(KLIBServiceEnum(&none), 0);
}

TEST_F(FirewallSystemServices, InfoGetAppendsTheSectionNamesInFileOrder) {
  WriteSystemService("ftp", Section("ftp", "tcp", "21") +
                                Section("ftp_passive", "tcp", "55536-55899") +
                                Section("ftp_bad", "tcp", "nope"));
  SzList list = NewList({"x"});
  KLIBSZLIST *raw = list.release();
  EXPECT_EQ(KLIBServicecfgInfoGet("ftp", KLIB_SERVICE_INFO_FW_SECTIONS, &raw),
            0);
  list.reset(raw);
  // Refused sections are named too; the table does not hold them.
  EXPECT_EQ(Items(list.get()), (Names{"x", "ftp", "ftp_passive", "ftp_bad"}));
}

TEST_F(FirewallSystemServices, InfoGetOfAnUnknownServiceFails) {
  std::filesystem::create_directories(ZARK_FW_SYSTEM_SERVICE_DIR);
  SzList list = NewList();
  KLIBSZLIST *raw = list.release();
  EXPECT_LT(KLIBServicecfgInfoGet("nosuch", 64, &raw), 0);
  list.reset(raw);
  EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_FILE_NOT_FOUND);
  EXPECT_EQ(list->nItem, 0);
}

TEST_F(FirewallSystemServices, InfoGetOfAnotherKindFails) {
  WriteSystemService("ssh", Section("ssh", "tcp", "22"));
  SzList list = NewList();
  KLIBSZLIST *raw = list.release();
  EXPECT_LT(KLIBServicecfgInfoGet("ssh", 1, &raw), 0);
  EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_BAD_PARAMETER);
  EXPECT_LT(KLIBServicecfgInfoGet(nullptr, 64, &raw), 0);
  EXPECT_LT(KLIBServicecfgInfoGet("ssh", 64, nullptr), 0);
  list.reset(raw);
  EXPECT_EQ(list->nItem, 0);
}

TEST_F(FirewallSystemServices, InfoGetRefusesIdentifiersThatAreNoFileName) {
  WriteSystemService("ssh", Section("ssh", "tcp", "22"));
  WriteFile("/usr/zark/etc.defaults/escape.sc", Section("escape", "tcp", "1"));
  SzList list = NewList();
  KLIBSZLIST *raw = list.release();
  for (const char *id : {"", ".", "..", "../escape", "ssh/x"}) {
    EXPECT_LT(KLIBServicecfgInfoGet(id, 64, &raw), 0) << id;
    EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_BAD_PARAMETER) << id;
  }
  list.reset(raw);
  EXPECT_EQ(list->nItem, 0);
}

TEST_F(FirewallSystemServices, InfoGetOfAnUnreadableFileFailsWithALog) {
  // A folder in the place of the service file.
  WriteFile(std::string(ZARK_FW_SYSTEM_SERVICE_DIR) + "/odd.sc/x", "x");
  SzList list = NewList();
  KLIBSZLIST *raw = list.release();
  EXPECT_LT(KLIBServicecfgInfoGet("odd", 64, &raw), 0);
  list.reset(raw);
  EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_FILE_OPEN);
  EXPECT_TRUE(HasLogContaining("cannot read service file "
                               "/usr/zark/etc.defaults/services.d/odd.sc"));
}

} // namespace
