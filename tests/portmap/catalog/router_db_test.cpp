// Reading the router database: the shipped data, the listing order, the
// checks of the format, KLibGetRouterDBList and KLibGetRouterDesc (private
// mount namespace).
#include "libzarkportmap.h"

#include "catalog/router_conf_store.h"
#include "catalog/router_db.h"
#include "db_test_support.h"
#include "hermetic.h"
#include "klibc.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

namespace {

using namespace zark::portmap;
using zark::test::ClearLogs;
using zark::test::DescriptionSpec;
using zark::test::HasLogContaining;
using zark::test::InstallShippedRouterDb;
using zark::test::kDbRoot;
using zark::test::ResetFixedPaths;
using zark::test::WriteFile;
using zark::test::WriteRouterDb;

struct FreeList {
  void operator()(ZARK_ROUTERDB_LIST *list) const {
    KLibFreeRouterDBList(list);
  }
};
using ListPtr = std::unique_ptr<ZARK_ROUTERDB_LIST, FreeList>;

std::vector<std::string> Names(const RouterDb &db) {
  std::vector<std::string> names;
  for (const RouterDbEntry &entry : db.entries) {
    names.push_back(entry.brand + "/" + entry.model + "/" + entry.version +
                    (entry.generic ? " (generic)" : ""));
  }
  return names;
}

class PortMapDBRead : public testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearLogs();
  }
};

TEST_F(PortMapDBRead, ShippedDatabaseHasTheGenericRouters) {
  InstallShippedRouterDb();
  RouterDb db;
  int err = -1;
  ASSERT_TRUE(ReadRouterDb(db, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_NONE, err);
  EXPECT_EQ(kRouterDbSyntaxVersion, db.syntaxVersion);
  EXPECT_EQ(1, db.version);
  ASSERT_EQ(2u, db.entries.size());
  const RouterDbEntry &natpmp = db.entries[0];
  EXPECT_EQ("Generic", natpmp.brand);
  EXPECT_EQ("NAT-PMP", natpmp.model);
  EXPECT_EQ("generic", natpmp.version);
  EXPECT_TRUE(natpmp.generic);
  EXPECT_EQ(RouterProtocol::kNatPmp, natpmp.protocol);
  const RouterDbEntry &upnp = db.entries[1];
  EXPECT_EQ("UPnP IGD", upnp.model);
  EXPECT_EQ(RouterProtocol::kUpnp, upnp.protocol);
  EXPECT_TRUE(upnp.supportChangePort);
  EXPECT_EQ(128, upnp.maxRules);
}

TEST_F(PortMapDBRead, TheModulesGenericVersionLookupWorks) {
  // The module reads "version" from <db>/<brand>/<model>/generic with the
  // core library's key/value reader.
  InstallShippedRouterDb();
  char version[1024] = {};
  EXPECT_EQ(
      7, KLIBCFileGetKeyValue((kDbRoot + "/Generic/UPnP IGD/generic").c_str(),
                              "version", version, sizeof(version), 0));
  EXPECT_STREQ("generic", version);
}

TEST_F(PortMapDBRead, OrderIsStableWhateverTheFolderOrder) {
  // Written in an order unlike the sorted one; folders list in hash order.
  WriteRouterDb(kDbRoot, 1, 5,
                {{"Zeta", "Z1", "2.0", "2.0"},
                 {"Acme", "R2", "1.1", "1.1"},
                 {"Acme", "R2", "generic", "any"},
                 {"Acme", "R2", "1.0", "1.0"},
                 {"Acme", "R10", "generic", "generic"},
                 {"Beta", "B", "x", "3"}});
  RouterDb db;
  int err = 0;
  ASSERT_TRUE(ReadRouterDb(db, err));
  EXPECT_EQ((std::vector<std::string>{
                "Acme/R10/generic (generic)", "Acme/R2/any (generic)",
                "Acme/R2/1.0", "Acme/R2/1.1", "Beta/B/3", "Zeta/Z1/2.0"}),
            Names(db));
  EXPECT_EQ(5, db.version);
}

TEST_F(PortMapDBRead, HiddenNamesAndStrayFilesAreNotEntries) {
  WriteRouterDb(kDbRoot, 1, 1, {{"Acme", "R1", "generic", "generic"}});
  WriteFile(kDbRoot + "/.routerdb-update.abc/x", "junk");
  WriteFile(kDbRoot + "/Acme/R1/.generic.swp", "junk");
  WriteFile(kDbRoot + "/README", "notes");
  RouterDb db;
  int err = 0;
  ASSERT_TRUE(ReadRouterDb(db, err));
  EXPECT_EQ((std::vector<std::string>{"Acme/R1/generic (generic)"}), Names(db));
}

struct BadDb {
  const char *name;
  DescriptionSpec spec;
  const char *log;
};

void PrintTo(const BadDb &bad, std::ostream *os) {
  *os << bad.name;
}

class PortMapDBReadBad : public PortMapDBRead,
                         public testing::WithParamInterface<BadDb> {};

TEST_P(PortMapDBReadBad, WholeDatabaseIsRefused) {
  const BadDb &bad = GetParam();
  WriteRouterDb(kDbRoot, 1, 1,
                {{"Acme", "R1", "generic", "generic"}, bad.spec});
  RouterDb db;
  int err = 0;
  EXPECT_FALSE(ReadRouterDb(db, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_IO, err);
  EXPECT_TRUE(HasLogContaining(bad.log)) << bad.name;
  EXPECT_TRUE(db.entries.empty());
}

INSTANTIATE_TEST_SUITE_P(
    Descriptions, PortMapDBReadBad,
    testing::Values(BadDb{"NoVersion",
                          {"B", "M", "f", "", "upnp", "yes", "1"},
                          "has no \"version\""},
                    BadDb{"BadProtocol",
                          {"B", "M", "f", "1", "pcp", "yes", "1"},
                          "is not upnp, natpmp or web"},
                    BadDb{"BadChangePort",
                          {"B", "M", "f", "1", "upnp", "maybe", "1"},
                          "is not yes or no"},
                    BadDb{"ZeroRules",
                          {"B", "M", "f", "1", "upnp", "no", "0"},
                          "is not a number from 1 to 65536"},
                    BadDb{"TextRules",
                          {"B", "M", "f", "1", "upnp", "no", "12a"},
                          "is not a number"},
                    BadDb{"DuplicateVersion",
                          {"Acme", "R1", "other", "generic"},
                          "has two descriptions of version"}),
    [](const testing::TestParamInfo<BadDb> &info) { return info.param.name; });

TEST_F(PortMapDBRead, LinksAreNotPartOfADatabase) {
  WriteRouterDb(kDbRoot, 1, 1, {{"Acme", "R1", "generic", "generic"}});
  ASSERT_EQ(0, ::symlink("/etc/passwd", (kDbRoot + "/Acme/R1/1.0").c_str()));
  RouterDb db;
  int err = 0;
  EXPECT_FALSE(ReadRouterDb(db, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_IO, err);
  EXPECT_TRUE(HasLogContaining("is not a regular file"));
}

TEST_F(PortMapDBRead, AnotherSyntaxVersionIsError6) {
  WriteRouterDb(kDbRoot, 2, 1, {{"Acme", "R1", "generic", "generic"}});
  RouterDb db;
  int err = 0;
  EXPECT_FALSE(ReadRouterDb(db, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_DB_SYNTAX, err);
}

TEST_F(PortMapDBRead, MissingOrBrokenInfoIsAnIoError) {
  RouterDb db;
  int err = 0;
  EXPECT_FALSE(ReadRouterDb(db, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_IO, err);
  for (const char *info :
       {"version=1\n", "syntax_version=1\n", "syntax_version=one\nversion=1\n",
        "syntax_version=1\nversion=-3\n"}) {
    WriteFile(kDbRoot + "/routerdb.conf", info);
    EXPECT_FALSE(ReadRouterDb(db, err)) << info;
    EXPECT_EQ(ZARK_PORTMAP_ERR_IO, err) << info;
  }
}

TEST_F(PortMapDBRead, FindsAnEntryByBrandModelAndVersion) {
  WriteRouterDb(kDbRoot, 1, 1,
                {{"Acme", "R1", "generic", "generic", "web", "no", "16"},
                 {"Acme", "R1", "2.1", "2.1", "upnp", "yes", "32"}});
  RouterDbEntry entry;
  int err = 0;
  ASSERT_TRUE(FindRouterDbEntry("Acme", "R1", "2.1", entry, err));
  EXPECT_EQ(32, entry.maxRules);
  EXPECT_FALSE(entry.generic);
  ASSERT_TRUE(FindRouterDbEntry("Acme", "R1", "generic", entry, err));
  EXPECT_EQ(RouterProtocol::kWebPages, entry.protocol);
  ClearLogs();
  EXPECT_FALSE(FindRouterDbEntry("Acme", "R1", "9", entry, err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_NOT_CONFIGURED, err);
  EXPECT_TRUE(zark::test::CapturedMessages().empty());
}

// --- KLibGetRouterDBList ----------------------------------------------------

TEST_F(PortMapDBRead, ListHasEveryEntryInOrder) {
  WriteRouterDb(kDbRoot, 1, 1,
                {{"Beta", "B", "x", "3"},
                 {"Acme", "R1", "generic", "generic"},
                 {"Acme", "R1", "1.0", "1.0"}});
  ZARK_ROUTERDB_LIST *raw = reinterpret_cast<ZARK_ROUTERDB_LIST *>(1);
  ASSERT_EQ(0, KLibGetRouterDBList(&raw));
  ListPtr list(raw);
  std::vector<std::string> seen;
  for (const ZARK_ROUTERDB_LIST *node = list.get(); node != nullptr;
       node = node->next) {
    seen.push_back(std::string(node->brand) + "/" + node->model + "/" +
                   node->version + (node->generic ? " (generic)" : ""));
  }
  EXPECT_EQ((std::vector<std::string>{"Acme/R1/generic (generic)",
                                      "Acme/R1/1.0", "Beta/B/3"}),
            seen);
}

TEST_F(PortMapDBRead, EmptyDatabaseGivesNoList) {
  WriteRouterDb(kDbRoot, 1, 1, {});
  ZARK_ROUTERDB_LIST *raw = reinterpret_cast<ZARK_ROUTERDB_LIST *>(1);
  EXPECT_EQ(0, KLibGetRouterDBList(&raw));
  EXPECT_EQ(nullptr, raw);
}

TEST_F(PortMapDBRead, UnreadableDatabaseFailsTheList) {
  ZARK_ROUTERDB_LIST *raw = reinterpret_cast<ZARK_ROUTERDB_LIST *>(1);
  EXPECT_EQ(-1, KLibGetRouterDBList(&raw));
  EXPECT_EQ(nullptr, raw);
  EXPECT_EQ(-1, KLibGetRouterDBList(nullptr));
  KLibFreeRouterDBList(nullptr); // accepted, nothing to free
}

// --- KLibGetRouterDesc ------------------------------------------------------

class PortMapDBDesc : public PortMapDBRead {
protected:
  void Configure(const char *gateway, const char *brand, const char *model,
                 const char *version) {
    ZARK_ROUTER_CONF conf{};
    std::strcpy(conf.brand, brand);
    std::strcpy(conf.model, model);
    std::strcpy(conf.version, version);
    std::strcpy(conf.support_upnp, "yes");
    int err = 0;
    ASSERT_TRUE(StoreRouterConfForGateway(gateway, conf, err));
  }
};

TEST_F(PortMapDBDesc, NoConfigurationIsError2) {
  InstallShippedRouterDb();
  ZARK_ROUTER_DESC desc{};
  ZARK_LIBZARKPORTMAP_ERR err{0};
  EXPECT_EQ(-1, KLibGetRouterDesc("192.168.1.1", &desc, &err, true));
  EXPECT_EQ(ZARK_PORTMAP_ERR_NOT_CONFIGURED, err.err);
}

TEST_F(PortMapDBDesc, ChangePortComesFromTheEntry) {
  WriteRouterDb(kDbRoot, 1, 1,
                {{"Acme", "R1", "generic", "generic", "upnp", "yes", "8"},
                 {"Acme", "R2", "generic", "generic", "web", "no", "8"}});
  Configure("192.168.1.1", "Acme", "R1", "generic");
  Configure("10.0.0.1", "Acme", "R2", "generic");
  ZARK_ROUTER_DESC desc{};
  ZARK_LIBZARKPORTMAP_ERR err{-1};
  ASSERT_EQ(0, KLibGetRouterDesc("192.168.1.1", &desc, &err, true));
  EXPECT_TRUE(desc.support_change_port);
  EXPECT_EQ(ZARK_PORTMAP_ERR_NONE, err.err);
  ASSERT_EQ(0, KLibGetRouterDesc("10.0.0.1", &desc, &err, true));
  EXPECT_FALSE(desc.support_change_port);
}

TEST_F(PortMapDBDesc, RouterNotInTheDatabaseIsError2AndSaysSo) {
  InstallShippedRouterDb();
  Configure("192.168.1.1", "Acme", "R9", "1.0");
  ZARK_ROUTER_DESC desc{};
  ZARK_LIBZARKPORTMAP_ERR err{0};
  EXPECT_EQ(-1, KLibGetRouterDesc("192.168.1.1", &desc, &err, true));
  EXPECT_EQ(ZARK_PORTMAP_ERR_NOT_CONFIGURED, err.err);
  EXPECT_TRUE(HasLogContaining("router \"Acme\" / \"R9\" / \"1.0\" configured "
                               "for 192.168.1.1 is not in the router "
                               "database"));
}

TEST_F(PortMapDBDesc, DatabaseOfAnotherSyntaxIsError6) {
  WriteRouterDb(kDbRoot, 3, 1, {{"Acme", "R1", "generic", "generic"}});
  Configure("192.168.1.1", "Acme", "R1", "generic");
  ZARK_ROUTER_DESC desc{};
  ZARK_LIBZARKPORTMAP_ERR err{0};
  EXPECT_EQ(-1, KLibGetRouterDesc("192.168.1.1", &desc, &err, true));
  EXPECT_EQ(ZARK_PORTMAP_ERR_DB_SYNTAX, err.err);
}

} // namespace
