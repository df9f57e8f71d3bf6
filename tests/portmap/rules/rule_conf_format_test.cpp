// The rule configuration text: what SerializeRuleConf writes comes back
// unchanged from ParseRuleConf, and anything else is refused as a whole.
#include "rules/rule_conf_format.h"

#include <gtest/gtest.h>
#include <json/json.h>

#include <memory>
#include <ostream>
#include <string>
#include <vector>

namespace {

using zark::portmap::kMaxRuleConfBytes;
using zark::portmap::kMaxRuleConfRules;
using zark::portmap::ParseRuleConf;
using zark::portmap::SerializeRuleConf;

RouterRule Rule(std::string id, bool enable, std::string protocol,
                std::string routerPort, std::string dsPort,
                std::string serviceId = "", std::string serviceName = "") {
  RouterRule rule;
  rule.ruleId = std::move(id);
  rule.enable = enable;
  rule.protocol = std::move(protocol);
  rule.routerPort = std::move(routerPort);
  rule.dsPort = std::move(dsPort);
  rule.serviceId = std::move(serviceId);
  rule.serviceName = std::move(serviceName);
  return rule;
}

void ExpectSameRules(const std::vector<RouterRule> &expected,
                     const std::vector<RouterRule> &actual) {
  ASSERT_EQ(expected.size(), actual.size());
  for (std::size_t i = 0; i < expected.size(); ++i) {
    SCOPED_TRACE("rule " + std::to_string(i));
    EXPECT_EQ(expected[i].ruleId, actual[i].ruleId);
    EXPECT_EQ(expected[i].enable, actual[i].enable);
    EXPECT_EQ(expected[i].protocol, actual[i].protocol);
    EXPECT_EQ(expected[i].routerPort, actual[i].routerPort);
    EXPECT_EQ(expected[i].dsPort, actual[i].dsPort);
    EXPECT_EQ(expected[i].serviceId, actual[i].serviceId);
    EXPECT_EQ(expected[i].serviceName, actual[i].serviceName);
  }
}

// Every byte but NUL, in order, cut into texts that fit a field.
std::vector<std::string> AllBytesTexts() {
  std::string all;
  for (int c = 1; c < 256; ++c) {
    all.push_back(static_cast<char>(c));
  }
  return {all.substr(0, 128), all.substr(127)};
}

std::string OneRuleDocument(const std::string &ruleBody) {
  return "{\"version\": 1, \"rules\": [" + ruleBody + "]}";
}

const char *const kGoodRuleBody =
    R"({"rule_id": "1", "enable": true, "router_protocol": "tcp",
        "router_port": "80", "ds_port": "80", "serviceid": "",
        "service_name": ""})";

TEST(PortMapRuleConfFormat, RoundTripsHostileTexts) {
  std::vector<RouterRule> rules = {
      Rule("plain", true, "tcp", "8080", "80", "web", "Web Station"),
      Rule("\"quoted\" 'single'", false, "udp", "a=b", "==", "x=y", "=\"=\""),
      Rule("line1\nline2\r\n", true, "tcp\n", "\t1,2\n3", "\\n", "\\", "\\\""),
      Rule("[x]", true, "[section]", "{\"json\": 1}", "]", "[", "#;comment"),
      Rule("", false, "", "", "", "", ""),
      Rule(std::string(1023, 'r'), true, std::string(1023, '"'),
           std::string(1023, '='), std::string(1023, '\n'),
           std::string(1023, '\\'), std::string(1023, '\xff')),
      Rule("caf\xc3\xa9 \xe6\x97\xa5\xe6\x9c\xac", true, "tcp", "1", "2",
           "\xf0\x9f\x98\x80", "\xed\xa0\x80 lone surrogate bytes"),
      Rule("\x80\xfe\xff broken utf-8 \xc3", true, "\x01\x02\x1f\x7f", "1", "2",
           "\xe6\x97", "\xc0\xaf"),
  };
  std::vector<std::string> bytes = AllBytesTexts();
  rules.push_back(
      Rule(bytes[0], true, bytes[1], bytes[0], bytes[1], bytes[0], bytes[1]));

  std::string text = SerializeRuleConf(rules);
  auto parsed = ParseRuleConf(text);
  ASSERT_TRUE(parsed.ok) << parsed.error;
  ExpectSameRules(rules, parsed.rules);
}

TEST(PortMapRuleConfFormat, EmptyRuleSetRoundTrips) {
  std::string text = SerializeRuleConf({});
  auto parsed = ParseRuleConf(text);
  ASSERT_TRUE(parsed.ok) << parsed.error;
  EXPECT_TRUE(parsed.rules.empty());
}

TEST(PortMapRuleConfFormat, WritesTheDocumentedJson) {
  std::vector<RouterRule> rules = {
      Rule("7", true, "tcp", "8080", "80", "web", "Web"),
      Rule("svc.udp", false, "udp", "5000-5010", "5000-5010", "svc", "")};
  std::string text = SerializeRuleConf(rules);

  Json::CharReaderBuilder builder;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value root;
  std::string errors;
  ASSERT_TRUE(
      reader->parse(text.data(), text.data() + text.size(), &root, &errors))
      << errors;
  EXPECT_EQ(1, root["version"].asInt());
  ASSERT_TRUE(root["rules"].isArray());
  ASSERT_EQ(2u, root["rules"].size());
  const Json::Value &first = root["rules"][0];
  EXPECT_EQ("7", first["rule_id"].asString());
  EXPECT_TRUE(first["enable"].isBool());
  EXPECT_TRUE(first["enable"].asBool());
  EXPECT_EQ("tcp", first["router_protocol"].asString());
  EXPECT_EQ("8080", first["router_port"].asString());
  EXPECT_EQ("80", first["ds_port"].asString());
  EXPECT_EQ("web", first["serviceid"].asString());
  EXPECT_EQ("Web", first["service_name"].asString());
  EXPECT_FALSE(root["rules"][1]["enable"].asBool());
  EXPECT_EQ("svc.udp", root["rules"][1]["rule_id"].asString());
}

TEST(PortMapRuleConfFormat, ReadsAHandWrittenDocument) {
  auto parsed = ParseRuleConf(R"({
    "rules": [
      {"service_name": "Name", "serviceid": "id", "ds_port": "22",
       "router_port": "2222", "router_protocol": "tcp", "enable": false,
       "rule_id": "a\u00e9\n", "comment": "members we do not know are ignored"}
    ],
    "version": 1,
    "written_by": "someone else"
  })");
  ASSERT_TRUE(parsed.ok) << parsed.error;
  ExpectSameRules(
      {Rule("a\xc3\xa9\n", false, "tcp", "2222", "22", "id", "Name")},
      parsed.rules);
}

struct MalformedCase {
  const char *name;
  std::string text;
};

// Names the case in test listings instead of dumping its (long) text.
void PrintTo(const MalformedCase &c, std::ostream *os) {
  *os << c.name;
}

class PortMapRuleConfFormatMalformed
    : public testing::TestWithParam<MalformedCase> {};

TEST_P(PortMapRuleConfFormatMalformed, IsRefusedAsAWhole) {
  auto parsed = ParseRuleConf(GetParam().text);
  EXPECT_FALSE(parsed.ok);
  EXPECT_TRUE(parsed.rules.empty());
  EXPECT_FALSE(parsed.error.empty());
}

// A well-formed rule object, except that member key has the JSON text
// jsonValue (or is left out when jsonValue is empty).
std::string RuleWith(const std::string &key, const std::string &jsonValue) {
  const std::pair<const char *, const char *> members[] = {
      {"rule_id", "\"1\""},           {"enable", "true"},
      {"router_protocol", "\"tcp\""}, {"router_port", "\"80\""},
      {"ds_port", "\"80\""},          {"serviceid", "\"\""},
      {"service_name", "\"\""}};
  std::string text = "{";
  for (const auto &[name, value] : members) {
    std::string member = name == key ? jsonValue : value;
    if (member.empty()) {
      continue;
    }
    if (text.size() > 1) {
      text += ", ";
    }
    text += "\"" + std::string(name) + "\": " + member;
  }
  return text + "}";
}

std::vector<MalformedCase> MalformedCases() {
  std::string good = OneRuleDocument(kGoodRuleBody);
  std::vector<MalformedCase> cases = {
      {"Empty", ""},
      {"Whitespace", " \n\t"},
      {"NotJson", "rule_id=1\nenable=yes\n"},
      {"IniLike", "[rule1]\nrouter_port=80\n"},
      {"TopLevelArray", "[]"},
      {"TopLevelString", "\"rules\""},
      {"NoVersion", R"({"rules": []})"},
      {"VersionTwo", R"({"version": 2, "rules": []})"},
      {"VersionText", R"({"version": "1", "rules": []})"},
      {"VersionFloat", R"({"version": 1.5, "rules": []})"},
      {"NoRules", R"({"version": 1})"},
      {"RulesObject", R"({"version": 1, "rules": {}})"},
      {"RulesNull", R"({"version": 1, "rules": null})"},
      {"RuleNotObject", OneRuleDocument("\"rule\"")},
      {"RuleNull", OneRuleDocument("null")},
      {"EnableText", OneRuleDocument(RuleWith("enable", "\"true\""))},
      {"EnableNumber", OneRuleDocument(RuleWith("enable", "1"))},
      {"EnableMissing", OneRuleDocument(RuleWith("enable", ""))},
      {"RuleIdNumber", OneRuleDocument(RuleWith("rule_id", "1"))},
      {"RuleIdMissing", OneRuleDocument(RuleWith("rule_id", ""))},
      {"PortNumber", OneRuleDocument(RuleWith("router_port", "80"))},
      {"DsPortMissing", OneRuleDocument(RuleWith("ds_port", ""))},
      {"ProtocolNull", OneRuleDocument(RuleWith("router_protocol", "null"))},
      {"ServiceIdArray", OneRuleDocument(RuleWith("serviceid", "[]"))},
      {"ServiceNameMissing", OneRuleDocument(RuleWith("service_name", ""))},
      {"FieldTooLong",
       OneRuleDocument(
           RuleWith("service_name", "\"" + std::string(1024, 'x') + "\""))},
      {"FieldWithNul", OneRuleDocument(RuleWith("serviceid", "\"a\\u0000b\""))},
      {"LoneSurrogateEscape",
       OneRuleDocument(RuleWith("serviceid", "\"\\ud800\""))},
      {"BadEscape", OneRuleDocument(RuleWith("serviceid", "\"\\q\""))},
      {"DuplicateKey", R"({"version": 1, "version": 1, "rules": []})"},
      {"TrailingContent", good + "{}"},
      {"TwoDocuments", good + good},
      {"Comment", "// rules\n" + good},
      {"SingleQuotes", R"({'version': 1, 'rules': []})"},
      {"TrailingComma", R"({"version": 1, "rules": [],})"},
      {"DeepNesting", std::string(100000, '[') + std::string(100000, ']')},
      {"DeepNestingInRule",
       OneRuleDocument(RuleWith("serviceid", std::string(5000, '[') +
                                                 std::string(5000, ']')))},
      {"Unterminated", good.substr(0, good.size() - 1)},
      {"NulByteInside", std::string("{\"version\": 1,\0 \"rules\": []}", 28)},
      {"TooLarge", std::string(kMaxRuleConfBytes + 1, ' ')},
  };
  return cases;
}

INSTANTIATE_TEST_SUITE_P(Cases, PortMapRuleConfFormatMalformed,
                         testing::ValuesIn(MalformedCases()),
                         [](const testing::TestParamInfo<MalformedCase> &info) {
                           return std::string(info.param.name);
                         });

TEST(PortMapRuleConfFormat, FieldOf1023BytesIsAccepted) {
  auto parsed = ParseRuleConf(OneRuleDocument(
      RuleWith("service_name", "\"" + std::string(1023, 'x') + "\"")));
  ASSERT_TRUE(parsed.ok) << parsed.error;
  ASSERT_EQ(1u, parsed.rules.size());
  EXPECT_EQ(std::string(1023, 'x'), parsed.rules[0].serviceName);
}

TEST(PortMapRuleConfFormat, EveryTruncationOfAFileIsRefused) {
  std::vector<RouterRule> rules = {
      Rule("1", true, "tcp", "80", "8080", "web", "Web"),
      Rule("2", false, "udp", "53", "53", "dns", "")};
  std::string text = SerializeRuleConf(rules);
  // Without its closing brace (and the newline after it) no prefix is a
  // complete document.
  std::size_t complete = text.rfind('}');
  ASSERT_NE(std::string::npos, complete);
  for (std::size_t length = 0; length <= complete; ++length) {
    auto parsed = ParseRuleConf(std::string_view(text).substr(0, length));
    EXPECT_FALSE(parsed.ok) << "prefix of " << length << " bytes";
    EXPECT_TRUE(parsed.rules.empty());
  }
  EXPECT_TRUE(ParseRuleConf(text).ok);
}

TEST(PortMapRuleConfFormat, RuleCountIsBounded) {
  const std::string rule = kGoodRuleBody;
  std::string text = "{\"version\": 1, \"rules\": [";
  for (std::size_t i = 0; i < kMaxRuleConfRules; ++i) {
    text += rule;
    text += ',';
  }
  std::string atLimit = text;
  atLimit.back() = ']';
  atLimit += '}';
  text += rule + "]}";
  ASSERT_LE(text.size(), kMaxRuleConfBytes);

  auto accepted = ParseRuleConf(atLimit);
  ASSERT_TRUE(accepted.ok) << accepted.error;
  EXPECT_EQ(kMaxRuleConfRules, accepted.rules.size());
  auto refused = ParseRuleConf(text);
  EXPECT_FALSE(refused.ok);
  EXPECT_TRUE(refused.rules.empty());
}

TEST(PortMapRuleConfFormat, FitsRuleField) {
  using zark::portmap::FitsRuleField;
  EXPECT_TRUE(FitsRuleField(""));
  EXPECT_TRUE(FitsRuleField(std::string(1023, 'a')));
  EXPECT_FALSE(FitsRuleField(std::string(1024, 'a')));
  EXPECT_FALSE(FitsRuleField(std::string("a\0b", 3)));
}

} // namespace
