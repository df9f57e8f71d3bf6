// The database of tested routers through KLibWriteRecordIntoUpnpDB.
// HERMETIC: /etc/portforward.
#include "compat/tested_router_db.h"

#include "hermetic.h"
#include "syslog_capture.h"

#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>
#include <thread>

namespace zark::portmap {
namespace {

ZARK_ROUTER_RECORD Record(const char *brand, const char *model,
                          const char *version, int max, const char *date) {
  ZARK_ROUTER_RECORD record{};
  std::strcpy(record.brand, brand);
  std::strcpy(record.model, model);
  std::strcpy(record.version, version);
  std::strcpy(record.date, date);
  record.max_mappings = max;
  return record;
}

std::vector<TestedRouter> Stored() {
  std::vector<TestedRouter> routers;
  EXPECT_TRUE(LoadTestedRouters(kTestedRoutersPath, routers));
  return routers;
}

class PortTestTestedRouters : public testing::Test {
protected:
  void SetUp() override {
    test::ResetFixedPaths();
    test::ClearLogs();
  }
};

TEST_F(PortTestTestedRouters, StoresReplacesAndKeepsOthers) {
  ZARK_ROUTER_RECORD first =
      Record("ZarkTest", "TestIGD", "1", 24, "2024-05-01T12:00:00Z");
  ASSERT_EQ(0, KLibWriteRecordIntoUpnpDB(&first));
  ZARK_ROUTER_RECORD other =
      Record("Acme", "R1", "", 60, "2024-05-02T12:00:00Z");
  ASSERT_EQ(0, KLibWriteRecordIntoUpnpDB(&other));
  ZARK_ROUTER_RECORD again =
      Record("ZarkTest", "TestIGD", "1", 32, "2024-06-01T12:00:00Z");
  ASSERT_EQ(0, KLibWriteRecordIntoUpnpDB(&again));
  EXPECT_EQ((std::vector<TestedRouter>{
                {"Acme", "R1", "", 60, "2024-05-02T12:00:00Z"},
                {"ZarkTest", "TestIGD", "1", 32, "2024-06-01T12:00:00Z"}}),
            Stored());
  struct stat info {};
  ASSERT_EQ(0, ::stat(kTestedRoutersPath, &info));
  EXPECT_EQ(0644u, info.st_mode & 0777);
}

TEST_F(PortTestTestedRouters, RefusesRecordsThatAreNotOnes) {
  EXPECT_EQ(-1, KLibWriteRecordIntoUpnpDB(nullptr));
  ZARK_ROUTER_RECORD empty = Record("", "TestIGD", "1", 24, "d");
  EXPECT_EQ(-1, KLibWriteRecordIntoUpnpDB(&empty));
  ZARK_ROUTER_RECORD none = Record("ZarkTest", "TestIGD", "1", 0, "d");
  EXPECT_EQ(-1, KLibWriteRecordIntoUpnpDB(&none));
  ZARK_ROUTER_RECORD unterminated = Record("ZarkTest", "TestIGD", "1", 5, "d");
  std::memset(unterminated.version, 'v', sizeof(unterminated.version));
  EXPECT_EQ(-1, KLibWriteRecordIntoUpnpDB(&unterminated));
  EXPECT_NE(0, ::access(kTestedRoutersPath, F_OK));
  EXPECT_TRUE(test::HasLogContaining("KLibWriteRecordIntoUpnpDB: "));
}

TEST_F(PortTestTestedRouters, ABrokenFileIsMovedAsideNotLost) {
  test::WriteFile(kTestedRoutersPath, "{ not json");
  ZARK_ROUTER_RECORD record = Record("ZarkTest", "TestIGD", "1", 8, "d");
  ASSERT_EQ(0, KLibWriteRecordIntoUpnpDB(&record));
  EXPECT_EQ("{ not json",
            test::ReadFile(std::string(kTestedRoutersPath) + ".bad"));
  EXPECT_EQ(1u, Stored().size());
  EXPECT_TRUE(test::HasLogContaining("starting a new database"));
}

TEST_F(PortTestTestedRouters, KeepsTheNewestWhenFull) {
  for (std::size_t i = 0; i < kMaxTestedRouters + 3; ++i) {
    TestedRouter router{"Brand", "M" + std::to_string(i), "", 4, "d"};
    ASSERT_TRUE(StoreTestedRouter(kTestedRoutersPath, router));
  }
  std::vector<TestedRouter> routers = Stored();
  ASSERT_EQ(kMaxTestedRouters, routers.size());
  EXPECT_EQ("M3", routers.front().model);
  EXPECT_EQ("M" + std::to_string(kMaxTestedRouters + 2), routers.back().model);
}

// Two writers at once lose nothing.
TEST_F(PortTestTestedRouters, ConcurrentWritersKeepEveryRecord) {
  std::vector<std::thread> writers;
  for (int w = 0; w < 4; ++w) {
    writers.emplace_back([w] {
      for (int i = 0; i < 10; ++i) {
        TestedRouter router{"B" + std::to_string(w), "M" + std::to_string(i),
                            "", 4, "d"};
        EXPECT_TRUE(StoreTestedRouter(kTestedRoutersPath, router));
      }
    });
  }
  for (std::thread &writer : writers) {
    writer.join();
  }
  EXPECT_EQ(40u, Stored().size());
}

} // namespace
} // namespace zark::portmap
