// Services and firewall sections: package service files, the service
// mapping table, system services, and dropping unusable sections. Real core
// library and firewall platform over files written in the private
// namespace.
#include "RouterRuleServHandler.h"
#include "hermetic.h"
#include "serv_test_env.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <filesystem>

namespace {

using namespace zark::test;
using Names = std::vector<std::string>;

class ServHandlerSources : public ::testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearLogs();
    std::filesystem::create_directories(ZARK_FW_SYSTEM_SERVICE_DIR);
    WriteFile(ZARK_FW_SERVICE_MAPPING_TABLE, "# no entries\n");
  }

  void WriteMapping(const std::string &text) {
    WriteFile(ZARK_FW_SERVICE_MAPPING_TABLE, text);
  }

  // ReadPackageServiceSections into a fresh list; count gets the result.
  Names ReadPackage(const char *id, int &count) {
    SzList list = NewList();
    KLIBSZLIST *raw = list.release();
    count = handler.ReadPackageServiceSections(id, &raw);
    list.reset(raw);
    return Items(list.get());
  }

  SzList SystemServices() {
    SzList list = NewList();
    KLIBSZLIST *raw = list.release();
    EXPECT_EQ(KLIBServiceEnum(&raw), 0);
    list.reset(raw);
    return list;
  }

  RouterRuleServHandler handler;
};

TEST_F(ServHandlerSources, PackageFileSectionsComeBeforeMappedSections) {
  WritePackageFile("pkg.sc", Section("pkg_web", "tcp", "8080") +
                                 Section("pkg_api", "tcp", "8081"));
  WriteMapping("pkg=a,b\n");
  int count = 0;
  Names names = ReadPackage("pkg", count);
  EXPECT_EQ(names, (Names{"pkg_web", "pkg_api", "a", "b"}));
  EXPECT_EQ(count, 4);
}

TEST_F(ServHandlerSources, MappingNamingAnExistingFileGivesThatFilesSections) {
  WritePackageFile("shared.sc", Section("shared_http", "tcp", "9000") +
                                    Section("shared_udp", "udp", "9001"));
  WriteMapping("pkg=shared.sc\n");
  int count = 0;
  EXPECT_EQ(ReadPackage("pkg", count), (Names{"shared_http", "shared_udp"}));
  EXPECT_EQ(count, 2);
}

TEST_F(ServHandlerSources, MappingNamingAMissingFileIsSplitIntoSections) {
  WriteMapping("pkg=x,,y\nother=missing.sc\n");
  int count = 0;
  EXPECT_EQ(ReadPackage("pkg", count), (Names{"x", "y"}));
  EXPECT_EQ(count, 2);
  EXPECT_EQ(ReadPackage("other", count), (Names{"missing.sc"}));
  EXPECT_EQ(count, 1);
}

TEST_F(ServHandlerSources, IdentifierWithNeitherFileNorEntryYieldsNothing) {
  int count = -1;
  EXPECT_TRUE(ReadPackage("nothing", count).empty());
  EXPECT_EQ(count, 0);
  SzList services = SystemServices();
  SzList sections = NewList();
  KLIBSZLIST *raw = sections.release();
  EXPECT_EQ(handler.GetServiceSections("nothing", services.get(), &raw), 0);
  sections.reset(raw);
  EXPECT_EQ(sections->nItem, 0);
  EXPECT_TRUE(CapturedLogs().empty());
}

TEST_F(ServHandlerSources, PackageSectionsAreAppendedToTheList) {
  WritePackageFile("pkg.sc", Section("pkg_web", "tcp", "8080"));
  SzList list = NewList({"earlier"});
  KLIBSZLIST *raw = list.release();
  EXPECT_EQ(handler.ReadPackageServiceSections("pkg", &raw), 2);
  list.reset(raw);
  EXPECT_EQ(Items(list.get()), (Names{"earlier", "pkg_web"}));
}

TEST_F(ServHandlerSources, NullArgumentsSetTheBadParameterError) {
  SzList list = NewList();
  KLIBSZLIST *raw = list.get();
  KLIBSZLIST *none = nullptr;
  EXPECT_EQ(handler.ReadPackageServiceSections(nullptr, &raw), -1);
  EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_BAD_PARAMETER);
  EXPECT_STREQ(KLIBCErrorGetFile(), "src/RouterRuleServHandler.cpp");
  EXPECT_EQ(handler.ReadPackageServiceSections("pkg", nullptr), -1);
  EXPECT_EQ(handler.ReadPackageServiceSections("pkg", &none), -1);
  EXPECT_EQ(handler.GetServiceSections(nullptr, list.get(), &raw), -1);
  EXPECT_EQ(handler.GetServiceSections("pkg", nullptr, &raw), -1);
  EXPECT_EQ(handler.GetServiceSections("pkg", list.get(), nullptr), -1);
  EXPECT_EQ(handler.GetServiceSections("pkg", list.get(), &none), -1);
}

TEST_F(ServHandlerSources, MissingMappingTableMakesPackageLookupsFail) {
  std::filesystem::remove(ZARK_FW_SERVICE_MAPPING_TABLE);
  WritePackageFile("pkg.sc", Section("pkg_web", "tcp", "8080"));
  int count = 0;
  ReadPackage("pkg", count);
  EXPECT_EQ(count, -1);
  ReadPackage("nofile", count);
  EXPECT_EQ(count, -1);
  EXPECT_EQ(
      CountServLogs(
          R"(KLIBCFileGetKeyValue error, )"
          R"(szFile=\[/usr/zark/etc\.defaults/firewall_service_mapping_table\], )"
          R"(zarkerr=\[0x[0-9A-F]{4}\])"),
      2);
  // Through GetServiceSections a failed package lookup is just nothing.
  SzList services = SystemServices();
  SzList sections = NewList();
  KLIBSZLIST *raw = sections.release();
  EXPECT_EQ(handler.GetServiceSections("pkg", services.get(), &raw), 0);
  sections.reset(raw);
}

TEST_F(ServHandlerSources, UnreadablePackageFileFailsWithLog) {
  // A folder where the package's .sc file should be.
  WriteFile(std::string(ZARK_FW_PACKAGE_SERVICE_DIR) + "/pkg.sc/x", "x");
  int count = 0;
  ReadPackage("pkg", count);
  EXPECT_EQ(count, -1);
  EXPECT_TRUE(HasServLog(
      R"(KLIBCFileEnumSection error, )"
      R"(szFile=\[/usr/local/etc/services\.d/pkg\.sc\], zarkerr=\[0x[0-9A-F]{4}\])"));
}

TEST_F(ServHandlerSources, SystemServiceSectionsComeFromItsDefinition) {
  WriteSystemService("ftp", Section("ftp", "tcp", "21") +
                                Section("ftp_passive", "tcp", "55536-55899"));
  // A package file of the same name does not count for a system service.
  WritePackageFile("ftp.sc", Section("pkg_ftp", "tcp", "2121"));
  SzList services = SystemServices();
  SzList sections = NewList({"first"});
  KLIBSZLIST *raw = sections.release();
  EXPECT_EQ(handler.GetServiceSections("ftp", services.get(), &raw), 3);
  sections.reset(raw);
  EXPECT_EQ(Items(sections.get()), (Names{"first", "ftp", "ftp_passive"}));
}

TEST_F(ServHandlerSources, SystemServiceWhoseDefinitionVanishedYieldsZero) {
  WriteSystemService("ssh", Section("ssh", "tcp", "22"));
  SzList services = SystemServices();
  std::filesystem::remove(std::string(ZARK_FW_SYSTEM_SERVICE_DIR) + "/ssh.sc");
  SzList sections = NewList({"kept"});
  KLIBSZLIST *raw = sections.release();
  EXPECT_EQ(handler.GetServiceSections("ssh", services.get(), &raw), 0);
  sections.reset(raw);
  EXPECT_EQ(Items(sections.get()), Names{"kept"});
}

TEST_F(ServHandlerSources, RemoveSectionOfOnlyUnknownSectionsLeavesNothing) {
  WriteSystemService("ssh", Section("ssh", "tcp", "22"));
  ASSERT_EQ(handler.FwSectionEnum(), 0);
  SzList list = NewList({"x", "y", "z"});
  EXPECT_EQ(handler.RemoveSection(list.get()), 0);
  EXPECT_EQ(list->nItem, 0);
  EXPECT_TRUE(CapturedLogs().empty());
}

TEST_F(ServHandlerSources, RemoveSectionDropsUnusableAndUnknownKeepsOrder) {
  WriteSystemService("mix", Section("a", "tcp", "1") +
                                Section("lan", "tcp", "2", false) +
                                Section("b", "udp", "3"));
  ASSERT_EQ(handler.FwSectionEnum(), 0);
  SzList list = NewList({"a", "lan", "ghost", "b", "lan", "a"});
  EXPECT_EQ(handler.RemoveSection(list.get()), 3);
  EXPECT_EQ(Items(list.get()), (Names{"a", "b", "a"}));
  EXPECT_EQ(handler.RemoveSection(nullptr), -1);
}

TEST_F(ServHandlerSources, FwSectionEnumFailsWhenThereIsNoSection) {
  EXPECT_EQ(handler.FwSectionEnum(), -1);
  EXPECT_TRUE(HasServLog("Failed to enum firewall section, " + kErrState));
}

TEST_F(ServHandlerSources, FwSectionEnumSucceedsWithSections) {
  WritePackageFile("p.sc", Section("p", "tcp", "1"));
  EXPECT_EQ(handler.FwSectionEnum(), 0);
  // A second enumeration replaces the table.
  EXPECT_EQ(handler.FwSectionEnum(), 0);
  EXPECT_TRUE(CapturedLogs().empty());
}

TEST_F(ServHandlerSources, FillPortMapByFwSectionFillsKnownSections) {
  WriteSystemService("svc", Section("t", "tcp", "10-12") +
                                Section("u", "udp", "20") +
                                Section("b", "both", "30,31-"));
  ASSERT_EQ(handler.FwSectionEnum(), 0);
  SzList list = NewList({"t", "ghost", "u", "b"});
  EXPECT_EQ(handler.FillPortMapByFwSection(list.get()), 0);
  EXPECT_TRUE(handler.CheckTCPBitSet(10, 12));
  EXPECT_FALSE(handler.CheckUDPBitSet(10, 10));
  EXPECT_TRUE(handler.CheckUDPBitSet(20, 20));
  EXPECT_FALSE(handler.CheckTCPBitSet(20, 20));
  EXPECT_TRUE(handler.CheckTCPBitSet(30, 31));
  EXPECT_TRUE(handler.CheckUDPBitSet(30, 31));
  EXPECT_FALSE(handler.CheckTCPBitSet(32, 32));
}

TEST_F(ServHandlerSources, FillPortMapByFwSectionOfANullListFails) {
  EXPECT_EQ(handler.FillPortMapByFwSection(nullptr), -1);
  EXPECT_TRUE(HasServLog("pslFwSection should not be null"));
}

TEST_F(ServHandlerSources, FillPortMapByFwSectionStopsAtASectionWithoutPorts) {
  WriteSystemService("svc", Section("first", "tcp", "1") +
                                "[noports]\nprotocol=tcp\n" +
                                Section("last", "tcp", "3"));
  ASSERT_EQ(handler.FwSectionEnum(), 0);
  SzList list = NewList({"first", "noports", "last"});
  EXPECT_EQ(handler.FillPortMapByFwSection(list.get()), -1);
  EXPECT_TRUE(HasServLog("pslPorts should not be null"));
  EXPECT_EQ(handler.CheckPort("tcp", 1), 1);
  EXPECT_EQ(handler.CheckPort("tcp", 3), 0);
}

TEST_F(ServHandlerSources, FillPortMapByServMarksEveryPortOfEveryService) {
  WriteSystemService("ssh", Section("ssh", "tcp", "22"));
  WriteSystemService("vpn", Section("vpn", "udp", "1194"));
  WriteSystemService("smb", Section("smb", "tcp", "445", false));
  WritePackageFile("pkg.sc", Section("pkg", "both", "7000-7001"));
  ASSERT_EQ(handler.FwSectionEnum(), 0);
  Json::Value services(Json::arrayValue);
  for (const char *id : {"ssh", "vpn", "smb", "pkg", "unknown"}) {
    services.append(id);
  }
  EXPECT_EQ(handler.FillPortMapByServ(services), 0);
  EXPECT_EQ(handler.CheckPort("tcp", 22), 1);
  EXPECT_EQ(handler.CheckPort("udp", 22), 0);
  EXPECT_EQ(handler.CheckPort("udp", 1194), 1);
  EXPECT_EQ(handler.CheckPort("tcp", 445), 0); // unusable: dropped
  EXPECT_TRUE(handler.CheckTCPBitSet(7000, 7001));
  EXPECT_TRUE(handler.CheckUDPBitSet(7000, 7001));
}

TEST_F(ServHandlerSources, FillPortMapByServOfNothingIsFine) {
  WriteSystemService("ssh", Section("ssh", "tcp", "22"));
  ASSERT_EQ(handler.FwSectionEnum(), 0);
  EXPECT_EQ(handler.FillPortMapByServ(Json::Value()), 0);
  EXPECT_EQ(handler.FillPortMapByServ(Json::Value(Json::arrayValue)), 0);
  EXPECT_EQ(handler.CheckPort("tcp", 22), 0);
}

TEST_F(ServHandlerSources, FillPortMapByServFailsWhenServicesCannotBeListed) {
  WritePackageFile("pkg.sc", Section("pkg", "tcp", "80"));
  std::filesystem::remove_all(ZARK_FW_SYSTEM_SERVICE_DIR);
  ASSERT_EQ(handler.FwSectionEnum(), 0);
  Json::Value services(Json::arrayValue);
  services.append("pkg");
  EXPECT_EQ(handler.FillPortMapByServ(services), -1);
  EXPECT_TRUE(HasServLog("Failed to enum service, " + kErrState));
  EXPECT_EQ(handler.CheckPort("tcp", 80), 0);
}

TEST_F(ServHandlerSources, FillPortMapByServFailsOnASectionWithoutPorts) {
  WriteSystemService("svc", "[noports]\nprotocol=udp\n");
  ASSERT_EQ(handler.FwSectionEnum(), 0);
  Json::Value services(Json::arrayValue);
  services.append("svc");
  EXPECT_EQ(handler.FillPortMapByServ(services), -1);
  EXPECT_TRUE(HasServLog("pslPorts should not be null"));
}

} // namespace
