// The small helpers of klibc's public C++ headers that the other libraries,
// the host and the probe share: Trim and its blank sets, WriteAll,
// RandomHex and UniqueFd.
#include "klibc_fd.h"
#include "klibc_file.h"
#include "klibc_text.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <csignal>
#include <string>

namespace {

using zark::klibc::kBlanksButLineFeed;
using zark::klibc::kSpaceAndTab;
using zark::klibc::kSpaceTabAndCr;
using zark::klibc::kWhiteSpace;
using zark::klibc::RandomHex;
using zark::klibc::Trim;
using zark::klibc::UniqueFd;
using zark::klibc::WriteAll;

TEST(KlibcTrim, CutsOnlyTheGivenBlanksAtBothEnds) {
  EXPECT_EQ(Trim("  a b\t", kSpaceAndTab), "a b");
  EXPECT_EQ(Trim("a", kSpaceAndTab), "a");
  EXPECT_EQ(Trim("", kSpaceAndTab), "");
  EXPECT_EQ(Trim(" \t \t", kSpaceAndTab), "");
  // Blanks inside are kept.
  EXPECT_EQ(Trim(" a \t b ", kSpaceAndTab), "a \t b");
}

TEST(KlibcTrim, EachSetKeepsWhatItDoesNotName) {
  // A list item or header value: CR and LF stay.
  EXPECT_EQ(Trim(" x\r\n", kSpaceAndTab), "x\r\n");
  // A datagram line: CR goes, LF stays.
  EXPECT_EQ(Trim("\r x \r", kSpaceTabAndCr), "x");
  EXPECT_EQ(Trim(" x\n", kSpaceTabAndCr), "x\n");
  // A key/value line: every blank but the line feed goes.
  EXPECT_EQ(Trim("\f\v\r\t x \t\r\v\f", kBlanksButLineFeed), "x");
  EXPECT_EQ(Trim("\nx\n", kBlanksButLineFeed), "\nx\n");
  // All white space.
  EXPECT_EQ(Trim("\n\r\t\v\f x\n\r\t\v\f ", kWhiteSpace), "x");
}

TEST(KlibcTrim, PointsIntoItsInput) {
  const std::string text = "  key  ";
  const std::string_view trimmed = Trim(text, kSpaceAndTab);
  EXPECT_EQ(trimmed.data(), text.data() + 2);
  EXPECT_EQ(trimmed.size(), 3U);
}

TEST(KlibcWriteAll, WritesEverythingThroughAPipe) {
  int ends[2];
  ASSERT_EQ(pipe2(ends, O_CLOEXEC), 0);
  UniqueFd readEnd(ends[0]);
  UniqueFd writeEnd(ends[1]);
  // Less than the 64 KiB a pipe holds, so no reader is needed meanwhile.
  const std::string data(40000, 'z');
  ASSERT_TRUE(WriteAll(writeEnd.Get(), data));
  ASSERT_TRUE(writeEnd.Close());
  std::string got;
  char buffer[8192];
  for (;;) {
    const ssize_t n = read(readEnd.Get(), buffer, sizeof buffer);
    ASSERT_GE(n, 0);
    if (n == 0) {
      break;
    }
    got.append(buffer, static_cast<std::size_t>(n));
  }
  EXPECT_EQ(got, data);
}

TEST(KlibcWriteAll, EmptyDataWritesNothingAndSucceeds) {
  EXPECT_TRUE(WriteAll(-1, ""));
}

TEST(KlibcWriteAll, FailsWithErrnoOnABadDescriptor) {
  errno = 0;
  EXPECT_FALSE(WriteAll(-1, "x"));
  EXPECT_EQ(errno, EBADF);
}

TEST(KlibcWriteAll, FailsWithEpipeWhenNobodyReads) {
  int ends[2];
  ASSERT_EQ(pipe2(ends, O_CLOEXEC), 0);
  UniqueFd writeEnd(ends[1]);
  ASSERT_EQ(close(ends[0]), 0);
  struct sigaction ignore {};
  struct sigaction previous {};
  ignore.sa_handler = SIG_IGN;
  ASSERT_EQ(sigaction(SIGPIPE, &ignore, &previous), 0);
  errno = 0;
  EXPECT_FALSE(WriteAll(writeEnd.Get(), "lost"));
  EXPECT_EQ(errno, EPIPE);
  ASSERT_EQ(sigaction(SIGPIPE, &previous, nullptr), 0);
}

TEST(KlibcRandomHex, GivesTwoLowerCaseDigitsPerByte) {
  for (const std::size_t bytes :
       {std::size_t{0}, std::size_t{1}, std::size_t{8}, std::size_t{16},
        std::size_t{300}}) {
    const std::optional<std::string> hex = RandomHex(bytes);
    ASSERT_TRUE(hex.has_value());
    EXPECT_EQ(hex->size(), 2 * bytes);
    for (const char c : *hex) {
      EXPECT_TRUE((c >= '0' && c <= '9') || (c >= 'a' && c <= 'f')) << c;
    }
  }
}

TEST(KlibcRandomHex, TwoTokensDiffer) {
  // 128 random bits each: equal only if the source were broken.
  const std::optional<std::string> first = RandomHex(16);
  const std::optional<std::string> second = RandomHex(16);
  ASSERT_TRUE(first && second);
  EXPECT_NE(*first, *second);
}

bool IsOpen(int fd) {
  return fcntl(fd, F_GETFD) != -1;
}

TEST(KlibcUniqueFd, ClosesWhenItGoesAway) {
  int fd = -1;
  {
    UniqueFd owner(open("/dev/null", O_RDONLY | O_CLOEXEC));
    ASSERT_TRUE(owner.Valid());
    fd = owner.Get();
    EXPECT_TRUE(IsOpen(fd));
  }
  EXPECT_FALSE(IsOpen(fd));
}

TEST(KlibcUniqueFd, MovesReleasesAndResets) {
  UniqueFd empty;
  EXPECT_FALSE(empty.Valid());
  EXPECT_EQ(empty.Get(), -1);
  EXPECT_TRUE(empty.Close()); // nothing held

  UniqueFd first(open("/dev/null", O_RDONLY | O_CLOEXEC));
  const int fd = first.Get();
  UniqueFd second(std::move(first));
  EXPECT_FALSE(first.Valid()); // NOLINT(bugprone-use-after-move)
  EXPECT_EQ(second.Get(), fd);

  UniqueFd third;
  third = std::move(second);
  EXPECT_EQ(third.Get(), fd);
  EXPECT_TRUE(IsOpen(fd));

  const int released = third.Release();
  EXPECT_EQ(released, fd);
  EXPECT_FALSE(third.Valid());
  EXPECT_TRUE(IsOpen(fd)); // the caller owns it now
  third.Reset(released);
  EXPECT_TRUE(third.Close());
  EXPECT_FALSE(third.Valid());
  EXPECT_FALSE(IsOpen(fd));
}

TEST(KlibcUniqueFd, CloseReportsAFailedClose) {
  // A number that is no open descriptor: close() fails with EBADF.
  UniqueFd bogus(100000);
  errno = 0;
  EXPECT_FALSE(bogus.Close());
  EXPECT_EQ(errno, EBADF);
  EXPECT_FALSE(bogus.Valid());
}

} // namespace
