// klibc::ReplaceFile, the one atomic file replacement of the platform
// libraries and the host. Runs in the private mount namespace (/tmp is a
// fresh tmpfs).
#include "hermetic.h"
#include "klibc_replace.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <set>
#include <string>

namespace zark::test {
namespace {

namespace fs = std::filesystem;
using klibc::FileWasReplaced;
using klibc::ReplaceFile;
using klibc::ReplaceOptions;
using klibc::ReplaceStep;
using klibc::TempName;

constexpr const char *kFolder = "/tmp/replace";
constexpr const char *kFile = "/tmp/replace/state.json";

std::set<std::string> Names(const char *folder) {
  std::set<std::string> names;
  for (const auto &entry : fs::directory_iterator(folder)) {
    names.insert(entry.path().filename().string());
  }
  return names;
}

mode_t ModeOf(const char *path) {
  struct stat status {};
  EXPECT_EQ(stat(path, &status), 0) << path;
  return status.st_mode & 07777;
}

class KlibcReplaceFile : public ::testing::Test {
protected:
  void SetUp() override {
    ResetFixedPaths();
    fs::create_directories(kFolder);
  }
};

TEST_F(KlibcReplaceFile, WritesANewFileWithTheMode) {
  ReplaceOptions options;
  options.mode = 0640;
  EXPECT_EQ(ReplaceFile(kFile, "new\n", options), std::nullopt);
  EXPECT_EQ(ReadFile(kFile), "new\n");
  EXPECT_EQ(ModeOf(kFile), 0640U);
  // No temporary file is left behind.
  EXPECT_EQ(Names(kFolder), std::set<std::string>{"state.json"});
}

TEST_F(KlibcReplaceFile, ReplacesAnOldFileWhole) {
  WriteFile(kFile, "old content that is longer\n", 0600);
  ReplaceOptions options;
  options.mode = 0644;
  EXPECT_EQ(ReplaceFile(kFile, "short\n", options), std::nullopt);
  EXPECT_EQ(ReadFile(kFile), "short\n");
  EXPECT_EQ(ModeOf(kFile), 0644U);
}

TEST_F(KlibcReplaceFile, EveryTempNameAndFlushChoiceGivesTheSameFile) {
  for (const TempName name :
       {TempName::kHiddenInFolder, TempName::kBesidePath}) {
    for (const bool flush : {true, false}) {
      ReplaceOptions options;
      options.tempName = name;
      options.flush = flush;
      const std::string content = "flush=" + std::to_string(flush);
      EXPECT_EQ(ReplaceFile(kFile, content, options), std::nullopt);
      EXPECT_EQ(ReadFile(kFile), content);
      EXPECT_EQ(Names(kFolder), std::set<std::string>{"state.json"});
    }
  }
}

TEST_F(KlibcReplaceFile, ASymlinkAtThePathIsReplacedNotFollowed) {
  const std::string target = std::string(kFolder) + "/target";
  WriteFile(target, "target\n");
  ASSERT_EQ(symlink(target.c_str(), kFile), 0);
  EXPECT_EQ(ReplaceFile(kFile, "mine\n", ReplaceOptions{}), std::nullopt);
  EXPECT_FALSE(fs::is_symlink(kFile));
  EXPECT_EQ(ReadFile(kFile), "mine\n");
  EXPECT_EQ(ReadFile(target), "target\n");
}

TEST_F(KlibcReplaceFile, AMissingFolderFailsAtTheTemporaryFile) {
  const std::optional<klibc::ReplaceFailure> failure =
      ReplaceFile("/tmp/absent/file", "x", ReplaceOptions{});
  ASSERT_TRUE(failure.has_value());
  EXPECT_EQ(failure->step, ReplaceStep::kCreateTemp);
  EXPECT_EQ(failure->error, ENOENT);
  EXPECT_EQ(failure->folder, "/tmp/absent");
  EXPECT_EQ(failure->tempPath.rfind("/tmp/absent/.file.", 0), 0U)
      << failure->tempPath;
  EXPECT_FALSE(FileWasReplaced(failure));
}

TEST_F(KlibcReplaceFile, TheTempNameFollowsTheOption) {
  ReplaceOptions options;
  options.tempName = TempName::kBesidePath;
  const std::optional<klibc::ReplaceFailure> failure =
      ReplaceFile("/tmp/absent/file", "x", options);
  ASSERT_TRUE(failure.has_value());
  EXPECT_EQ(failure->tempPath.rfind("/tmp/absent/file.", 0), 0U)
      << failure->tempPath;
}

TEST_F(KlibcReplaceFile, AFolderAtThePathFailsAtTheRenameAndCleansUp) {
  fs::create_directories(kFile);
  const std::optional<klibc::ReplaceFailure> failure =
      ReplaceFile(kFile, "x", ReplaceOptions{});
  ASSERT_TRUE(failure.has_value());
  EXPECT_EQ(failure->step, ReplaceStep::kRename);
  EXPECT_EQ(failure->error, EISDIR);
  EXPECT_FALSE(FileWasReplaced(failure));
  EXPECT_TRUE(fs::is_directory(kFile));
  // The temporary file was removed again.
  EXPECT_EQ(Names(kFolder), std::set<std::string>{"state.json"});
}

TEST(KlibcFileWasReplaced, OnlySuccessAndFolderStepsCount) {
  EXPECT_TRUE(FileWasReplaced(std::nullopt));
  for (const ReplaceStep step :
       {ReplaceStep::kCreateTemp, ReplaceStep::kSetMode, ReplaceStep::kSetOwner,
        ReplaceStep::kWrite, ReplaceStep::kFlush, ReplaceStep::kClose,
        ReplaceStep::kRename}) {
    EXPECT_FALSE(FileWasReplaced(klibc::ReplaceFailure{step, EIO, "", ""}));
  }
  EXPECT_TRUE(FileWasReplaced(
      klibc::ReplaceFailure{ReplaceStep::kOpenFolder, EACCES, "", ""}));
  EXPECT_TRUE(FileWasReplaced(
      klibc::ReplaceFailure{ReplaceStep::kFlushFolder, EIO, "", ""}));
}

} // namespace
} // namespace zark::test
