#include "klibc.h"
#include "klibc_test_util.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>

namespace zark::test {
namespace {

class KlibcErrorState : public ::testing::Test {
protected:
  void SetUp() override { ClearError(); }
};

TEST_F(KlibcErrorState, FreshThreadHasNothingRecorded) {
  int code = -1;
  std::string file = "unset";
  int line = -1;
  std::thread reader([&] {
    code = KLIBCErrGet();
    file = KLIBCErrorGetFile();
    line = KLIBCErrorGetLine();
  });
  reader.join();
  EXPECT_EQ(code, KLIBC_ERR_NONE);
  EXPECT_EQ(file, "");
  EXPECT_EQ(line, 0);
}

TEST_F(KlibcErrorState, SetExRecordsCodeFileAndLine) {
  KLIBCErrSetEx(KLIBC_ERR_BAD_PARAMETER, "src/RouterRuleServHandler.cpp", 42);
  EXPECT_EQ(KLIBCErrGet(), 0x0D00);
  EXPECT_STREQ(KLIBCErrorGetFile(), "src/RouterRuleServHandler.cpp");
  EXPECT_EQ(KLIBCErrorGetLine(), 42);
  KLIBCErrSetEx(KLIBC_ERR_EXEC, "other.cpp", 7);
  EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_EXEC);
  EXPECT_STREQ(KLIBCErrorGetFile(), "other.cpp");
  EXPECT_EQ(KLIBCErrorGetLine(), 7);
}

TEST_F(KlibcErrorState, FileTextIsCopied) {
  std::string file = "caller/buffer.cpp";
  KLIBCErrSetEx(KLIBC_ERR_FILE_OPEN, file.c_str(), 3);
  const char *kept = KLIBCErrorGetFile();
  file.assign(file.size(), 'X');
  file.clear();
  file.shrink_to_fit();
  EXPECT_STREQ(kept, "caller/buffer.cpp");
  EXPECT_STREQ(KLIBCErrorGetFile(), "caller/buffer.cpp");
}

TEST_F(KlibcErrorState, NullFileReadsAsEmpty) {
  KLIBCErrSetEx(KLIBC_ERR_OUT_OF_MEMORY, nullptr, 9);
  EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_OUT_OF_MEMORY);
  EXPECT_STREQ(KLIBCErrorGetFile(), "");
  EXPECT_EQ(KLIBCErrorGetLine(), 9);
}

TEST_F(KlibcErrorState, VeryLongFileTextIsCutNotOverrun) {
  const std::string file(1000, 'f');
  KLIBCErrSetEx(KLIBC_ERR_FILE_READ, file.c_str(), 1);
  const std::string kept = KLIBCErrorGetFile();
  EXPECT_EQ(kept, file.substr(0, kept.size()));
  EXPECT_GE(kept.size(), 200u);
  EXPECT_LT(kept.size(), file.size());
}

TEST_F(KlibcErrorState, ThreadsDoNotSeeEachOthersState) {
  KLIBCErrSetEx(KLIBC_ERR_FILE_WRITE, "main.cpp", 1);
  int seenByOther = -1;
  std::string fileSeenByOther;
  int recordedByOther = -1;
  std::thread other([&] {
    seenByOther = KLIBCErrGet();
    fileSeenByOther = KLIBCErrorGetFile();
    KLIBCErrSetEx(KLIBC_ERR_EXEC, "other.cpp", 2);
    // A failing library call records in this thread only.
    EXPECT_EQ(KLIBCSzListGet(nullptr, 0), nullptr);
    recordedByOther = KLIBCErrGet();
  });
  other.join();
  EXPECT_EQ(seenByOther, KLIBC_ERR_NONE);
  EXPECT_EQ(fileSeenByOther, "");
  EXPECT_EQ(recordedByOther, KLIBC_ERR_BAD_PARAMETER);
  EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_FILE_WRITE);
  EXPECT_STREQ(KLIBCErrorGetFile(), "main.cpp");
  EXPECT_EQ(KLIBCErrorGetLine(), 1);
}

TEST_F(KlibcErrorState, FailingCallsRecordTheirOwnSourceFile) {
  EXPECT_EQ(KLIBCStrSep(nullptr, ",", nullptr), -1);
  EXPECT_STREQ(KLIBCErrorGetFile(), "platform/klibc/src/str_split.cpp");
  EXPECT_EQ(KLIBCFileExist(nullptr), -1);
  EXPECT_STREQ(KLIBCErrorGetFile(), "platform/klibc/src/file_exist.cpp");
  EXPECT_EQ(KLIBCSystem(nullptr), -1);
  EXPECT_STREQ(KLIBCErrorGetFile(), "platform/klibc/src/system.cpp");
  char buf[4];
  EXPECT_EQ(KLIBCFileGetKeyValue(nullptr, "k", buf, sizeof buf, 0), -1);
  EXPECT_STREQ(KLIBCErrorGetFile(), "platform/klibc/src/key_value_file.cpp");
}

} // namespace
} // namespace zark::test
