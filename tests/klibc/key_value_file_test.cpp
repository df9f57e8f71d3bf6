#include "hermetic.h"
#include "klibc.h"
#include "klibc_test_util.h"
#include "run_as_nobody.h"

#include <gtest/gtest.h>

#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <set>
#include <string>
#include <vector>

namespace zark::test {
namespace {

namespace fs = std::filesystem;
using Strings = std::vector<std::string>;

constexpr const char *kFile = "/tmp/klibc/settings.conf";

// A router-detection style file with sections, quotes, comments and blanks.
constexpr const char *kSample = "# written by hand\n"
                                "version = 3\n"
                                "\n"
                                "[general]\n"
                                "name = My Server \n"
                                "motd=\"  hello = world  \"\n"
                                "; note=not a key\n"
                                "empty=\n"
                                "[web]\n"
                                "port=5000\n"
                                "name=web server\n";

class KlibcKeyValueFile : public ::testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    ClearError();
  }

  // Reads key from path; the result and the buffer's text.
  static std::pair<int, std::string> Get(const char *path, const char *key,
                                         int size = 1024) {
    std::vector<char> buf(static_cast<std::size_t>(size > 0 ? size : 1), 'Z');
    const int result = KLIBCFileGetKeyValue(path, key, buf.data(), size, 0);
    if (size > 0) {
      EXPECT_NE(std::memchr(buf.data(), '\0', buf.size()), nullptr)
          << "buffer not terminated";
    }
    return {result, std::string(buf.data())};
  }

  static mode_t ModeOf(const char *path) {
    struct stat status {};
    EXPECT_EQ(stat(path, &status), 0) << path;
    return status.st_mode & 07777;
  }

  static std::set<std::string> FolderEntries(const std::string &folder) {
    std::set<std::string> names;
    for (const auto &entry : fs::directory_iterator(folder)) {
      names.insert(entry.path().filename().string());
    }
    return names;
  }
};

using Result = std::pair<int, std::string>;

TEST_F(KlibcKeyValueFile, GetReadsValuesInAnySection) {
  WriteFile(kFile, kSample);
  EXPECT_EQ(Get(kFile, "version"), (Result{1, "3"}));
  EXPECT_EQ(Get(kFile, "port"), (Result{4, "5000"}));
  ExpectNoError();
}

TEST_F(KlibcKeyValueFile, GetTrimsBlanksAndKeepsQuotedTextExactly) {
  WriteFile(kFile, kSample);
  EXPECT_EQ(Get(kFile, "name"), (Result{9, "My Server"}));
  EXPECT_EQ(Get(kFile, "motd"), (Result{17, "  hello = world  "}));
}

TEST_F(KlibcKeyValueFile, GetTakesTheFirstMatchingLine) {
  WriteFile(kFile, "[a]\nkey=first\n[b]\nkey=second\nkey=third\n");
  EXPECT_EQ(Get(kFile, "key"), (Result{5, "first"}));
}

TEST_F(KlibcKeyValueFile, GetOfAbsentOrEmptyIsZero) {
  WriteFile(kFile, kSample);
  EXPECT_EQ(Get(kFile, "missing"), (Result{0, ""}));
  EXPECT_EQ(Get(kFile, "empty"), (Result{0, ""}));
  EXPECT_EQ(Get(kFile, "note"), (Result{0, ""}));    // commented out
  EXPECT_EQ(Get(kFile, "Version"), (Result{0, ""})); // case-sensitive
  EXPECT_EQ(Get(kFile, "general"), (Result{0, ""})); // a section, no key
  ExpectNoError();
}

TEST_F(KlibcKeyValueFile, GetOfAnEmptyFileIsZero) {
  WriteFile(kFile, "");
  EXPECT_EQ(Get(kFile, "a"), (Result{0, ""}));
  ExpectNoError();
}

TEST_F(KlibcKeyValueFile, GetReadsCrLfLines) {
  WriteFile(kFile, "[s]\r\nupnp_add=finished\r\nupnp_max = 12 \r\n");
  EXPECT_EQ(Get(kFile, "upnp_add"), (Result{8, "finished"}));
  EXPECT_EQ(Get(kFile, "upnp_max"), (Result{2, "12"}));
}

TEST_F(KlibcKeyValueFile, GetCutsTheValueToTheBuffer) {
  WriteFile(kFile, "k=abcdef\n");
  EXPECT_EQ(Get(kFile, "k", 4), (Result{3, "abc"}));
  EXPECT_EQ(Get(kFile, "k", 7), (Result{6, "abcdef"}));
  EXPECT_EQ(Get(kFile, "k", 6), (Result{5, "abcde"}));
  EXPECT_EQ(Get(kFile, "k", 2), (Result{1, "a"}));
  EXPECT_EQ(Get(kFile, "k", 1), (Result{0, ""}));
  ExpectNoError();
}

TEST_F(KlibcKeyValueFile, GetOfAMissingFileFails) {
  EXPECT_EQ(Get("/tmp/klibc/none", "k"), (Result{-1, ""}));
  ExpectError(KLIBC_ERR_FILE_NOT_FOUND);
  ClearError();
  EXPECT_EQ(Get("/tmp/klibc/no/folder/file", "k"), (Result{-1, ""}));
  ExpectError(KLIBC_ERR_FILE_NOT_FOUND);
}

TEST_F(KlibcKeyValueFile, GetOfAFolderFails) {
  WriteFile("/tmp/klibc/folder/file", "");
  EXPECT_EQ(Get("/tmp/klibc/folder", "k"), (Result{-1, ""}));
  ExpectError(KLIBC_ERR_FILE_OPEN);
}

TEST_F(KlibcKeyValueFile, GetOfAFifoFailsWithoutWaiting) {
  fs::create_directories("/tmp/klibc");
  ASSERT_EQ(mkfifo("/tmp/klibc/fifo", 0644), 0);
  EXPECT_EQ(Get("/tmp/klibc/fifo", "k"), (Result{-1, ""}));
  ExpectError(KLIBC_ERR_FILE_OPEN);
}

TEST_F(KlibcKeyValueFile, GetOfAnUnreadableFileFails) {
  WriteFile(kFile, "k=v\n", 0600);
  const int result = RunAsNobody([] {
    ClearError();
    char buf[16] = "Z";
    const int got = KLIBCFileGetKeyValue(kFile, "k", buf, sizeof buf, 0);
    if (got != -1 || buf[0] != '\0') {
      return 10;
    }
    if (KLIBCErrGet() != KLIBC_ERR_FILE_OPEN) {
      return 11;
    }
    return std::strcmp(KLIBCErrorGetFile(), "platform/klibc/src/whole_file.cpp")
               ? 12
               : 0;
  });
  EXPECT_EQ(result, 0);
}

TEST_F(KlibcKeyValueFile, GetRefusesAFileOverTheSizeLimit) {
  std::string big = "k=v\n";
  big.resize((std::size_t{4} << 20) + 1, '#');
  WriteFile(kFile, big);
  EXPECT_EQ(Get(kFile, "k"), (Result{-1, ""}));
  ExpectError(KLIBC_ERR_TOO_LARGE);
  ClearError();
  big.resize(std::size_t{4} << 20);
  WriteFile(kFile, big);
  EXPECT_EQ(Get(kFile, "k"), (Result{1, "v"}));
  ExpectNoError();
}

TEST_F(KlibcKeyValueFile, GetRejectsBadArguments) {
  WriteFile(kFile, "k=v\n");
  char buf[8] = "Z";
  EXPECT_EQ(KLIBCFileGetKeyValue(nullptr, "k", buf, sizeof buf, 0), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  EXPECT_EQ(buf[0], '\0');
  ClearError();
  EXPECT_EQ(KLIBCFileGetKeyValue(kFile, nullptr, buf, sizeof buf, 0), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCFileGetKeyValue(kFile, "", buf, sizeof buf, 0), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCFileGetKeyValue(kFile, "k", nullptr, 8, 0), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCFileGetKeyValue(kFile, "k", buf, 0, 0), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCFileGetKeyValue(kFile, "k", buf, -5, 0), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCFileGetKeyValue(kFile, "k", buf, sizeof buf, 1), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
}

TEST_F(KlibcKeyValueFile, SuccessLeavesAnEarlierErrorInPlace) {
  WriteFile(kFile, "k=v\n");
  EXPECT_EQ(Get("/tmp/klibc/none", "k").first, -1);
  const int line = KLIBCErrorGetLine();
  EXPECT_EQ(Get(kFile, "k"), (Result{1, "v"}));
  EXPECT_EQ(Get(kFile, "absent"), (Result{0, ""}));
  EXPECT_EQ(KLIBCErrGet(), KLIBC_ERR_FILE_NOT_FOUND);
  EXPECT_EQ(KLIBCErrorGetLine(), line);
}

TEST_F(KlibcKeyValueFile, SetCreatesAMissingFileWithMode0644) {
  fs::create_directories("/tmp/klibc");
  const mode_t oldMask = umask(077);
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "key", "value", 0), 0);
  umask(oldMask);
  EXPECT_EQ(ReadFile(kFile), "key=value\n");
  EXPECT_EQ(ModeOf(kFile), 0644u);
  EXPECT_EQ(Get(kFile, "key"), (Result{5, "value"}));
  ExpectNoError();
}

TEST_F(KlibcKeyValueFile, SetReplacesOnlyTheFirstMatchingLine) {
  WriteFile(kFile, kSample);
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "name", "NAS", 0), 0);
  const std::string expected = std::string(kSample).replace(
      std::string(kSample).find("name = My Server "), 17, "name=NAS");
  EXPECT_EQ(ReadFile(kFile), expected);
  EXPECT_EQ(Get(kFile, "name"), (Result{3, "NAS"}));
}

TEST_F(KlibcKeyValueFile, SetAppendsAnAbsentKey) {
  WriteFile(kFile, "[s]\na=1\n");
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "b", "2", 0), 0);
  EXPECT_EQ(ReadFile(kFile), "[s]\na=1\nb=2\n");
}

TEST_F(KlibcKeyValueFile, SetEndsAnUnfinishedLastLineFirst) {
  WriteFile(kFile, "a=1");
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "b", "2", 0), 0);
  EXPECT_EQ(ReadFile(kFile), "a=1\nb=2\n");
}

TEST_F(KlibcKeyValueFile, SetKeepsCrLfEndings) {
  WriteFile(kFile, "a=1\r\nb=2\r\n");
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "a", "one", 0), 0);
  EXPECT_EQ(ReadFile(kFile), "a=one\r\nb=2\r\n");
}

TEST_F(KlibcKeyValueFile, SetRoundTripsValuesThatNeedQuotes) {
  WriteFile(kFile, "");
  const Strings values = {"  lead", "trail\t",   " both ", "\"quoted\"",
                          "\"",     "a = b # c", "",       "x\"y"};
  for (const std::string &value : values) {
    ASSERT_EQ(KLIBCFileSetKeyValue(kFile, "k", value.c_str(), 0), 0) << value;
    EXPECT_EQ(Get(kFile, "k"), (Result{static_cast<int>(value.size()), value}));
  }
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "k", "  lead", 0), 0);
  EXPECT_EQ(ReadFile(kFile), "k=\"  lead\"\n");
  ExpectNoError();
}

TEST_F(KlibcKeyValueFile, SetKeepsTheFileMode) {
  WriteFile(kFile, "a=1\n", 0600);
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "a", "2", 0), 0);
  EXPECT_EQ(ModeOf(kFile), 0600u);
  WriteFile(kFile, "a=1\n", 0751);
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "a", "2", 0), 0);
  EXPECT_EQ(ModeOf(kFile), 0751u);
}

TEST_F(KlibcKeyValueFile, SetKeepsAnotherUsersOwnership) {
  WriteFile(kFile, "a=1\n", 0640);
  ASSERT_EQ(chown(kFile, 65534, 65534), 0);
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "a", "2", 0), 0);
  struct stat status {};
  ASSERT_EQ(stat(kFile, &status), 0);
  EXPECT_EQ(status.st_uid, 65534u);
  EXPECT_EQ(status.st_gid, 65534u);
  EXPECT_EQ(status.st_mode & 07777, 0640u);
  EXPECT_EQ(ReadFile(kFile), "a=2\n");
}

TEST_F(KlibcKeyValueFile, SetLeavesNoTemporaryFiles) {
  WriteFile(kFile, "a=1\n");
  ASSERT_EQ(KLIBCFileSetKeyValue(kFile, "a", "2", 0), 0);
  ASSERT_EQ(KLIBCFileSetKeyValue(kFile, "b", "3", 0), 0);
  EXPECT_EQ(FolderEntries("/tmp/klibc"),
            (std::set<std::string>{"settings.conf"}));
}

TEST_F(KlibcKeyValueFile, SetWritesThroughASymbolicLink) {
  WriteFile("/tmp/klibc/real.conf", "a=1\n", 0640);
  ASSERT_EQ(symlink("real.conf", "/tmp/klibc/link.conf"), 0);
  EXPECT_EQ(KLIBCFileSetKeyValue("/tmp/klibc/link.conf", "a", "2", 0), 0);
  struct stat status {};
  ASSERT_EQ(lstat("/tmp/klibc/link.conf", &status), 0);
  EXPECT_TRUE(S_ISLNK(status.st_mode));
  EXPECT_EQ(ReadFile("/tmp/klibc/real.conf"), "a=2\n");
  EXPECT_EQ(ModeOf("/tmp/klibc/real.conf"), 0640u);
}

TEST_F(KlibcKeyValueFile, SetRejectsBadArguments) {
  WriteFile(kFile, "a=1\n");
  const char *const badKeys[] = {"",    "a=b", "a\nb", " a",
                                 "a\t", "#a",  ";a",   "[a]"};
  for (const char *key : badKeys) {
    ClearError();
    EXPECT_EQ(KLIBCFileSetKeyValue(kFile, key, "v", 0), -1) << key;
    ExpectError(KLIBC_ERR_BAD_PARAMETER);
  }
  ClearError();
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "a", "x\ny", 0), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "a", "x\ry", 0), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCFileSetKeyValue(nullptr, "a", "v", 0), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, nullptr, "v", 0), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "a", nullptr, 0), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "a", "v", 2), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCFileSetKeyValue("/tmp/klibc/", "a", "v", 0), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  EXPECT_EQ(ReadFile(kFile), "a=1\n");
}

TEST_F(KlibcKeyValueFile, SetIntoAMissingFolderFails) {
  EXPECT_EQ(KLIBCFileSetKeyValue("/tmp/klibc/none/x.conf", "a", "1", 0), -1);
  ExpectError(KLIBC_ERR_FILE_WRITE);
  EXPECT_FALSE(fs::exists("/tmp/klibc/none"));
}

TEST_F(KlibcKeyValueFile, SetDoesNotReplaceAnUnreadableFile) {
  WriteFile("/tmp/klibc/folder/inner", "");
  EXPECT_EQ(KLIBCFileSetKeyValue("/tmp/klibc/folder", "a", "1", 0), -1);
  ExpectError(KLIBC_ERR_FILE_OPEN);
  EXPECT_TRUE(fs::is_directory("/tmp/klibc/folder"));
}

// Mounts a file system for one test and takes it away again.
class ScopedMount {
public:
  explicit ScopedMount(const std::string &target) : mTarget(target) {}
  ~ScopedMount() { umount2(mTarget.c_str(), MNT_DETACH); }
  ScopedMount(const ScopedMount &) = delete;
  ScopedMount &operator=(const ScopedMount &) = delete;

private:
  std::string mTarget;
};

TEST_F(KlibcKeyValueFile, SetInAReadOnlyFolderKeepsTheOldContent) {
  const std::string folder = "/tmp/klibc/ro";
  const std::string file = folder + "/settings.conf";
  WriteFile(file, "a=1\nb=2\n");
  ASSERT_EQ(mount(folder.c_str(), folder.c_str(), nullptr, MS_BIND, nullptr),
            0);
  ScopedMount unmount(folder);
  ASSERT_EQ(mount(nullptr, folder.c_str(), nullptr,
                  MS_REMOUNT | MS_BIND | MS_RDONLY, nullptr),
            0);
  EXPECT_EQ(KLIBCFileSetKeyValue(file.c_str(), "a", "changed", 0), -1);
  ExpectError(KLIBC_ERR_FILE_WRITE);
  EXPECT_EQ(ReadFile(file), "a=1\nb=2\n");
  EXPECT_EQ(FolderEntries(folder), (std::set<std::string>{"settings.conf"}));
}

TEST_F(KlibcKeyValueFile, SetOnAFullFileSystemKeepsTheOldContent) {
  const std::string folder = "/tmp/klibc/small";
  const std::string file = folder + "/settings.conf";
  fs::create_directories(folder);
  ASSERT_EQ(mount("klibc-test", folder.c_str(), "tmpfs", 0, "size=64k"), 0);
  ScopedMount unmount(folder);
  WriteFile(file, "a=1\nb=2\n", 0600);
  const std::string huge(256 * 1024, 'v');
  EXPECT_EQ(KLIBCFileSetKeyValue(file.c_str(), "a", huge.c_str(), 0), -1);
  ExpectError(KLIBC_ERR_FILE_WRITE);
  EXPECT_EQ(ReadFile(file), "a=1\nb=2\n");
  EXPECT_EQ(ModeOf(file.c_str()), 0600u);
  EXPECT_EQ(FolderEntries(folder), (std::set<std::string>{"settings.conf"}));
}

TEST_F(KlibcKeyValueFile, SetRefusesToGrowAFilePastTheSizeLimit) {
  std::string big(std::size_t{4} << 20, '#');
  big.back() = '\n';
  WriteFile(kFile, big);
  EXPECT_EQ(KLIBCFileSetKeyValue(kFile, "a", "1", 0), -1);
  ExpectError(KLIBC_ERR_TOO_LARGE);
  EXPECT_EQ(ReadFile(kFile).size(), big.size());
}

TEST_F(KlibcKeyValueFile, EnumSectionAppendsNamesInFileOrder) {
  WriteFile(kFile, "top=1\n[web]\na=1\n[ ssh ]\n[admin]\n# [hidden]\n[web]\n");
  SzListPtr list = MakeList();
  ASSERT_EQ(KLIBCSzListPush(ListSlot(list), "existing"), 0);
  EXPECT_EQ(KLIBCFileEnumSection(kFile, ListSlot(list)), 3);
  EXPECT_EQ(Items(list.get()), (Strings{"existing", "web", "ssh", "admin"}));
  ExpectNoError();
}

TEST_F(KlibcKeyValueFile, EnumSectionGrowsTheList) {
  std::string text;
  Strings expected;
  for (int i = 0; i < 50; ++i) {
    expected.push_back("section" + std::to_string(i));
    text += "[" + expected.back() + "]\nport=" + std::to_string(i) + "\n";
  }
  WriteFile(kFile, text);
  SzListPtr list = MakeList(1);
  EXPECT_EQ(KLIBCFileEnumSection(kFile, ListSlot(list)), 50);
  EXPECT_EQ(Items(list.get()), expected);
}

TEST_F(KlibcKeyValueFile, EnumSectionOfAFileWithoutSectionsIsZero) {
  WriteFile(kFile, "a=1\n");
  SzListPtr list = MakeList();
  EXPECT_EQ(KLIBCFileEnumSection(kFile, ListSlot(list)), 0);
  EXPECT_EQ(list->nItem, 0);
  ExpectNoError();
}

TEST_F(KlibcKeyValueFile, EnumSectionOfAMissingFileFails) {
  SzListPtr list = MakeList();
  EXPECT_EQ(KLIBCFileEnumSection("/tmp/klibc/none.sc", ListSlot(list)), -1);
  ExpectError(KLIBC_ERR_FILE_NOT_FOUND);
  EXPECT_EQ(list->nItem, 0);
}

TEST_F(KlibcKeyValueFile, EnumSectionRejectsNullArguments) {
  WriteFile(kFile, "[a]\n");
  SzListPtr list = MakeList();
  KLIBSZLIST *none = nullptr;
  EXPECT_EQ(KLIBCFileEnumSection(nullptr, ListSlot(list)), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCFileEnumSection(kFile, nullptr), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
  ClearError();
  EXPECT_EQ(KLIBCFileEnumSection(kFile, &none), -1);
  ExpectError(KLIBC_ERR_BAD_PARAMETER);
}

} // namespace
} // namespace zark::test
