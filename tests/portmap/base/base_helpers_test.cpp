// The library's shared helpers in base/: the record field reader and
// writer, and the strict JSON reader every document of the library goes
// through.
#include "base/record_text.h"
#include "base/strict_json.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>

namespace {

using zark::portmap::CopyText;
using zark::portmap::Field;
using zark::portmap::ParseStrictJson;
using zark::portmap::ParseStrictJsonOrThrow;

TEST(PortMapRecordText, FieldStopsAtTheFirstNul) {
  char field[8] = {'a', 'b', '\0', 'c', 'd', '\0', '\0', '\0'};
  EXPECT_EQ(Field(field), "ab");
  char empty[4] = {};
  EXPECT_EQ(Field(empty), "");
}

TEST(PortMapRecordText, FieldWithoutNulIsWholeArray) {
  // A caller that filled every byte: read no further than the array.
  char field[4] = {'w', 'x', 'y', 'z'};
  EXPECT_EQ(Field(field), "wxyz");
  EXPECT_EQ(Field(field).data(), field);
}

TEST(PortMapRecordText, CopyTextTerminatesAndCuts) {
  char field[5];
  std::memset(field, '#', sizeof field);
  CopyText(field, "ab");
  EXPECT_EQ(Field(field), "ab");
  // The bytes after the NUL are left as they were.
  EXPECT_EQ(field[3], '#');
  EXPECT_EQ(field[4], '#');

  CopyText(field, "abcdefgh");
  EXPECT_EQ(Field(field), "abcd");
  EXPECT_EQ(field[4], '\0');

  CopyText(field, "");
  EXPECT_EQ(Field(field), "");
}

TEST(PortMapStrictJson, ReadsOneStrictDocument) {
  Json::Value root;
  std::string why;
  ASSERT_TRUE(
      ParseStrictJsonOrThrow(R"({"a": [1, 2], "b": "x"})", root, why, 16));
  EXPECT_EQ(root["a"][1].asInt(), 2);
  EXPECT_EQ(root["b"].asString(), "x");
  EXPECT_TRUE(why.empty());
}

TEST(PortMapStrictJson, RefusesWhatRfc8259DoesNotAllow) {
  for (const char *text :
       {R"({"a": 1,})", R"({"a": 1} x)", R"({"a": 1, "a": 2})", "// note\n{}",
        "{'a': 1}", ""}) {
    Json::Value root(7);
    std::string why;
    EXPECT_FALSE(ParseStrictJsonOrThrow(text, root, why, 16)) << text;
    EXPECT_EQ(why.rfind("not valid JSON: ", 0), 0U) << why;
    // root is left as it was.
    EXPECT_EQ(root, Json::Value(7)) << text;
    why.clear();
    EXPECT_FALSE(ParseStrictJson(text, root, why)) << text;
    EXPECT_EQ(why.rfind("not valid JSON: ", 0), 0U) << why;
  }
}

TEST(PortMapStrictJson, TooDeepThrowsOrIsRefused) {
  const std::string deep = std::string(10, '[') + std::string(10, ']');
  Json::Value root;
  std::string why;
  EXPECT_TRUE(ParseStrictJsonOrThrow(deep, root, why, 16));
  // The thrown form lets a caller report the depth in its own way ...
  EXPECT_THROW((void)ParseStrictJsonOrThrow(deep, root, why, 4),
               Json::Exception);
  // ... the other turns it into a refusal.
  why.clear();
  EXPECT_FALSE(ParseStrictJson(deep, root, why, 4));
  EXPECT_EQ(why.rfind("not valid JSON: ", 0), 0U) << why;
}

} // namespace
