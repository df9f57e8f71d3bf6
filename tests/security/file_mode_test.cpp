// The files that hold secrets are readable by their owner only: the router
// configuration store (the router's login password), written by the
// module's RouterConf set through the real host, and the accounts file
// (password hashes), written by "zark-webapid passwd" and by the host's
// account writer. Mode 0600 when created, when replaced, and when the file
// found there had looser bits. The writers run with umask 0, so a mode
// that only the umask would have narrowed shows.
#include "account_file.h"
#include "db_test_support.h"
#include "hermetic.h"
#include "security_support.h"
#include "test_network.h"

#include <sys/stat.h>
#include <sys/wait.h>

#include <gtest/gtest.h>

#include <filesystem>

namespace zark::security {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

struct FileFacts {
  bool regular = false;
  unsigned mode = 0;
  uid_t owner = 0;
  ino_t inode = 0;
};

FileFacts Facts(const std::string &path) {
  FileFacts facts;
  struct stat info {};
  if (::lstat(path.c_str(), &info) == 0) {
    facts.regular = S_ISREG(info.st_mode);
    facts.mode = info.st_mode & 07777;
    facts.owner = info.st_uid;
    facts.inode = info.st_ino;
  }
  return facts;
}

// The names in folder: a writer that replaces atomically leaves no
// temporary file behind.
std::vector<std::string> Names(const std::string &folder) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto &entry : fs::directory_iterator(folder, ec)) {
    names.push_back(entry.path().filename().string());
  }
  std::sort(names.begin(), names.end());
  return names;
}

class SecurityFileModes : public testing::Test {
protected:
  void SetUp() override {
    std::optional<zark::testnet::TestNetwork> network =
        zark::testnet::CurrentNetwork();
    ASSERT_TRUE(network.has_value())
        << "run through testnet/run-in-testnet.sh (as CTest does)";
    mGateway = network->lanRouter;
    zark::test::ResetFixedPaths();
  }

  std::string mGateway;
};

TEST_F(SecurityFileModes, RouterPasswordStoreIs0600CreatedReplacedAndRepaired) {
  // Nothing of the library's folder exists yet.
  std::error_code ec;
  fs::remove_all("/etc/portforward", ec);
  // The module's RouterConf set reads the router database.
  zark::test::InstallShippedRouterDb();
  HostProcess host(0);
  std::string why;
  ASSERT_TRUE(host.Start(why)) << why;
  std::optional<HostSession> admin = host.Login(kAdminAccount);
  ASSERT_TRUE(admin);
  const std::string folder = "/etc/portforward/routers";
  const std::string store = folder + "/" + mGateway + ".conf";
  const MethodRow set{"ZARK.Core.PortForwarding.RouterConf", 1, "set"};
  auto storePassword = [&](const std::string &password) {
    HostAnswer answer = host.Call(
        *admin, RowFields(set) +
                    "&router_brand=Generic&router_model=Web&router_version="
                    "generic&router_protocol=http&router_port=80"
                    "&router_account=rtadmin&router_pass=" +
                    password + "&support_upnp=no&support_natpmp=no");
    EXPECT_TRUE(answer.Success()) << answer.body;
  };

  storePassword("first-password-0600");
  FileFacts created = Facts(store);
  ASSERT_TRUE(created.regular) << store;
  EXPECT_EQ(0600u, created.mode);
  EXPECT_EQ(0u, created.owner);
  EXPECT_EQ(0700u, Facts(folder).mode);
  // It is the file that holds the password.
  EXPECT_NE(std::string::npos,
            zark::test::ReadFile(store).find("first-password-0600"));
  EXPECT_EQ(std::vector<std::string>{mGateway + ".conf"}, Names(folder));

  storePassword("second-password-0600");
  FileFacts replaced = Facts(store);
  EXPECT_EQ(0600u, replaced.mode);
  const std::string content = zark::test::ReadFile(store);
  EXPECT_NE(std::string::npos, content.find("second-password-0600"));
  EXPECT_EQ(std::string::npos, content.find("first-password-0600"));
  EXPECT_EQ(std::vector<std::string>{mGateway + ".conf"}, Names(folder));

  // A file left readable by others (by hand, or by an older version) is
  // replaced by one that is not at the next write.
  ASSERT_EQ(0, ::chmod(store.c_str(), 0644));
  storePassword("third-password-0600");
  EXPECT_EQ(0600u, Facts(store).mode);
  EXPECT_NE(std::string::npos,
            zark::test::ReadFile(store).find("third-password-0600"));
  EXPECT_EQ(std::vector<std::string>{mGateway + ".conf"}, Names(folder));
  const int status = host.Stop();
  EXPECT_TRUE(status != -1 && WIFEXITED(status) && WEXITSTATUS(status) == 0)
      << "the host did not stop cleanly: " << status;
}

// "zark-webapid passwd" run as its own process with umask 0.
int RunPasswd(SyslogSink &sink, const std::string &accounts,
              const std::string &user, const std::string &password,
              std::string &why) {
  LaunchOptions options;
  options.args = {kWebapid, "passwd", user, "--accounts", accounts};
  options.sink = &sink;
  options.umask = 0;
  options.outputFile = kWorkDir + "/passwd.out";
  options.inputText = password + "\n";
  return RunToEnd(options, 60s, why);
}

TEST_F(SecurityFileModes,
       AccountsFileOfPasswdIs0600CreatedReplacedAndRepaired) {
  SyslogSink sink;
  ASSERT_TRUE(sink.Ok());
  const std::string folder = kWorkDir + "/accounts";
  fs::create_directories(folder);
  const std::string accounts = folder + "/webapid.accounts";
  std::string why;

  ASSERT_EQ(0, RunPasswd(sink, accounts, "operator", "0perator-pass", why))
      << why;
  FileFacts created = Facts(accounts);
  ASSERT_TRUE(created.regular);
  EXPECT_EQ(0600u, created.mode);
  EXPECT_EQ(0, zark::test::ReadFile(accounts).rfind("operator:$y$", 0));
  EXPECT_EQ(std::vector<std::string>{"webapid.accounts"}, Names(folder));

  // Another account appended, then the first one's password replaced.
  ASSERT_EQ(0, RunPasswd(sink, accounts, "second", "Sec0nd-pass", why)) << why;
  EXPECT_EQ(0600u, Facts(accounts).mode);
  ASSERT_EQ(0, RunPasswd(sink, accounts, "operator", "Changed-pass", why))
      << why;
  EXPECT_EQ(0600u, Facts(accounts).mode);
  const std::string content = zark::test::ReadFile(accounts);
  EXPECT_NE(std::string::npos, content.find("\nsecond:$y$"));
  EXPECT_EQ(std::vector<std::string>{"webapid.accounts"}, Names(folder));

  ASSERT_EQ(0, ::chmod(accounts.c_str(), 0644));
  ASSERT_EQ(0, RunPasswd(sink, accounts, "second", "Th1rd-pass", why)) << why;
  EXPECT_EQ(0600u, Facts(accounts).mode);
  EXPECT_EQ(std::vector<std::string>{"webapid.accounts"}, Names(folder));

  // The passwords never reach the log either.
  sink.Settle();
  EXPECT_FALSE(sink.Lines().empty());
  for (const std::string &line : sink.Lines()) {
    for (const char *password :
         {"0perator-pass", "Sec0nd-pass", "Changed-pass", "Th1rd-pass"}) {
      EXPECT_EQ(std::string::npos, line.find(password)) << line;
    }
  }
}

TEST_F(SecurityFileModes, AccountWriterIs0600CreatedReplacedAndRepaired) {
  const std::string folder = kWorkDir + "/writer";
  fs::create_directories(folder);
  const fs::path accounts = folder + "/webapid.accounts";
  const zark::host::Account account{"writer", "$y$j9T$not-a-real-hash",
                                    "admin"};
  std::string error;
  std::string warning;
  // The host process's umask is whatever it was started with.
  const mode_t previous = ::umask(0);
  const bool created =
      zark::host::StoreAccount(accounts, account, error, warning);
  const unsigned createdMode = Facts(accounts).mode;
  const bool replaced = zark::host::StoreAccount(
      accounts, {"other", "$y$j9T$another-hash", "users"}, error, warning);
  const unsigned replacedMode = Facts(accounts).mode;
  ::chmod(accounts.c_str(), 0664);
  const bool repaired =
      zark::host::StoreAccount(accounts, account, error, warning);
  const unsigned repairedMode = Facts(accounts).mode;
  ::umask(previous);

  EXPECT_TRUE(created) << error;
  EXPECT_EQ(0600u, createdMode);
  EXPECT_TRUE(replaced) << error;
  EXPECT_EQ(0600u, replacedMode);
  EXPECT_TRUE(repaired) << error;
  EXPECT_EQ(0600u, repairedMode);
  EXPECT_FALSE(warning.empty()) << "the loose mode found is reported";
  EXPECT_NE(std::string::npos,
            zark::test::ReadFile(accounts).find("other:$y$j9T$another-hash"));
  EXPECT_EQ(std::vector<std::string>{"webapid.accounts"}, Names(folder));
}

} // namespace
} // namespace zark::security
