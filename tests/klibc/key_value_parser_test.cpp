#include "key_value_parser.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace zark::klibc {
namespace {

using Strings = std::vector<std::string>;

// "section|key|value" for every entry, to compare whole parses at once.
Strings Flatten(const KeyValueText &parsed) {
  Strings flat;
  for (const KeyValueEntry &entry : parsed.entries) {
    flat.push_back(entry.section + "|" + entry.key + "|" + entry.value);
  }
  return flat;
}

TEST(KlibcKeyValueParser, EmptyTextHasNothing) {
  const KeyValueText parsed = ParseKeyValueText("");
  EXPECT_TRUE(parsed.sections.empty());
  EXPECT_TRUE(parsed.entries.empty());
}

TEST(KlibcKeyValueParser, KeysBeforeAnySectionHaveAnEmptySection) {
  EXPECT_EQ(Flatten(ParseKeyValueText("a=1\nb=2\n")),
            (Strings{"|a|1", "|b|2"}));
}

TEST(KlibcKeyValueParser, SectionsGroupTheKeysThatFollow) {
  const KeyValueText parsed = ParseKeyValueText("top=0\n"
                                                "[web]\n"
                                                "port=80\n"
                                                "[ ssh ]\n"
                                                "port=22\n");
  EXPECT_EQ(parsed.sections, (Strings{"web", "ssh"}));
  EXPECT_EQ(Flatten(parsed), (Strings{"|top|0", "web|port|80", "ssh|port|22"}));
}

TEST(KlibcKeyValueParser, SectionNamesAreListedOnceInFirstOrder) {
  const KeyValueText parsed =
      ParseKeyValueText("[b]\n[a]\nx=1\n[b]\ny=2\n[c]\n");
  EXPECT_EQ(parsed.sections, (Strings{"b", "a", "c"}));
  EXPECT_EQ(Flatten(parsed), (Strings{"a|x|1", "b|y|2"}));
}

TEST(KlibcKeyValueParser, SectionHeaderIgnoresWhatFollowsTheBracket) {
  EXPECT_EQ(ParseKeyValueText("  [name] ; note\n").sections, (Strings{"name"}));
}

TEST(KlibcKeyValueParser, UnclosedSectionHeaderIsIgnored) {
  const KeyValueText parsed = ParseKeyValueText("[a]\n[broken\nk=v\n");
  EXPECT_EQ(parsed.sections, (Strings{"a"}));
  EXPECT_EQ(Flatten(parsed), (Strings{"a|k|v"}));
}

TEST(KlibcKeyValueParser, EmptySectionNameCounts) {
  EXPECT_EQ(ParseKeyValueText("[]\n[ ]\n").sections, (Strings{""}));
}

TEST(KlibcKeyValueParser, BlanksAroundKeyAndValueAreTrimmed) {
  EXPECT_EQ(Flatten(ParseKeyValueText(" \tname \t= \tMy Server \t\n")),
            (Strings{"|name|My Server"}));
}

TEST(KlibcKeyValueParser, QuotedValueIsKeptExactly) {
  EXPECT_EQ(Flatten(ParseKeyValueText("motd = \"  hi = x # y ; \"\n"
                                      "empty=\"\"\n"
                                      "inner=\"a\"b\"\n")),
            (Strings{"|motd|  hi = x # y ; ", "|empty|", "|inner|a\"b"}));
}

TEST(KlibcKeyValueParser, LoneOrUnbalancedQuotesStay) {
  EXPECT_EQ(Flatten(ParseKeyValueText("a=\"\nb=\"open\nc=close\"\n")),
            (Strings{"|a|\"", "|b|\"open", "|c|close\""}));
}

TEST(KlibcKeyValueParser, ValueKeepsLaterEqualSigns) {
  EXPECT_EQ(Flatten(ParseKeyValueText("url=http://x/?a=1&b=2\n")),
            (Strings{"|url|http://x/?a=1&b=2"}));
}

TEST(KlibcKeyValueParser, CommentsAreSkipped) {
  EXPECT_EQ(Flatten(ParseKeyValueText("# a=1\n; b=2\n  # c=3\n\t;d=4\ne=5\n")),
            (Strings{"|e|5"}));
}

TEST(KlibcKeyValueParser, NoInlineComments) {
  EXPECT_EQ(Flatten(ParseKeyValueText("a=1 # one\n")), (Strings{"|a|1 # one"}));
}

TEST(KlibcKeyValueParser, EmptyValue) {
  EXPECT_EQ(Flatten(ParseKeyValueText("a=\nb=   \n")), (Strings{"|a|", "|b|"}));
}

TEST(KlibcKeyValueParser, LinesWithoutKeyOrEqualsAreIgnored) {
  EXPECT_EQ(Flatten(ParseKeyValueText("=value\n  = x\njust text\n\nk=v")),
            (Strings{"|k|v"}));
}

TEST(KlibcKeyValueParser, CrLfLineEndings) {
  const KeyValueText parsed =
      ParseKeyValueText("[s]\r\na = 1\r\nb=\"q \"\r\n\r\nc=3");
  EXPECT_EQ(parsed.sections, (Strings{"s"}));
  EXPECT_EQ(Flatten(parsed), (Strings{"s|a|1", "s|b|q ", "s|c|3"}));
}

TEST(KlibcKeyValueParser, LastLineWithoutNewline) {
  EXPECT_EQ(Flatten(ParseKeyValueText("a=1\nb=2")), (Strings{"|a|1", "|b|2"}));
}

TEST(KlibcKeyValueParser, ByteOrderMarkIsSkipped) {
  EXPECT_EQ(Flatten(ParseKeyValueText("\xEF\xBB\xBF"
                                      "a=1\n")),
            (Strings{"|a|1"}));
}

TEST(KlibcKeyValueParser, KeysAreCaseSensitiveAndAllKept) {
  EXPECT_EQ(Flatten(ParseKeyValueText("Key=1\nkey=2\nkey=3\n")),
            (Strings{"|Key|1", "|key|2", "|key|3"}));
}

TEST(KlibcKeyValueParser, LineOffsetsCoverTheLineWithoutItsEnding) {
  const std::string text = "[s]\r\n  a = 1 \r\nb=2";
  const KeyValueText parsed = ParseKeyValueText(text);
  ASSERT_EQ(parsed.entries.size(), 2u);
  const KeyValueEntry &a = parsed.entries[0];
  EXPECT_EQ(text.substr(a.lineStart, a.lineEnd - a.lineStart), "  a = 1 ");
  const KeyValueEntry &b = parsed.entries[1];
  EXPECT_EQ(text.substr(b.lineStart, b.lineEnd - b.lineStart), "b=2");
  EXPECT_EQ(b.lineEnd, text.size());
}

TEST(KlibcKeyValueParser, EmbeddedNulIsPartOfTheValue) {
  using namespace std::string_literals;
  const KeyValueText parsed = ParseKeyValueText("a=x\0y\nb=2\n"s);
  ASSERT_EQ(parsed.entries.size(), 2u);
  EXPECT_EQ(parsed.entries[0].value, "x\0y"s);
  EXPECT_EQ(parsed.entries[1].value, "2");
}

} // namespace
} // namespace zark::klibc
