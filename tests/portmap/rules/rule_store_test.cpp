// The rule store classes and the C calls that read rule configurations,
// against real files under /etc/portforward (private mount namespace).
#include "RouterRuleConf.h"
#include "libzarkportmap.h"

#include "hermetic.h"
#include "rules/rule_conf_format.h"
#include "syslog_capture.h"

#include <gtest/gtest.h>

#include <dirent.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <syslog.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

namespace {

namespace fs = std::filesystem;
using zark::test::ClearLogs;
using zark::test::HasLogContaining;
using zark::test::ReadFile;
using zark::test::ResetFixedPaths;
using zark::test::WriteFile;

const std::string kFolder = ZARK_PORTMAP_CONF_DIR;
const std::string kRuleConf = ZARK_PORTMAP_RULE_CONF;
const std::string kTestRuleConf = ZARK_PORTMAP_TEST_RULE_CONF;

struct FreeRules {
  void operator()(ZARK_ROUTER_RULE *rules) const { KLibFreeRulesArr(rules); }
};
using RulesPtr = std::unique_ptr<ZARK_ROUTER_RULE, FreeRules>;

class PortMapRuleStore : public testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearLogs();
  }
};

RouterRule Rule(std::string id, bool enable, std::string protocol,
                std::string routerPort, std::string dsPort,
                std::string serviceId, std::string serviceName) {
  return RouterRule{std::move(id),         enable,
                    std::move(routerPort), std::move(dsPort),
                    std::move(protocol),   std::move(serviceId),
                    std::move(serviceName)};
}

bool Add(RouterRuleConfWriter &writer, const RouterRule &r) {
  return writer.AddRule(r.ruleId, r.enable, r.routerPort, r.dsPort, r.protocol,
                        r.serviceId, r.serviceName);
}

std::vector<RouterRule> ReadAll(RouterRuleConfReader &reader) {
  std::vector<RouterRule> rules;
  if (!reader.StartNextRule()) {
    return rules;
  }
  do {
    RouterRule rule;
    EXPECT_TRUE(reader.GetRuleInfo(rule));
    rules.push_back(rule);
  } while (reader.NextRule());
  return rules;
}

void ExpectSameRule(const RouterRule &expected, const RouterRule &actual) {
  EXPECT_EQ(expected.ruleId, actual.ruleId);
  EXPECT_EQ(expected.enable, actual.enable);
  EXPECT_EQ(expected.protocol, actual.protocol);
  EXPECT_EQ(expected.routerPort, actual.routerPort);
  EXPECT_EQ(expected.dsPort, actual.dsPort);
  EXPECT_EQ(expected.serviceId, actual.serviceId);
  EXPECT_EQ(expected.serviceName, actual.serviceName);
}

void ExpectRecord(const RouterRule &expected, const ZARK_ROUTER_RULE &record) {
  EXPECT_EQ(expected.ruleId, record.rule_id);
  EXPECT_EQ(expected.enable ? 1 : 0, record.enable);
  EXPECT_EQ(expected.protocol, record.router_protocol);
  EXPECT_EQ(expected.routerPort, record.router_port);
  EXPECT_EQ(expected.dsPort, record.ds_port);
  EXPECT_EQ(expected.serviceId, record.serviceid);
  EXPECT_EQ(expected.serviceName, record.service_name);
}

// Names in folder other than the given ones: leftovers of a failed write.
std::vector<std::string> OtherEntries(const std::string &folder,
                                      const std::vector<std::string> &known) {
  std::vector<std::string> others;
  for (const auto &entry : fs::directory_iterator(folder)) {
    std::string name = entry.path().filename();
    if (std::find(known.begin(), known.end(), name) == known.end()) {
      others.push_back(name);
    }
  }
  return others;
}

std::vector<RouterRule> HostileRules() {
  return {
      Rule("plain", true, "tcp", "8080", "80", "web", "Web Station"),
      Rule("\"q\"", false, "udp", "a=b", "=", "id=\"x\"", "'single'"),
      Rule("multi\nline", true, "tcp\r\n", "1\n2", "\n", "\\n", "\\"),
      Rule("[x]", true, "[rule]", "[x]=1", "]", "[", "#;"),
      Rule("", false, "", "", "", "", ""),
      Rule(std::string(1023, '1'), true, std::string(1023, '"'),
           std::string(1023, '='), std::string(1023, '\n'),
           std::string(1023, '['), std::string(1023, '\xe9')),
      Rule("\xff\xfe non-utf8 \x80", true, "\x01\x1f\x7f", "caf\xc3\xa9",
           "\xe6\x97\xa5", "\xf0\x9f\x98\x80", "\xc3"),
  };
}

TEST_F(PortMapRuleStore, SyncThenReadRoundTripsHostileTexts) {
  RouterRuleConfWriter writer;
  std::vector<RouterRule> rules = HostileRules();
  for (const RouterRule &rule : rules) {
    ASSERT_TRUE(Add(writer, rule));
  }
  ASSERT_TRUE(writer.Sync(kRuleConf));

  RouterRuleConfReader reader(false);
  ASSERT_TRUE(reader.IsValid());
  std::vector<RouterRule> read = ReadAll(reader);
  ASSERT_EQ(rules.size(), read.size());
  for (std::size_t i = 0; i < rules.size(); ++i) {
    SCOPED_TRACE("rule " + std::to_string(i));
    ExpectSameRule(rules[i], read[i]);
  }

  // The same rules through the C interface.
  int count = -1;
  ZARK_ROUTER_RULE *raw = nullptr;
  ZARK_LIBZARKPORTMAP_ERR err{-1};
  ASSERT_EQ(0, KLibGetRulesArrFromRuleConf(&count, &raw, nullptr, false, &err));
  RulesPtr records(raw);
  EXPECT_EQ(ZARK_PORTMAP_ERR_NONE, err.err);
  ASSERT_EQ(static_cast<int>(rules.size()), count);
  for (std::size_t i = 0; i < rules.size(); ++i) {
    SCOPED_TRACE("record " + std::to_string(i));
    ExpectRecord(rules[i], records.get()[i]);
  }
}

TEST_F(PortMapRuleStore, GetRuleInfoGivesTheFiveFieldsInOrder) {
  RouterRuleConfWriter writer;
  ASSERT_TRUE(writer.AddRule(0, true, "8080", "80", "tcp", "web", "Web"));
  ASSERT_TRUE(writer.AddRule(1, false, "53", "5353", "udp", "", ""));
  ASSERT_TRUE(writer.Sync(kRuleConf));

  RouterRuleConfReader reader;
  bool enable = false;
  std::string routerPort, dsPort, protocol, serviceId;
  ASSERT_TRUE(reader.StartNextRule());
  ASSERT_TRUE(
      reader.GetRuleInfo(enable, routerPort, dsPort, protocol, serviceId));
  EXPECT_TRUE(enable);
  EXPECT_EQ("8080", routerPort);
  EXPECT_EQ("80", dsPort);
  EXPECT_EQ("tcp", protocol);
  EXPECT_EQ("web", serviceId);
  ASSERT_TRUE(reader.NextRule());
  ASSERT_TRUE(
      reader.GetRuleInfo(enable, routerPort, dsPort, protocol, serviceId));
  EXPECT_FALSE(enable);
  EXPECT_EQ("53", routerPort);
  EXPECT_EQ("5353", dsPort);
  EXPECT_EQ("udp", protocol);
  EXPECT_EQ("", serviceId);
  EXPECT_FALSE(reader.NextRule());
  EXPECT_FALSE(
      reader.GetRuleInfo(enable, routerPort, dsPort, protocol, serviceId));
  EXPECT_FALSE(reader.NextRule());
  // Starting again walks the same rules.
  ASSERT_TRUE(reader.StartNextRule());
  RouterRule first;
  ASSERT_TRUE(reader.GetRuleInfo(first));
  EXPECT_EQ("0", first.ruleId);
}

TEST_F(PortMapRuleStore, EveryFieldOver1023BytesIsRefused) {
  const std::string ok(1023, 'x');
  const std::string tooLong(1024, 'x');
  RouterRuleConfWriter writer;
  ASSERT_TRUE(writer.AddRule(ok, true, ok, ok, ok, ok, ok));
  for (int field = 0; field < 6; ++field) {
    SCOPED_TRACE("field " + std::to_string(field));
    auto pick = [&](int which) -> const std::string & {
      return which == field ? tooLong : ok;
    };
    ClearLogs();
    EXPECT_FALSE(writer.AddRule(pick(0), true, pick(1), pick(2), pick(3),
                                pick(4), pick(5)));
    EXPECT_TRUE(HasLogContaining("refused"));
    if (field > 0) {
      EXPECT_FALSE(
          writer.AddRule(7, true, pick(1), pick(2), pick(3), pick(4), pick(5)));
    }
  }
  EXPECT_EQ(1u, writer.Rules().size());
}

TEST_F(PortMapRuleStore, TextWithNulIsRefused) {
  RouterRuleConfWriter writer;
  EXPECT_FALSE(
      writer.AddRule(1, true, std::string("80\0", 3), "80", "tcp", "", ""));
  EXPECT_TRUE(writer.Rules().empty());
}

TEST_F(PortMapRuleStore, IntOverloadUsesDecimalText) {
  RouterRuleConfWriter writer;
  ASSERT_TRUE(writer.AddRule(0, true, "1", "1", "tcp", "", ""));
  ASSERT_TRUE(writer.AddRule(42, true, "1", "1", "tcp", "", ""));
  ASSERT_TRUE(writer.AddRule(-7, true, "1", "1", "tcp", "", ""));
  ASSERT_TRUE(writer.AddRule(2147483647, true, "1", "1", "tcp", "", ""));
  ASSERT_EQ(4u, writer.Rules().size());
  EXPECT_EQ("0", writer.Rules()[0].ruleId);
  EXPECT_EQ("42", writer.Rules()[1].ruleId);
  EXPECT_EQ("-7", writer.Rules()[2].ruleId);
  EXPECT_EQ("2147483647", writer.Rules()[3].ruleId);
}

TEST_F(PortMapRuleStore, ToArrayCopiesEveryRuleInOrder) {
  RouterRuleConfWriter writer;
  std::vector<RouterRule> rules = HostileRules();
  for (const RouterRule &rule : rules) {
    ASSERT_TRUE(Add(writer, rule));
  }
  int count = -1;
  ZARK_ROUTER_RULE *raw = nullptr;
  ASSERT_TRUE(writer.ToArray(&count, &raw));
  RulesPtr records(raw);
  ASSERT_NE(nullptr, records);
  ASSERT_EQ(static_cast<int>(rules.size()), count);
  for (int i = 0; i < count; ++i) {
    SCOPED_TRACE("record " + std::to_string(i));
    ExpectRecord(rules[static_cast<std::size_t>(i)], records.get()[i]);
  }
  // The 1023-byte texts fill their fields up to the terminating NUL.
  const ZARK_ROUTER_RULE &full = records.get()[5];
  EXPECT_EQ('1', full.rule_id[ZARK_PORTMAP_TEXT_SIZE - 2]);
  EXPECT_EQ('\0', full.rule_id[ZARK_PORTMAP_TEXT_SIZE - 1]);
  EXPECT_EQ('\xe9', full.service_name[ZARK_PORTMAP_TEXT_SIZE - 2]);
  EXPECT_EQ('\0', full.service_name[ZARK_PORTMAP_TEXT_SIZE - 1]);
}

TEST_F(PortMapRuleStore, ToArrayOfNoRuleIsNull) {
  RouterRuleConfWriter writer;
  int count = -1;
  ZARK_ROUTER_RULE *raw = reinterpret_cast<ZARK_ROUTER_RULE *>(&count);
  ASSERT_TRUE(writer.ToArray(&count, &raw));
  EXPECT_EQ(0, count);
  EXPECT_EQ(nullptr, raw);
}

TEST_F(PortMapRuleStore, ToArrayRefusesNullArguments) {
  RouterRuleConfWriter writer;
  ASSERT_TRUE(writer.AddRule(1, true, "80", "80", "tcp", "", ""));
  int count = 0;
  ZARK_ROUTER_RULE *raw = nullptr;
  EXPECT_FALSE(writer.ToArray(nullptr, &raw));
  EXPECT_FALSE(writer.ToArray(&count, nullptr));
  EXPECT_EQ(nullptr, raw);
}

TEST_F(PortMapRuleStore, SyncWritesMode0600WhateverTheUmask) {
  RouterRuleConfWriter writer;
  ASSERT_TRUE(writer.AddRule(1, true, "80", "80", "tcp", "", ""));
  mode_t old = umask(0277);
  bool synced = writer.Sync(kRuleConf);
  umask(old);
  ASSERT_TRUE(synced);
  struct stat info {};
  ASSERT_EQ(0, stat(kRuleConf.c_str(), &info));
  EXPECT_TRUE(S_ISREG(info.st_mode));
  EXPECT_EQ(0600u, info.st_mode & 07777);
}

TEST_F(PortMapRuleStore, SyncCreatesAMissingFolder) {
  fs::remove_all(kFolder);
  const std::string path = kFolder + "/deeper/rules.conf";
  RouterRuleConfWriter writer;
  ASSERT_TRUE(writer.AddRule(1, true, "80", "80", "tcp", "", ""));
  ASSERT_TRUE(writer.Sync(path));
  struct stat info {};
  ASSERT_EQ(0, stat(kFolder.c_str(), &info));
  EXPECT_EQ(0755u, info.st_mode & 07777);
  ASSERT_EQ(0, stat((kFolder + "/deeper").c_str(), &info));
  EXPECT_EQ(0755u, info.st_mode & 07777);
  RouterRuleConfReader reader(path);
  EXPECT_TRUE(reader.IsValid());
  EXPECT_EQ(1u, reader.Rules().size());
}

TEST_F(PortMapRuleStore, SyncReplacesTheOldFile) {
  RouterRuleConfWriter first;
  ASSERT_TRUE(first.AddRule(1, true, "80", "80", "tcp", "", ""));
  ASSERT_TRUE(first.AddRule(2, true, "81", "81", "tcp", "", ""));
  ASSERT_TRUE(first.Sync(kRuleConf));
  RouterRuleConfWriter second;
  ASSERT_TRUE(second.AddRule("only", false, "90", "91", "udp", "s", "n"));
  ASSERT_TRUE(second.Sync(kRuleConf));
  RouterRuleConfReader reader;
  ASSERT_EQ(1u, reader.Rules().size());
  EXPECT_EQ("only", reader.Rules()[0].ruleId);
  EXPECT_EQ(std::vector<std::string>{}, OtherEntries(kFolder, {"rule.conf"}));

  // An empty writer writes a configuration with no rule, not nothing.
  RouterRuleConfWriter empty;
  ASSERT_TRUE(empty.Sync(kRuleConf));
  RouterRuleConfReader emptied;
  EXPECT_TRUE(emptied.IsValid());
  EXPECT_TRUE(emptied.Rules().empty());
}

TEST_F(PortMapRuleStore, SyncOntoAFolderFailsAndLeavesItAlone) {
  const std::string target = kFolder + "/rule.conf";
  ASSERT_EQ(0, mkdir(target.c_str(), 0700));
  WriteFile(target + "/inside", "keep");
  RouterRuleConfWriter writer;
  ASSERT_TRUE(writer.AddRule(1, true, "80", "80", "tcp", "", ""));
  EXPECT_FALSE(writer.Sync(target));
  EXPECT_TRUE(HasLogContaining("rename failed"));
  EXPECT_TRUE(fs::is_directory(target));
  EXPECT_EQ("keep", ReadFile(target + "/inside"));
  EXPECT_EQ(std::vector<std::string>{}, OtherEntries(kFolder, {"rule.conf"}));
}

// A folder that becomes read-only: the old file must survive whole.
TEST_F(PortMapRuleStore, SyncIntoAReadOnlyFolderKeepsTheOldFile) {
  const std::string folder = kFolder + "/ro";
  ASSERT_EQ(0, mkdir(folder.c_str(), 0755));
  ASSERT_EQ(0, mount("zark-test", folder.c_str(), "tmpfs", 0, "mode=0755"))
      << std::strerror(errno);
  const std::string path = folder + "/rule.conf";
  RouterRuleConfWriter old;
  ASSERT_TRUE(old.AddRule("old", true, "80", "80", "tcp", "", ""));
  ASSERT_TRUE(old.Sync(path));
  const std::string oldText = ReadFile(path);
  ASSERT_EQ(0, mount(nullptr, folder.c_str(), nullptr, MS_REMOUNT | MS_RDONLY,
                     nullptr))
      << std::strerror(errno);

  RouterRuleConfWriter replacement;
  ASSERT_TRUE(replacement.AddRule("new", true, "81", "81", "tcp", "", ""));
  EXPECT_FALSE(replacement.Sync(path));
  EXPECT_TRUE(HasLogContaining("mkostemp failed"));
  EXPECT_EQ(oldText, ReadFile(path));
  RouterRuleConfReader reader(path);
  ASSERT_EQ(1u, reader.Rules().size());
  EXPECT_EQ("old", reader.Rules()[0].ruleId);
  EXPECT_EQ(std::vector<std::string>{}, OtherEntries(folder, {"rule.conf"}));
  ASSERT_EQ(0, umount(folder.c_str()));
}

TEST_F(PortMapRuleStore, SyncRefusesAPathWithoutAName) {
  RouterRuleConfWriter writer;
  EXPECT_FALSE(writer.Sync(""));
  EXPECT_FALSE(writer.Sync(kFolder + "/"));
  EXPECT_TRUE(fs::is_directory(kFolder));
}

TEST_F(PortMapRuleStore, SyncRefusesMoreRulesThanAReaderTakes) {
  RouterRuleConfWriter writer;
  for (std::size_t i = 0; i <= zark::portmap::kMaxRuleConfRules; ++i) {
    ASSERT_TRUE(
        writer.AddRule(static_cast<int>(i), true, "1", "1", "tcp", "", ""));
  }
  EXPECT_FALSE(writer.Sync(kRuleConf));
  EXPECT_FALSE(fs::exists(kRuleConf));
}

TEST_F(PortMapRuleStore, MissingFileHoldsNoRule) {
  RouterRuleConfReader reader(false);
  EXPECT_TRUE(reader.IsValid());
  EXPECT_FALSE(reader.StartNextRule());
  RouterRule rule;
  EXPECT_FALSE(reader.GetRuleInfo(rule));
  EXPECT_FALSE(reader.NextRule());
  EXPECT_TRUE(zark::test::CapturedLogs().empty());
}

TEST_F(PortMapRuleStore, MalformedFileIsInvalidAndLoggedOnce) {
  WriteFile(kRuleConf, "[rule1]\nrouter_port=80\n", 0600);
  RouterRuleConfReader reader(false);
  EXPECT_FALSE(reader.IsValid());
  EXPECT_FALSE(reader.StartNextRule());
  auto logs = zark::test::CapturedLogs();
  ASSERT_EQ(1u, logs.size());
  EXPECT_EQ(LOG_ERR, logs[0].priority);
  EXPECT_NE(std::string::npos, logs[0].message.find(kRuleConf));
}

TEST_F(PortMapRuleStore, TruncatedFileIsInvalid) {
  RouterRuleConfWriter writer;
  ASSERT_TRUE(writer.AddRule(1, true, "80", "80", "tcp", "web", "Web"));
  ASSERT_TRUE(writer.AddRule(2, true, "81", "81", "udp", "web", "Web"));
  ASSERT_TRUE(writer.Sync(kRuleConf));
  std::string whole = ReadFile(kRuleConf);
  WriteFile(kRuleConf, whole.substr(0, whole.size() / 2), 0600);
  RouterRuleConfReader reader(false);
  EXPECT_FALSE(reader.IsValid());
  EXPECT_TRUE(reader.Rules().empty());
}

TEST_F(PortMapRuleStore, EmptyFileIsInvalid) {
  WriteFile(kRuleConf, "", 0600);
  RouterRuleConfReader reader(false);
  EXPECT_FALSE(reader.IsValid());
}

TEST_F(PortMapRuleStore, FolderInsteadOfFileIsInvalid) {
  ASSERT_EQ(0, mkdir(kRuleConf.c_str(), 0755));
  RouterRuleConfReader reader(false);
  EXPECT_FALSE(reader.IsValid());
  EXPECT_EQ(1u, zark::test::CapturedLogs().size());
}

TEST_F(PortMapRuleStore, FifoInsteadOfFileIsInvalidWithoutBlocking) {
  ASSERT_EQ(0, mkfifo(kRuleConf.c_str(), 0600));
  RouterRuleConfReader reader(false);
  EXPECT_FALSE(reader.IsValid());
  EXPECT_TRUE(HasLogContaining("not a regular file"));
}

TEST_F(PortMapRuleStore, FileOverTheSizeLimitIsInvalid) {
  WriteFile(kRuleConf, std::string(zark::portmap::kMaxRuleConfBytes + 1, ' '),
            0600);
  RouterRuleConfReader reader(false);
  EXPECT_FALSE(reader.IsValid());
  EXPECT_TRUE(HasLogContaining("larger than"));
}

TEST_F(PortMapRuleStore, ReaderFlagPicksTheFile) {
  RouterRuleConfWriter saved;
  ASSERT_TRUE(saved.AddRule("saved", true, "80", "80", "tcp", "", ""));
  ASSERT_TRUE(saved.Sync(kRuleConf));
  RouterRuleConfWriter test;
  ASSERT_TRUE(test.AddRule("svc.tcp", true, "81", "81", "tcp", "svc", ""));
  ASSERT_TRUE(test.Sync(kTestRuleConf));

  RouterRuleConfReader savedReader(false);
  ASSERT_EQ(1u, savedReader.Rules().size());
  EXPECT_EQ("saved", savedReader.Rules()[0].ruleId);
  RouterRuleConfReader testReader(true);
  ASSERT_EQ(1u, testReader.Rules().size());
  EXPECT_EQ("svc.tcp", testReader.Rules()[0].ruleId);
}

TEST_F(PortMapRuleStore, GetRulesWithNullPathReadsTheDefaultFiles) {
  RouterRuleConfWriter saved;
  ASSERT_TRUE(saved.AddRule("saved", true, "80", "8080", "tcp", "", ""));
  ASSERT_TRUE(saved.Sync(kRuleConf));
  RouterRuleConfWriter test;
  ASSERT_TRUE(test.AddRule("svc.tcp", true, "81", "81", "tcp", "svc", ""));
  ASSERT_TRUE(test.AddRule("svc.udp", false, "82", "82", "udp", "svc", ""));
  ASSERT_TRUE(test.Sync(kTestRuleConf));

  int count = 0;
  ZARK_ROUTER_RULE *raw = nullptr;
  ASSERT_EQ(0,
            KLibGetRulesArrFromRuleConf(&count, &raw, nullptr, false, nullptr));
  RulesPtr savedRecords(raw);
  ASSERT_EQ(1, count);
  EXPECT_STREQ("saved", savedRecords.get()[0].rule_id);
  EXPECT_STREQ("8080", savedRecords.get()[0].ds_port);

  ASSERT_EQ(0, KLibGetRulesArrFromTestRuleConf(&count, &raw, nullptr, false,
                                               nullptr));
  RulesPtr testRecords(raw);
  ASSERT_EQ(2, count);
  EXPECT_STREQ("svc.tcp", testRecords.get()[0].rule_id);
  EXPECT_EQ(1, testRecords.get()[0].enable);
  EXPECT_STREQ("svc.udp", testRecords.get()[1].rule_id);
  EXPECT_EQ(0, testRecords.get()[1].enable);
  EXPECT_STREQ("svc", testRecords.get()[1].serviceid);
}

TEST_F(PortMapRuleStore, GetRulesWithAPathReadsThatFile) {
  std::string path = kFolder + "/other.conf";
  RouterRuleConfWriter writer;
  ASSERT_TRUE(writer.AddRule("other", true, "1", "2", "udp", "", ""));
  ASSERT_TRUE(writer.Sync(path));
  for (auto get :
       {KLibGetRulesArrFromRuleConf, KLibGetRulesArrFromTestRuleConf}) {
    int count = 0;
    ZARK_ROUTER_RULE *raw = nullptr;
    ASSERT_EQ(0, get(&count, &raw, path.data(), false, nullptr));
    RulesPtr records(raw);
    ASSERT_EQ(1, count);
    EXPECT_STREQ("other", records.get()[0].rule_id);
  }
}

TEST_F(PortMapRuleStore, GetRulesFromAMissingFileGivesNoRule) {
  for (auto get :
       {KLibGetRulesArrFromRuleConf, KLibGetRulesArrFromTestRuleConf}) {
    int count = 5;
    ZARK_ROUTER_RULE *raw = reinterpret_cast<ZARK_ROUTER_RULE *>(&count);
    ZARK_LIBZARKPORTMAP_ERR err{-1};
    EXPECT_EQ(0, get(&count, &raw, nullptr, false, &err));
    EXPECT_EQ(0, count);
    EXPECT_EQ(nullptr, raw);
    EXPECT_EQ(ZARK_PORTMAP_ERR_NONE, err.err);
  }
}

TEST_F(PortMapRuleStore, GetRulesFromAMalformedFileFailsWithIoError) {
  WriteFile(kRuleConf, "{\"version\": 1, \"rules\": [", 0600);
  WriteFile(kTestRuleConf, "garbage", 0600);
  for (auto get :
       {KLibGetRulesArrFromRuleConf, KLibGetRulesArrFromTestRuleConf}) {
    int count = 5;
    ZARK_ROUTER_RULE *raw = nullptr;
    ZARK_LIBZARKPORTMAP_ERR err{0};
    EXPECT_EQ(-1, get(&count, &raw, nullptr, false, &err));
    EXPECT_EQ(ZARK_PORTMAP_ERR_IO, err.err);
    EXPECT_EQ(0, count);
    EXPECT_EQ(nullptr, raw);
    // No error record at all is fine too.
    EXPECT_EQ(-1, get(&count, &raw, nullptr, false, nullptr));
  }
}

TEST_F(PortMapRuleStore, GetRulesFromAnUnreadablePathFailsWithIoError) {
  ASSERT_EQ(0, mkdir(kRuleConf.c_str(), 0755));
  int count = 0;
  ZARK_ROUTER_RULE *raw = nullptr;
  ZARK_LIBZARKPORTMAP_ERR err{0};
  EXPECT_EQ(-1,
            KLibGetRulesArrFromRuleConf(&count, &raw, nullptr, false, &err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_IO, err.err);
  EXPECT_EQ(nullptr, raw);
}

TEST_F(PortMapRuleStore, GetRulesRefusesNullOutputs) {
  int count = 0;
  ZARK_ROUTER_RULE *raw = nullptr;
  ZARK_LIBZARKPORTMAP_ERR err{0};
  EXPECT_EQ(-1,
            KLibGetRulesArrFromRuleConf(nullptr, &raw, nullptr, false, &err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_BAD_PARAMETER, err.err);
  err.err = 0;
  EXPECT_EQ(-1, KLibGetRulesArrFromTestRuleConf(&count, nullptr, nullptr, false,
                                                &err));
  EXPECT_EQ(ZARK_PORTMAP_ERR_BAD_PARAMETER, err.err);
}

TEST_F(PortMapRuleStore, FreeRulesArrTakesNull) {
  KLibFreeRulesArr(nullptr);
  EXPECT_TRUE(zark::test::CapturedLogs().empty());
}

} // namespace
