// The router configuration parser and the database archive check fed with
// many mutations of valid inputs (fixed seed, so every run is the same):
// neither crashes (the sanitizer build watches), and whatever they accept
// keeps their promises.
#include "catalog/router_conf_store.h"
#include "catalog/router_db_archive.h"
#include "db_test_support.h"

#include <archive_entry.h>

#include <gtest/gtest.h>

#include <cstring>
#include <random>
#include <string>

namespace {

using namespace zark::portmap;

std::string Mutate(std::string text, std::mt19937 &random) {
  std::uniform_int_distribution<int> kind(0, 4);
  std::uniform_int_distribution<int> byte(0, 255);
  int edits = 1 + static_cast<int>(random() % 4);
  for (int i = 0; i < edits && !text.empty(); ++i) {
    std::size_t at = random() % text.size();
    switch (kind(random)) {
    case 0:
      text[at] = static_cast<char>(byte(random));
      break;
    case 1:
      text.erase(at, 1 + random() % 8);
      break;
    case 2:
      text.insert(at, 1, static_cast<char>(byte(random)));
      break;
    case 3:
      text.resize(at);
      break;
    default:
      text.insert(at, text.substr(random() % text.size(), random() % 16));
      break;
    }
  }
  return text;
}

TEST(PortMapDBParserMutations, RouterConfParserKeepsItsPromises) {
  ZARK_ROUTER_CONF conf{};
  std::strcpy(conf.brand, "Acme \"quoted\"");
  std::strcpy(conf.model, "R\\1");
  std::strcpy(conf.password, "\xc3\xa9\x01pw");
  const std::string valid = SerializeRouterConf("10.0.0.1", conf);
  std::mt19937 random(20240501);
  int accepted = 0;
  for (int i = 0; i < 5000; ++i) {
    const std::string text = Mutate(valid, random);
    ZARK_ROUTER_CONF parsed{};
    std::string why;
    if (!ParseRouterConf(text, parsed, why)) {
      EXPECT_FALSE(why.empty()) << text;
      continue;
    }
    ++accepted;
    // Accepted: every field is a proper text, and writing it again reads
    // back the same.
    for (const char *field : {parsed.brand, parsed.model, parsed.version,
                              parsed.password, parsed.max_rule}) {
      ASSERT_LT(::strnlen(field, ZARK_PORTMAP_TEXT_SIZE),
                static_cast<std::size_t>(ZARK_PORTMAP_TEXT_SIZE));
    }
    ZARK_ROUTER_CONF again{};
    ASSERT_TRUE(
        ParseRouterConf(SerializeRouterConf("10.0.0.1", parsed), again, why))
        << why;
    EXPECT_EQ(0, std::memcmp(&parsed, &again, sizeof(parsed))) << text;
  }
  // The mutations are not all fatal: some still parse (a changed letter).
  EXPECT_GT(accepted, 0);
}

TEST(PortMapDBParserMutations, ArchiveCheckKeepsItsPromises) {
  std::vector<zark::test::TarMember> members(4);
  members[0].name = "routerdb/";
  members[0].type = AE_IFDIR;
  members[1].name = "routerdb/routerdb.conf";
  members[1].content = "syntax_version=1\n";
  members[2].name = "routerdb/Acme/";
  members[2].type = AE_IFDIR;
  members[3].name = "routerdb/Acme/R1/g";
  members[3].content = "version=generic\n";
  const std::string valid = zark::test::MakeTar(members);
  std::mt19937 random(7);
  int accepted = 0;
  for (int i = 0; i < 20000; ++i) {
    const std::string archive = Mutate(valid, random);
    std::string why;
    if (!CheckRouterDbArchive(archive, why)) {
      EXPECT_FALSE(why.empty());
      continue;
    }
    ++accepted;
    // Accepted: read on its own, every member is a folder or a file named
    // under routerdb/ that does not climb out.
    std::vector<zark::test::ListedMember> listed;
    ASSERT_TRUE(zark::test::ListTarMembers(archive, listed));
    for (const zark::test::ListedMember &member : listed) {
      EXPECT_TRUE(member.type == '-' || member.type == 'd') << member.name;
      EXPECT_EQ(0u, member.name.rfind("routerdb", 0)) << member.name;
      EXPECT_EQ(std::string::npos, (member.name + "/").find("/../"))
          << member.name;
    }
  }
  // The mutations are not all fatal: a changed byte of content still reads.
  EXPECT_GT(accepted, 0);
}

} // namespace
