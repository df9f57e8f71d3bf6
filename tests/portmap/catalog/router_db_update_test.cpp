// Updating the router database: archive checks, local and HTTP sources, the
// version rules, and that a failed update leaves the installed database
// whole (private mount namespace; the HTTP server listens on loopback).
#include "libzarkportmap.h"

#include "base/library_config.h"
#include "catalog/router_db.h"
#include "catalog/router_db_archive.h"
#include "catalog/router_db_update.h"
#include "db_test_support.h"
#include "hermetic.h"
#include "net/http_download.h"
#include "syslog_capture.h"

#include <archive.h>
#include <archive_entry.h>
#include <gtest/gtest.h>
#include <httplib.h>

#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

namespace {

namespace fs = std::filesystem;
using namespace zark::portmap;
using zark::test::ClearLogs;
using zark::test::DescribeTree;
using zark::test::HasLogContaining;
using zark::test::InstallShippedRouterDb;
using zark::test::kDbRoot;
using zark::test::MakeTar;
using zark::test::PackRouterDb;
using zark::test::ResetFixedPaths;
using zark::test::SetLibraryConfig;
using zark::test::TarMember;
using zark::test::WriteFile;
using zark::test::WriteRouterDb;

const std::string kSourceKey(config_key::kRouterDbUpdateSource);
const std::string kWork = "/tmp/dbwork";
const std::string kArchive = "/tmp/routerdb.tgz";

// Leftovers of an update in the database's parent folder.
std::vector<std::string> StagingLeftovers() {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto &item :
       fs::directory_iterator(fs::path(kDbRoot).parent_path(), ec)) {
    std::string name = item.path().filename().string();
    if (name != "routerdb") {
      names.push_back(name);
    }
  }
  return names;
}

// --- CheckRouterDbArchive (pure)
// ----------------------------------------------

TarMember Member(const std::string &name, unsigned type) {
  TarMember member;
  member.name = name;
  member.type = type;
  return member;
}
TarMember Folder(const std::string &name) {
  return Member(name, AE_IFDIR);
}
TarMember File(const std::string &name, std::string content = "x\n") {
  TarMember member = Member(name, AE_IFREG);
  member.content = std::move(content);
  return member;
}
TarMember Symlink(const std::string &name, const std::string &target) {
  TarMember member = Member(name, AE_IFLNK);
  member.symlink = target;
  return member;
}
TarMember HardLink(const std::string &name, const std::string &target) {
  TarMember member = Member(name, AE_IFREG);
  member.hardLink = target;
  return member;
}

// A database archive as the update expects it.
std::vector<TarMember> GoodMembers() {
  return {Folder("routerdb/"),
          File("routerdb/routerdb.conf", "syntax_version=1\nversion=2\n"),
          Folder("routerdb/Generic/UPnP IGD/"),
          File("routerdb/Generic/UPnP IGD/generic", "version=generic\n")};
}

TEST(PortMapDBArchiveCheck, TakesFoldersAndFilesUnderRouterdb) {
  std::string why;
  EXPECT_TRUE(CheckRouterDbArchive(MakeTar(GoodMembers()), why)) << why;
  // A top folder stored without its trailing slash, as some writers do.
  std::vector<TarMember> members = GoodMembers();
  members[0].name = "routerdb";
  EXPECT_TRUE(CheckRouterDbArchive(MakeTar(members), why)) << why;
}

TEST(PortMapDBArchiveCheck, ReadsPlainAndCompressedTars) {
  for (int filter : {ARCHIVE_FILTER_NONE, ARCHIVE_FILTER_GZIP,
                     ARCHIVE_FILTER_BZIP2, ARCHIVE_FILTER_XZ}) {
    SCOPED_TRACE(filter);
    std::string why;
    EXPECT_TRUE(CheckRouterDbArchive(MakeTar(GoodMembers(), filter), why))
        << why;
  }
}

struct BadArchive {
  const char *name;
  std::vector<TarMember> members;
  const char *why;
};

void PrintTo(const BadArchive &bad, std::ostream *os) {
  *os << bad.name;
}

class PortMapDBArchiveCheckBad : public testing::TestWithParam<BadArchive> {};

TEST_P(PortMapDBArchiveCheckBad, IsRefused) {
  std::vector<TarMember> members = GetParam().members;
  // Each bad member follows good ones: no member is taken on trust.
  members.insert(members.begin(), Folder("routerdb/"));
  std::string why;
  EXPECT_FALSE(CheckRouterDbArchive(MakeTar(members), why));
  EXPECT_NE(std::string::npos, why.find(GetParam().why)) << why;
}

INSTANTIATE_TEST_SUITE_P(
    Archives, PortMapDBArchiveCheckBad,
    testing::Values(
        BadArchive{"Symlink",
                   {Symlink("routerdb/x", "/etc")},
                   "neither a folder nor a regular file"},
        BadArchive{"HardLink",
                   {File("routerdb/a"), HardLink("routerdb/h", "routerdb/a")},
                   "neither a folder nor a regular file"},
        BadArchive{"Device",
                   {Member("routerdb/null", AE_IFCHR)},
                   "neither a folder nor a regular file"},
        BadArchive{"Fifo",
                   {Member("routerdb/fifo", AE_IFIFO)},
                   "neither a folder nor a regular file"},
        BadArchive{
            "OutsideTop", {File("etc/x")}, "not a plain path under routerdb/"},
        BadArchive{"DotDot", {File("routerdb/../../x")}, "not a plain path"},
        BadArchive{"Dot", {File("routerdb/./x")}, "not a plain path"},
        BadArchive{"Absolute", {File("/routerdb/x")}, "not a plain path"},
        BadArchive{"DoubleSlash", {File("routerdb//x")}, "not a plain path"},
        BadArchive{"TopAsFile", {File("routerdb")}, "not a plain path"},
        BadArchive{"LongName",
                   {File("routerdb/" + std::string(1100, 'n'))},
                   "name longer than"},
        BadArchive{"BigFile",
                   {File("routerdb/x", std::string(2000000, 'x'))},
                   "larger than"}),
    [](const testing::TestParamInfo<BadArchive> &info) {
      return info.param.name;
    });

TEST(PortMapDBArchiveCheck, EmptyArchiveIsRefused) {
  std::string why;
  EXPECT_FALSE(CheckRouterDbArchive(MakeTar({}), why));
  EXPECT_NE(std::string::npos, why.find("no member")) << why;
}

TEST(PortMapDBArchiveCheck, WhatIsNoTarIsRefused) {
  for (const std::string &bytes :
       {std::string(), std::string("hello\n"),
        MakeTar(GoodMembers(), ARCHIVE_FILTER_GZIP).substr(0, 40)}) {
    std::string why;
    EXPECT_FALSE(CheckRouterDbArchive(bytes, why));
    EXPECT_FALSE(why.empty());
  }
}

TEST(PortMapDBArchiveCheck, TruncatedContentIsRefused) {
  std::vector<TarMember> members = GoodMembers();
  members.push_back(File("routerdb/big", std::string(8000, 'b')));
  const std::string whole = MakeTar(members);
  std::string why;
  EXPECT_FALSE(CheckRouterDbArchive(whole.substr(0, whole.size() - 6000), why));
  EXPECT_NE(std::string::npos, why.find("not a readable archive")) << why;
}

TEST(PortMapDBArchiveCheck, TooMuchContentIsRefused) {
  std::vector<TarMember> members = {Folder("routerdb/")};
  for (int i = 0; i < 17; ++i) {
    members.push_back(
        File("routerdb/f" + std::to_string(i), std::string(1000000, 'c')));
  }
  std::string why;
  EXPECT_FALSE(
      CheckRouterDbArchive(MakeTar(members, ARCHIVE_FILTER_GZIP), why));
  EXPECT_NE(std::string::npos, why.find("content larger than")) << why;
}

TEST(PortMapDBArchiveCheck, TooManyMembersAreRefused) {
  std::vector<TarMember> members = {Folder("routerdb/")};
  for (std::size_t i = 0; i < kMaxArchiveMembers; ++i) {
    members.push_back(Folder("routerdb/d" + std::to_string(i) + "/"));
  }
  std::string why;
  EXPECT_FALSE(
      CheckRouterDbArchive(MakeTar(members, ARCHIVE_FILTER_GZIP), why));
  EXPECT_NE(std::string::npos, why.find("members")) << why;
}

// --- ParseHttpUrl (pure)
// --------------------------------------------------------

TEST(PortMapDBHttpUrl, SplitsHostPortAndTarget) {
  HttpUrl url;
  ASSERT_TRUE(ParseHttpUrl("http://127.0.0.1:8080/db/routerdb.tgz?x=1", url));
  EXPECT_EQ("127.0.0.1", url.host);
  EXPECT_EQ(8080, url.port);
  EXPECT_EQ("/db/routerdb.tgz?x=1", url.target);
  ASSERT_TRUE(ParseHttpUrl("http://updates.example", url));
  EXPECT_EQ(80, url.port);
  EXPECT_EQ("/", url.target);
  ASSERT_TRUE(ParseHttpUrl("https://updates.example/db.tgz", url));
  EXPECT_TRUE(url.tls);
  EXPECT_EQ(443, url.port);
  for (const char *bad :
       {"ftp://host/x", "https://", "HTTP://host/x", "http://", "http://:80/x",
        "http://user@host/x", "http://host:0/x", "http://host:65536/x",
        "http://host:8a/x", "http://[::1]/x", "http://host/a b",
        "/local/path"}) {
    EXPECT_FALSE(ParseHttpUrl(bad, url)) << bad;
  }
}

// --- The update
// -----------------------------------------------------------------

class PortMapDBUpdate : public testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearLogs();
    InstallShippedRouterDb();
    mShipped = DescribeTree(kDbRoot);
  }

  // Packs a database of this syntax and version with one extra router.
  void MakeArchive(int syntax, int version, const std::string &archive) {
    std::error_code ec;
    fs::remove_all(kWork, ec);
    WriteRouterDb(
        kWork + "/routerdb", syntax, version,
        {{"Generic", "UPnP IGD", "generic", "generic", "upnp", "yes", "128"},
         {"Acme", "R" + std::to_string(version), "generic", "generic", "web",
          "no", "16"}});
    PackRouterDb(kWork, archive);
  }

  int Update() {
    int version = -1;
    return KLibUpdateRouterDBList(&version) == 0 ? version : -1;
  }

  void ExpectShippedDatabaseWhole() {
    EXPECT_EQ(mShipped, DescribeTree(kDbRoot));
    EXPECT_TRUE(StagingLeftovers().empty());
  }

  std::string mShipped;
};

TEST_F(PortMapDBUpdate, InstallsANewerDatabaseFromALocalArchive) {
  MakeArchive(1, 2, kArchive);
  SetLibraryConfig(kSourceKey, kArchive);
  EXPECT_EQ(2, Update());
  RouterDbEntry entry;
  int err = 0;
  EXPECT_TRUE(FindRouterDbEntry("Acme", "R2", "generic", entry, err));
  EXPECT_EQ(DescribeTree(kWork + "/routerdb"), DescribeTree(kDbRoot));
  EXPECT_TRUE(StagingLeftovers().empty());
  EXPECT_EQ(fs::perms(0755), fs::status(kDbRoot).permissions());
  EXPECT_EQ(fs::perms(0644),
            fs::status(kDbRoot + "/Acme/R2/generic").permissions());
}

TEST_F(PortMapDBUpdate, SameOrOlderVersionChangesNothing) {
  MakeArchive(1, 1, kArchive);
  SetLibraryConfig(kSourceKey, kArchive);
  EXPECT_EQ(1, Update());
  ExpectShippedDatabaseWhole();
}

TEST_F(PortMapDBUpdate, AnotherSyntaxVersionIsRefusedAndTheOldStays) {
  MakeArchive(2, 9, kArchive);
  SetLibraryConfig(kSourceKey, kArchive);
  int version = 0;
  int err = 0;
  EXPECT_FALSE(UpdateRouterDb(version, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_DB_SYNTAX, err);
  EXPECT_EQ(-1, Update());
  EXPECT_TRUE(HasLogContaining("has syntax version 2"));
  ExpectShippedDatabaseWhole();
}

TEST_F(PortMapDBUpdate, ReplacesAnInstalledDatabaseOfAnotherSyntax) {
  WriteFile(kDbRoot + "/routerdb.conf", "syntax_version=0\nversion=50\n");
  MakeArchive(1, 3, kArchive);
  SetLibraryConfig(kSourceKey, kArchive);
  EXPECT_EQ(3, Update());
  RouterDb db;
  int err = 0;
  EXPECT_TRUE(ReadRouterDb(db, err));
}

TEST_F(PortMapDBUpdate, MissingSourceIsRefused) {
  int version = 0;
  int err = 0;
  EXPECT_FALSE(UpdateRouterDb(version, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_BAD_PARAMETER, err);
  EXPECT_TRUE(HasLogContaining(
      "no router database update source: set routerdb_update_source in "
      "/etc/portforward/portmap.conf"));
  SetLibraryConfig(kSourceKey, "relative/path.tgz");
  EXPECT_FALSE(UpdateRouterDb(version, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_BAD_PARAMETER, err);
  SetLibraryConfig(kSourceKey, "/tmp/no-such-archive.tgz");
  EXPECT_FALSE(UpdateRouterDb(version, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_IO, err);
  ExpectShippedDatabaseWhole();
}

TEST_F(PortMapDBUpdate, BrokenArchivesLeaveTheOldDatabaseWhole) {
  SetLibraryConfig(kSourceKey, kArchive);
  struct Case {
    const char *name;
    std::function<void()> make;
  };
  std::vector<Case> cases = {
      {"NotAnArchive", [] { WriteFile(kArchive, "not a tar file at all"); }},
      {"Empty", [] { WriteFile(kArchive, ""); }},
      {"Symlink",
       [this] {
         MakeArchive(1, 4, kArchive);
         ASSERT_EQ(0, ::symlink("/etc", (kWork + "/routerdb/etc").c_str()));
         PackRouterDb(kWork, kArchive);
       }},
      {"Truncated",
       [this] {
         MakeArchive(1, 4, kArchive);
         std::string whole = zark::test::ReadFile(kArchive);
         WriteFile(kArchive, whole.substr(0, whole.size() / 2));
       }},
      {"WrongTopFolder",
       [] {
         std::error_code ec;
         fs::remove_all(kWork, ec);
         WriteRouterDb(kWork + "/db", 1, 4, {{"A", "B", "generic", "g"}});
         fs::rename(kWork + "/db", kWork + "/routerdb");
         PackRouterDb(kWork, kArchive, "other");
       }},
      {"BadDescription",
       [this] {
         MakeArchive(1, 4, kArchive);
         WriteFile(kWork + "/routerdb/Acme/R4/generic", "version=generic\n");
         PackRouterDb(kWork, kArchive);
       }},
      {"NoRouter",
       [] {
         std::error_code ec;
         fs::remove_all(kWork, ec);
         WriteRouterDb(kWork + "/routerdb", 1, 4, {});
         PackRouterDb(kWork, kArchive);
       }},
  };
  for (const Case &c : cases) {
    SCOPED_TRACE(c.name);
    c.make();
    EXPECT_EQ(-1, Update());
    ExpectShippedDatabaseWhole();
  }
}

TEST_F(PortMapDBUpdate, StaleStagingFoldersAreCleanedUp) {
  WriteFile("/etc.defaults/portforward/.routerdb-update.old123/tree/x", "x");
  MakeArchive(1, 2, kArchive);
  SetLibraryConfig(kSourceKey, kArchive);
  EXPECT_EQ(2, Update());
  EXPECT_TRUE(StagingLeftovers().empty());
}

TEST_F(PortMapDBUpdate, WorksWithoutAnInstalledDatabase) {
  std::error_code ec;
  fs::remove_all(kDbRoot, ec);
  MakeArchive(1, 2, kArchive);
  SetLibraryConfig(kSourceKey, kArchive);
  EXPECT_EQ(2, Update());
  RouterDb db;
  int err = 0;
  EXPECT_TRUE(ReadRouterDb(db, err));
  EXPECT_EQ(2u, db.entries.size());
}

// Readers listing all the time while updates swap databases in: every
// listing is one whole database, never a mix or a failure.
TEST_F(PortMapDBUpdate, ReadersNeverSeeHalfADatabase) {
  std::vector<std::string> archives;
  for (int version = 2; version <= 6; ++version) {
    std::string archive = "/tmp/routerdb" + std::to_string(version) + ".tgz";
    MakeArchive(1, version, archive);
    archives.push_back(archive);
  }
  std::atomic<bool> stop{false};
  std::atomic<int> listings{0};
  std::atomic<int> bad{0};
  std::thread reader([&] {
    while (!stop.load()) {
      RouterDb db;
      int err = 0;
      if (!ReadRouterDb(db, err) || db.entries.size() != 2 ||
          (db.version > 1 &&
           db.entries[0].model != "R" + std::to_string(db.version))) {
        ++bad;
      }
      ++listings;
    }
  });
  for (const std::string &archive : archives) {
    SetLibraryConfig(kSourceKey, archive);
    EXPECT_NE(-1, Update());
  }
  // At least one listing after the last swap.
  int seen = listings.load();
  for (int i = 0; i < 10000 && listings.load() == seen; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  stop = true;
  reader.join();
  EXPECT_EQ(0, bad.load());
  EXPECT_GT(listings.load(), seen);
}

// --- HTTP source
// ----------------------------------------------------------------

// A loopback HTTP server on its own thread, stopped and joined by its owner.
class LoopbackServer {
public:
  explicit LoopbackServer(
      std::function<void(const httplib::Request &, httplib::Response &)>
          handler) {
    mServer.Get(".*", std::move(handler));
    mPort = mServer.bind_to_any_port("127.0.0.1");
    mThread = std::thread([this] { mServer.listen_after_bind(); });
    // bind_to_any_port already listens: connections wait in the backlog
    // until the thread accepts them.
  }
  ~LoopbackServer() {
    mServer.stop();
    mThread.join();
  }
  std::string Url(const std::string &target) const {
    return "http://127.0.0.1:" + std::to_string(mPort) + target;
  }

private:
  httplib::Server mServer;
  int mPort = 0;
  std::thread mThread;
};

TEST_F(PortMapDBUpdate, InstallsFromAnHttpUrl) {
  MakeArchive(1, 7, kArchive);
  const std::string body = zark::test::ReadFile(kArchive);
  std::string askedFor;
  std::atomic<int> requests{0};
  LoopbackServer server(
      [&](const httplib::Request &request, httplib::Response &response) {
        askedFor = request.path;
        ++requests;
        if (request.path == "/db/routerdb.tgz") {
          response.set_content(body, "application/gzip");
        } else {
          response.status = 404;
        }
      });
  SetLibraryConfig(kSourceKey, server.Url("/db/routerdb.tgz"));
  EXPECT_EQ(7, Update());
  EXPECT_EQ(1, requests.load());
  EXPECT_EQ("/db/routerdb.tgz", askedFor);
  RouterDbEntry entry;
  int err = 0;
  EXPECT_TRUE(FindRouterDbEntry("Acme", "R7", "generic", entry, err));
}

TEST_F(PortMapDBUpdate, HttpFailuresLeaveTheOldDatabaseWhole) {
  LoopbackServer server(
      [](const httplib::Request &request, httplib::Response &response) {
        if (request.path == "/redirect") {
          response.status = 302;
          response.set_header("Location", "http://127.0.0.1:1/x");
        } else if (request.path == "/big") {
          response.set_content(std::string(kMaxRouterDbArchiveBytes + 1, 'x'),
                               "application/octet-stream");
        } else {
          response.status = 404;
        }
      });
  for (const char *target : {"/missing", "/redirect", "/big"}) {
    SCOPED_TRACE(target);
    SetLibraryConfig(kSourceKey, server.Url(target));
    ClearLogs();
    EXPECT_EQ(-1, Update());
    ExpectShippedDatabaseWhole();
  }
  EXPECT_TRUE(HasLogContaining("body larger than"));
  // Nobody listens on port 1 of the loopback.
  SetLibraryConfig(kSourceKey, "http://127.0.0.1:1/routerdb.tgz");
  EXPECT_EQ(-1, Update());
  ExpectShippedDatabaseWhole();
}

} // namespace
