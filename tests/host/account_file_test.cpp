// The accounts file: reading it for a login (with its mode and owner
// checks) and setting an account in it atomically.
#include "account_file.h"
#include "hermetic.h"
#include "host_test_support.h"
#include "syslog_capture.h"

#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <gtest/gtest.h>

namespace zark::host {
namespace {

namespace fs = std::filesystem;
using zark::test::ReadFile;
using zark::test::WriteFile;

const fs::path kFile = "/tmp/accounts/webapid.accounts";

class HostAccounts : public ::testing::Test {
protected:
  void SetUp() override {
    zark::test::ResetFixedPaths();
    zark::test::ClearLogs();
  }
  static unsigned Mode(const fs::path &file) {
    struct stat info {};
    EXPECT_EQ(stat(file.c_str(), &info), 0);
    return info.st_mode & 07777;
  }
};

TEST_F(HostAccounts, ReadsAccountsAndSkipsCommentsAndBlankLines) {
  WriteFile(kFile.string(),
            "# accounts\n\nadmin:$y$j9T$abc$def:admin\n   \n"
            "viewer:$6$salt$hash:users\n",
            0600);
  auto accounts = LoadAccounts(kFile);
  ASSERT_TRUE(accounts.has_value());
  ASSERT_EQ(accounts->size(), 2u);
  EXPECT_EQ((*accounts)[0].user, "admin");
  EXPECT_EQ((*accounts)[0].hash, "$y$j9T$abc$def");
  EXPECT_EQ((*accounts)[0].group, "admin");
  EXPECT_EQ((*accounts)[1].user, "viewer");
  EXPECT_EQ((*accounts)[1].group, "users");
}

TEST_F(HostAccounts, MalformedLinesAreSkippedAndLoggedByNumberOnly) {
  WriteFile(kFile.string(),
            "admin:$y$h:admin\n"
            "nocolon-secret1\n"
            "two:fields-secret2\n"
            "a:b:c:d-secret3\n"
            "bad user:h:admin\n"
            "empty::admin\n"
            "nogroup:h:\n"
            "-dash:h:admin\n"
            "viewer:h:users\n",
            0600);
  auto accounts = LoadAccounts(kFile);
  ASSERT_TRUE(accounts.has_value());
  ASSERT_EQ(accounts->size(), 2u);
  EXPECT_EQ((*accounts)[1].user, "viewer");
  for (int line = 2; line <= 8; ++line) {
    EXPECT_TRUE(zark::test::HasLogContaining("accounts file " + kFile.string() +
                                             " line " + std::to_string(line) +
                                             " is malformed; skipped"))
        << line;
  }
  EXPECT_FALSE(zark::test::HasLogContaining("secret"));
}

TEST_F(HostAccounts, RepeatedUserKeepsItsFirstLine) {
  WriteFile(kFile.string(), "admin:first:admin\nadmin:second:users\n", 0600);
  auto accounts = LoadAccounts(kFile);
  ASSERT_TRUE(accounts.has_value());
  ASSERT_EQ(accounts->size(), 1u);
  EXPECT_EQ((*accounts)[0].hash, "first");
  EXPECT_TRUE(zark::test::HasLogContaining("line 2 names user admin again"));
}

TEST_F(HostAccounts, FileOpenToGroupOrOthersIsRefused) {
  for (unsigned mode : {0640u, 0604u, 0620u, 0602u, 0660u, 0644u}) {
    zark::test::ClearLogs();
    WriteFile(kFile.string(), "admin:$y$h:admin\n", mode);
    ASSERT_EQ(Mode(kFile), mode);
    EXPECT_FALSE(LoadAccounts(kFile).has_value()) << std::oct << mode;
    char text[8];
    snprintf(text, sizeof(text), "%04o", mode);
    EXPECT_TRUE(test::HasLogFrom(
        LOG_ERR, "host/account_file.cpp",
        "accounts file " + kFile.string() +
            " can be read or written by group or others (mode " + text +
            "); not using it until its mode is 0600"));
  }
  WriteFile(kFile.string(), "admin:$y$h:admin\n", 0400);
  EXPECT_TRUE(LoadAccounts(kFile).has_value());
}

TEST_F(HostAccounts, FileOfAnotherOwnerIsRefused) {
  WriteFile(kFile.string(), "admin:$y$h:admin\n", 0600);
  ASSERT_EQ(chown(kFile.c_str(), geteuid() + 1, static_cast<gid_t>(-1)), 0);
  EXPECT_FALSE(LoadAccounts(kFile).has_value());
  EXPECT_TRUE(zark::test::HasLogContaining("accounts file " + kFile.string() +
                                           " is owned by uid"));
}

TEST_F(HostAccounts, MissingFolderOrHugeFileIsRefused) {
  EXPECT_FALSE(LoadAccounts(kFile).has_value());
  EXPECT_TRUE(zark::test::HasLogContaining(
      "accounts file " + kFile.string() +
      " cannot be opened: No such file or directory"));
  fs::create_directories("/tmp/accounts/folder");
  chmod("/tmp/accounts/folder", 0700);
  EXPECT_FALSE(LoadAccounts("/tmp/accounts/folder").has_value());
  WriteFile(kFile.string(), std::string(kMaxAccountsFileSize + 1, '#'), 0600);
  EXPECT_FALSE(LoadAccounts(kFile).has_value());
  EXPECT_TRUE(zark::test::HasLogContaining("cannot be read: File too large"));
}

TEST_F(HostAccounts, StoreCreatesAFileOfMode0600) {
  fs::create_directories(kFile.parent_path());
  std::string error;
  std::string warning;
  ASSERT_TRUE(StoreAccount(kFile, {"admin", "$y$x$y", "admin"}, error, warning))
      << error;
  EXPECT_EQ(ReadFile(kFile.string()), "admin:$y$x$y:admin\n");
  EXPECT_EQ(Mode(kFile), 0600u);
  EXPECT_TRUE(warning.empty());
  // Nothing but the file is left in its folder.
  int entries = 0;
  for ([[maybe_unused]] const auto &entry :
       fs::directory_iterator(kFile.parent_path())) {
    ++entries;
  }
  EXPECT_EQ(entries, 1);
}

TEST_F(HostAccounts, StoreReplacesTheUsersLineAndKeepsTheRest) {
  WriteFile(kFile.string(),
            "# keep me\nadmin:old:admin\nviewer:v:users\nadmin:older:x\n"
            "not an account line\n",
            0600);
  std::string error;
  std::string warning;
  ASSERT_TRUE(StoreAccount(kFile, {"admin", "new", "admin"}, error, warning));
  EXPECT_EQ(ReadFile(kFile.string()),
            "# keep me\nadmin:new:admin\nviewer:v:users\n"
            "not an account line\n");
  ASSERT_TRUE(StoreAccount(kFile, {"third", "t", "users"}, error, warning));
  EXPECT_EQ(ReadFile(kFile.string()),
            "# keep me\nadmin:new:admin\nviewer:v:users\n"
            "not an account line\nthird:t:users\n");
}

TEST_F(HostAccounts, StoreTightensAnOpenFileAndSaysSo) {
  WriteFile(kFile.string(), "viewer:v:users\n", 0644);
  std::string error;
  std::string warning;
  ASSERT_TRUE(StoreAccount(kFile, {"admin", "h", "admin"}, error, warning));
  EXPECT_EQ(Mode(kFile), 0600u);
  EXPECT_EQ(warning, kFile.string() + " had mode 0644, readable or writable "
                                      "by group or others; it is now 0600");
}

TEST_F(HostAccounts, StoreFailsWithoutTheFolderAndChangesNothing) {
  std::string error;
  std::string warning;
  EXPECT_FALSE(StoreAccount(kFile, {"admin", "h", "admin"}, error, warning));
  EXPECT_NE(error.find("cannot create a temporary file beside"),
            std::string::npos)
      << error;
  EXPECT_FALSE(fs::exists(kFile));
}

TEST_F(HostAccounts, StoreRefusesBadNames) {
  fs::create_directories(kFile.parent_path());
  std::string error;
  std::string warning;
  EXPECT_FALSE(StoreAccount(kFile, {"a:b", "h", "admin"}, error, warning));
  EXPECT_FALSE(StoreAccount(kFile, {"a", "h:x", "admin"}, error, warning));
  EXPECT_FALSE(StoreAccount(kFile, {"a", "h", "ad min"}, error, warning));
  EXPECT_FALSE(fs::exists(kFile));
}

TEST_F(HostAccounts, StoredAccountsReadBack) {
  fs::create_directories(kFile.parent_path());
  std::string error;
  std::string warning;
  ASSERT_TRUE(
      StoreAccount(kFile, {"admin", "$y$a$b", "admin"}, error, warning));
  ASSERT_TRUE(
      StoreAccount(kFile, {"viewer", "$y$c$d", "users"}, error, warning));
  auto accounts = LoadAccounts(kFile);
  ASSERT_TRUE(accounts.has_value());
  ASSERT_EQ(accounts->size(), 2u);
  EXPECT_EQ((*accounts)[1].hash, "$y$c$d");
}

TEST(HostAccountNames, PlainNamesOnly) {
  EXPECT_TRUE(IsValidAccountName("admin"));
  EXPECT_TRUE(IsValidAccountName("a.b_c-1"));
  EXPECT_TRUE(IsValidAccountName(std::string(64, 'a')));
  EXPECT_FALSE(IsValidAccountName(std::string(65, 'a')));
  EXPECT_FALSE(IsValidAccountName(""));
  EXPECT_FALSE(IsValidAccountName("-admin"));
  EXPECT_FALSE(IsValidAccountName("ad min"));
  EXPECT_FALSE(IsValidAccountName("ad:min"));
  EXPECT_FALSE(IsValidAccountName("admín"));
}

} // namespace
} // namespace zark::host
