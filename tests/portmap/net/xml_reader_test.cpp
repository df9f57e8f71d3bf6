// The expat reader of router XML (net/xml_reader.h): the events it gives,
// its leniencies and its refusals.
#include "net/igd_description.h"
#include "net/xml_reader.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace zark::test {
namespace {

using namespace zark::portmap;

// Writes each event as one line; pieces of text in a row are joined, a
// character reference is marked with brackets.
class EventLog final : public XmlVisitor {
public:
  explicit EventLog(std::string stopAt = "") : mStopAt(std::move(stopAt)) {}

  bool OnStart(std::string_view name, std::size_t depth) override {
    mEvents.push_back("start " + std::string(name) + " " +
                      std::to_string(depth));
    return name != mStopAt;
  }
  bool OnEnd(std::string_view name, std::size_t depth) override {
    mEvents.push_back("end " + std::string(name) + " " + std::to_string(depth));
    return true;
  }
  void OnText(std::string_view text, std::size_t depth,
              bool fromReference) override {
    const std::string piece =
        fromReference ? "[" + std::string(text) + "]" : std::string(text);
    const std::string head = "text " + std::to_string(depth) + " ";
    if (!mEvents.empty() && mEvents.back().starts_with(head)) {
      mEvents.back() += piece;
    } else {
      mEvents.push_back(head + piece);
    }
  }

  std::vector<std::string> mEvents;

private:
  std::string mStopAt;
};

constexpr XmlLimits kLimits{.maxBytes = 4096, .maxDepth = 8};

TEST(DetectXmlReader, ElementsComeWithoutPrefixAndTextDecoded) {
  EventLog log;
  EXPECT_EQ(XmlEnd::kComplete,
            ReadXml("<?xml version=\"1.0\"?>\n"
                    "<u:root xmlns:u=\"urn:x\"><u:b a='>'>t&amp;u"
                    "<![CDATA[<v>]]>&#46;</u:b><c/></u:root>",
                    log, kLimits));
  EXPECT_EQ((std::vector<std::string>{"start root 1", "start b 2",
                                      "text 2 t&u<v>[.]", "end b 2",
                                      "start c 2", "end c 2", "end root 1"}),
            log.mEvents);
}

TEST(DetectXmlReader, RouterLeniencies) {
  EventLog log;
  // A control character, an HTML entity nobody declared, a character
  // beyond ASCII written as a reference.
  EXPECT_EQ(XmlEnd::kComplete, ReadXml("<a>A\x01"
                                       "B&nbsp;&#x263A;</a>",
                                       log, kLimits));
  EXPECT_EQ((std::vector<std::string>{"start a 1", "text 1 A B&nbsp;[\u263A]",
                                      "end a 1"}),
            log.mEvents);

  // An encoding expat does not know: ASCII still reads.
  EventLog unknown;
  EXPECT_EQ(XmlEnd::kComplete,
            ReadXml("<?xml version=\"1.0\" encoding=\"gb2312\"?>"
                    "<a>AB\xC4\xE3</a>",
                    unknown, kLimits));
  EXPECT_EQ((std::vector<std::string>{"start a 1", "text 1 AB\uFFFD\uFFFD",
                                      "end a 1"}),
            unknown.mEvents);
}

TEST(DetectXmlReader, ADoctypeIsRefusedBeforeAnyEntityExpands) {
  std::string laughs =
      "<?xml version=\"1.0\"?><!DOCTYPE a [<!ENTITY l0 \"ha\">";
  for (int i = 1; i < 10; ++i) {
    const std::string previous = "&l" + std::to_string(i - 1) + ";";
    laughs += "<!ENTITY l" + std::to_string(i) + " \"" + previous + previous +
              previous + previous + previous + previous + previous + previous +
              previous + previous + "\">";
  }
  laughs += "]><a>&l9;</a>";
  EventLog log;
  EXPECT_EQ(XmlEnd::kRefused, ReadXml(laughs, log, kLimits));
  EXPECT_TRUE(log.mEvents.empty());

  EventLog plain;
  EXPECT_EQ(XmlEnd::kRefused, ReadXml("<!DOCTYPE a><a>x</a>", plain, kLimits));
  EXPECT_TRUE(plain.mEvents.empty());
}

TEST(DetectXmlReader, NestingAndSizeAreBounded) {
  EventLog log;
  EXPECT_EQ(XmlEnd::kRefused,
            ReadXml("<a><b><c>x</c></b></a>", log,
                    XmlLimits{.maxBytes = 4096, .maxDepth = 2}));
  EXPECT_EQ((std::vector<std::string>{"start a 1", "start b 2"}), log.mEvents);

  EventLog big;
  const std::string text = "<a>" + std::string(100, 'x') + "</a>";
  EXPECT_EQ(XmlEnd::kRefused,
            ReadXml(text, big,
                    XmlLimits{.maxBytes = text.size() - 1, .maxDepth = 8}));
  EXPECT_TRUE(big.mEvents.empty());
  EXPECT_EQ(
      XmlEnd::kComplete,
      ReadXml(text, big, XmlLimits{.maxBytes = text.size(), .maxDepth = 8}));
}

TEST(DetectXmlReader, MalformedTextEndsAtTheFault) {
  EventLog log;
  EXPECT_EQ(XmlEnd::kMalformed, ReadXml("<a><b>x</a><c/>", log, kLimits));
  EXPECT_EQ((std::vector<std::string>{"start a 1", "start b 2", "text 2 x"}),
            log.mEvents);

  EventLog empty;
  EXPECT_EQ(XmlEnd::kMalformed, ReadXml("", empty, kLimits));
  EXPECT_EQ(XmlEnd::kMalformed, ReadXml("manufacturer=Acme", empty, kLimits));
  EXPECT_TRUE(empty.mEvents.empty());
}

TEST(DetectXmlReader, TheVisitorStopsTheReading) {
  EventLog log("b");
  EXPECT_EQ(XmlEnd::kStopped, ReadXml("<a><b/><c/></a>", log, kLimits));
  EXPECT_EQ((std::vector<std::string>{"start a 1", "start b 2"}), log.mEvents);
}

TEST(DetectXmlReader, RootDescriptionsWithADoctypeOrTooDeepNameLessOrNothing) {
  EXPECT_EQ(IgdIdentity{}, ParseIgdIdentity("<!DOCTYPE root><root><device>"
                                            "<manufacturer>Acme</manufacturer>"
                                            "</device></root>"));
  // The names before the 65th level are kept.
  std::string deep = "<root><device><manufacturer>Acme</manufacturer>";
  for (int i = 0; i < 100; ++i) {
    deep += "<x>";
  }
  EXPECT_EQ((IgdIdentity{"Acme", "", ""}), ParseIgdIdentity(deep));
  // A cut that falls just after a blank leaves none at the end.
  const IgdIdentity cut = ParseIgdIdentity(
      "<root><device><modelName>" + std::string(kMaxIdentityText - 1, 'n') +
      " tail</modelName></device></root>");
  EXPECT_EQ(std::string(kMaxIdentityText - 1, 'n'), cut.modelName);
}

} // namespace
} // namespace zark::test
