// ReadMethodTable: the walk to the end row and the checks of every row.
#include "module_table.h"

#include <gtest/gtest.h>

#include <array>
#include <string>
#include <vector>

namespace zark::host {
namespace {

void Answer(ZARK::APIRequest *, ZARK::APIResponse *response) {
  response->SetSuccess();
}
void Other(ZARK::APIRequest *, ZARK::APIResponse *) {}

constexpr ZARK_API_TABLE kEnd = {nullptr, 0, nullptr, nullptr};

struct Walk {
  bool ok = false;
  std::vector<MethodRow> rows;
  std::string reason;
};

Walk Read(const ZARK_API_TABLE *table,
          std::span<const MemoryRange> readable = {}) {
  Walk walk;
  walk.ok = ReadMethodTable(table, readable, walk.rows, walk.reason);
  return walk;
}

TEST(HostMethodTable, ReadsRowsInTableOrder) {
  const ZARK_API_TABLE table[] = {
      {"A.B", 1, "get", Answer},
      {"A.B", 2, "get", Other},
      {"A.C", 1, "set", Answer},
      kEnd,
  };
  Walk walk = Read(table);
  ASSERT_TRUE(walk.ok) << walk.reason;
  ASSERT_EQ(walk.rows.size(), 3u);
  EXPECT_EQ(walk.rows[0].api, "A.B");
  EXPECT_EQ(walk.rows[0].method, "get");
  EXPECT_EQ(walk.rows[0].version, 1);
  EXPECT_EQ(walk.rows[0].handler, &Answer);
  EXPECT_EQ(walk.rows[1].version, 2);
  EXPECT_EQ(walk.rows[1].handler, &Other);
  EXPECT_EQ(walk.rows[2].api, "A.C");
  EXPECT_EQ(walk.rows[2].method, "set");
}

TEST(HostMethodTable, TableOfOnlyTheEndRowHasNoMethods) {
  const ZARK_API_TABLE table[] = {kEnd};
  Walk walk = Read(table);
  EXPECT_TRUE(walk.ok);
  EXPECT_TRUE(walk.rows.empty());
}

TEST(HostMethodTable, NoTableIsRefused) {
  Walk walk = Read(nullptr);
  EXPECT_FALSE(walk.ok);
  EXPECT_EQ(walk.reason, "GetAPITable returned no table");
}

TEST(HostMethodTable, RowWithoutHandlerIsRefused) {
  const ZARK_API_TABLE table[] = {
      {"A.B", 1, "get", Answer},
      {"A.B", 1, "set", nullptr},
      kEnd,
  };
  Walk walk = Read(table);
  EXPECT_FALSE(walk.ok);
  EXPECT_EQ(walk.reason, "row 2 has no handler");
  EXPECT_TRUE(walk.rows.empty());
}

TEST(HostMethodTable, RowWithoutNamesIsRefused) {
  const ZARK_API_TABLE noApi[] = {{nullptr, 1, "get", Answer}, kEnd};
  EXPECT_EQ(Read(noApi).reason, "row 1 has no API name");
  const ZARK_API_TABLE noMethod[] = {
      {"A.B", 1, "get", Answer}, {"A.B", 1, nullptr, Answer}, kEnd};
  EXPECT_EQ(Read(noMethod).reason, "row 2 has no method name");
}

TEST(HostMethodTable, VersionBelowOneIsRefused) {
  const ZARK_API_TABLE zero[] = {{"A.B", 0, "get", Answer}, kEnd};
  Walk walk = Read(zero);
  EXPECT_FALSE(walk.ok);
  EXPECT_EQ(walk.reason, "row 1 has version 0 (below 1)");
  const ZARK_API_TABLE negative[] = {{"A.B", -3, "get", Answer}, kEnd};
  EXPECT_EQ(Read(negative).reason, "row 1 has version -3 (below 1)");
}

TEST(HostMethodTable, BadNamesAreRefused) {
  const ZARK_API_TABLE space[] = {{"A B", 1, "get", Answer}, kEnd};
  EXPECT_EQ(Read(space).reason, "row 1 has a bad API name");
  const ZARK_API_TABLE empty[] = {{"A.B", 1, "", Answer}, kEnd};
  EXPECT_EQ(Read(empty).reason, "row 1 has a bad method name");
  const std::string longName(kMaxNameLength + 1, 'x');
  const ZARK_API_TABLE tooLong[] = {{longName.c_str(), 1, "get", Answer}, kEnd};
  EXPECT_EQ(Read(tooLong).reason, "row 1 has a bad API name");
  const std::string longest(kMaxNameLength, 'x');
  const ZARK_API_TABLE fits[] = {{longest.c_str(), 1, "get", Answer}, kEnd};
  EXPECT_TRUE(Read(fits).ok);
}

TEST(HostMethodTable, RepeatedApiMethodVersionIsRefused) {
  const ZARK_API_TABLE table[] = {
      {"A.B", 1, "get", Answer},
      {"A.B", 2, "get", Answer},
      {"A.B", 1, "get", Other},
      kEnd,
  };
  Walk walk = Read(table);
  EXPECT_FALSE(walk.ok);
  EXPECT_EQ(walk.reason, "row 3 repeats A.B get version 1");
}

// The end row must come within kMaxTableRows rows, itself included.
TEST(HostMethodTable, EndRowMustComeWithinTheBound) {
  static std::array<ZARK_API_TABLE, kMaxTableRows + 1> table{};
  for (std::size_t i = 0; i + 1 < kMaxTableRows; ++i) {
    table[i] = {"A.B", static_cast<int32_t>(i + 1), "get", Answer};
  }
  table[kMaxTableRows - 1] = kEnd;
  Walk fits = Read(table.data());
  EXPECT_TRUE(fits.ok) << fits.reason;
  EXPECT_EQ(fits.rows.size(), kMaxTableRows - 1);

  table[kMaxTableRows - 1] = {"A.B", static_cast<int32_t>(kMaxTableRows), "get",
                              Answer};
  table[kMaxTableRows] = kEnd;
  Walk beyond = Read(table.data());
  EXPECT_FALSE(beyond.ok);
  EXPECT_EQ(beyond.reason, "no end row within 4096 rows");
}

TEST(HostMethodTable, RowsOutsideTheReadableRangeAreNotRead) {
  const ZARK_API_TABLE table[] = {
      {"A.B", 1, "get", Answer},
      {"A.B", 1, "set", Answer},
      kEnd,
  };
  auto begin = reinterpret_cast<std::uintptr_t>(&table[0]);
  const MemoryRange firstRowOnly[] = {{begin, begin + sizeof(table[0])}};
  Walk walk = Read(table, firstRowOnly);
  EXPECT_FALSE(walk.ok);
  EXPECT_EQ(walk.reason, "row 2 lies outside the module");

  const MemoryRange whole[] = {{begin, begin + sizeof(table)}};
  EXPECT_TRUE(Read(table, whole).ok);
}

} // namespace
} // namespace zark::host
