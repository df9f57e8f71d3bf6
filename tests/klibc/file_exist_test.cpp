#include "hermetic.h"
#include "klibc.h"
#include "klibc_test_util.h"
#include "run_as_nobody.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <string>

namespace zark::test {
namespace {

class KlibcFileExist : public ::testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearError();
  }
};

TEST_F(KlibcFileExist, ExistingFileAndFolderAreOne) {
  WriteFile("/tmp/klibc/file", "x");
  EXPECT_EQ(KLIBCFileExist("/tmp/klibc/file"), 1);
  EXPECT_EQ(KLIBCFileExist("/tmp/klibc"), 1);
  EXPECT_EQ(KLIBCFileExist("/tmp/klibc/"), 1);
  ExpectNoError();
}

TEST_F(KlibcFileExist, EmptyFileExists) {
  WriteFile("/tmp/klibc/empty", "");
  EXPECT_EQ(KLIBCFileExist("/tmp/klibc/empty"), 1);
}

TEST_F(KlibcFileExist, MissingPathIsZero) {
  EXPECT_EQ(KLIBCFileExist("/tmp/klibc/none"), 0);
  EXPECT_EQ(KLIBCFileExist("/tmp/no/such/folder/file"), 0);
  EXPECT_EQ(KLIBCFileExist(""), 0);
  ExpectNoError();
}

TEST_F(KlibcFileExist, PathThroughAFileIsZero) {
  WriteFile("/tmp/klibc/file", "x");
  EXPECT_EQ(KLIBCFileExist("/tmp/klibc/file/child"), 0);
  ExpectNoError();
}

TEST_F(KlibcFileExist, DanglingSymbolicLinkIsZero) {
  WriteFile("/tmp/klibc/target", "x");
  ASSERT_EQ(symlink("/tmp/klibc/target", "/tmp/klibc/link"), 0);
  EXPECT_EQ(KLIBCFileExist("/tmp/klibc/link"), 1);
  ASSERT_EQ(unlink("/tmp/klibc/target"), 0);
  EXPECT_EQ(KLIBCFileExist("/tmp/klibc/link"), 0);
}

TEST_F(KlibcFileExist, NullPathIsABadParameter) {
  EXPECT_EQ(KLIBCFileExist(nullptr), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
}

TEST_F(KlibcFileExist, PermissionDeniedCannotBeDecided) {
  WriteFile("/tmp/klibc/closed/file", "x");
  ASSERT_EQ(chmod("/tmp/klibc/closed", 0700), 0);
  const int result = RunAsNobody([] {
    ClearError();
    const int exist = KLIBCFileExist("/tmp/klibc/closed/file");
    if (exist != -1) {
      return 10 + exist;
    }
    return KLIBCErrGet() == KLIBC_ERR_FILE_OPEN ? 0 : 20;
  });
  EXPECT_EQ(result, 0);
}

TEST_F(KlibcFileExist, OverlongNameCannotBeDecided) {
  const std::string path = "/tmp/" + std::string(300, 'n');
  EXPECT_EQ(KLIBCFileExist(path.c_str()), -1);
  ExpectError(KLIBC_ERR_FILE_OPEN);
}

} // namespace
} // namespace zark::test
