#include "allocation_failure.h"
#include "hermetic.h"
#include "klibc.h"
#include "klibc_test_util.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <string>
#include <vector>

namespace zark::test {
namespace {

namespace fs = std::filesystem;

constexpr const char *kFile = "/tmp/klibc/alloc.conf";
constexpr const char *kContent = "[general]\nname=server\n[web]\nport=5000\n";
// Enough for any of these calls; each loop ends at the first success.
constexpr long kMaxAllocations = 1000;

class KlibcAllocationFailure : public ::testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    WriteFile(kFile, kContent);
  }
};

TEST_F(KlibcAllocationFailure, GetKeyValueReportsOutOfMemory) {
  long failures = 0;
  bool succeeded = false;
  for (long allowed = 0; allowed < kMaxAllocations && !succeeded; ++allowed) {
    ClearError();
    char buf[64] = "Z";
    int result = 0;
    bool triggered = false;
    {
      ScopedAllocationFailure fail(allowed);
      result = KLIBCFileGetKeyValue(kFile, "port", buf, sizeof buf, 0);
      triggered = fail.Triggered();
    }
    if (result == -1) {
      ++failures;
      EXPECT_TRUE(triggered);
      EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_OUT_OF_MEMORY);
      EXPECT_STREQ(buf, "");
    } else {
      EXPECT_EQ(result, 4);
      EXPECT_STREQ(buf, "5000");
      succeeded = true;
    }
  }
  EXPECT_TRUE(succeeded);
  EXPECT_GT(failures, 0) << "no allocation reached the library";
}

TEST_F(KlibcAllocationFailure, SetKeyValueKeepsTheOldFile) {
  long failures = 0;
  bool succeeded = false;
  for (long allowed = 0; allowed < kMaxAllocations && !succeeded; ++allowed) {
    ClearError();
    int result = 0;
    {
      ScopedAllocationFailure fail(allowed);
      result = KLIBCFileSetKeyValue(kFile, "port", "8080", 0);
    }
    if (result == -1) {
      ++failures;
      EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_OUT_OF_MEMORY);
      EXPECT_EQ(ReadFile(kFile), kContent);
    } else {
      EXPECT_EQ(result, 0);
      EXPECT_EQ(ReadFile(kFile), "[general]\nname=server\n[web]\nport=8080\n");
      succeeded = true;
    }
    std::vector<std::string> names;
    for (const auto &entry : fs::directory_iterator("/tmp/klibc")) {
      names.push_back(entry.path().filename().string());
    }
    EXPECT_EQ(names, std::vector<std::string>{"alloc.conf"});
  }
  EXPECT_TRUE(succeeded);
  EXPECT_GT(failures, 0) << "no allocation reached the library";
}

TEST_F(KlibcAllocationFailure, EnumSectionLeavesTheListAlone) {
  SzListPtr list = MakeList();
  ASSERT_EQ(KLIBCSzListPush(ListSlot(list), "kept"), 0);
  long failures = 0;
  bool succeeded = false;
  for (long allowed = 0; allowed < kMaxAllocations && !succeeded; ++allowed) {
    ClearError();
    int result = 0;
    {
      ScopedAllocationFailure fail(allowed);
      result = KLIBCFileEnumSection(kFile, ListSlot(list));
    }
    if (result == -1) {
      ++failures;
      EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_OUT_OF_MEMORY);
      EXPECT_EQ(Items(list.get()), std::vector<std::string>{"kept"});
    } else {
      EXPECT_EQ(result, 2);
      EXPECT_EQ(Items(list.get()),
                (std::vector<std::string>{"kept", "general", "web"}));
      succeeded = true;
    }
  }
  EXPECT_TRUE(succeeded);
  EXPECT_GT(failures, 0) << "no allocation reached the library";
}

} // namespace
} // namespace zark::test
