// The wire protocol: form decoding, parameter values, the call's fields and
// the answer shapes.
#include "wire_protocol.h"

#include <gtest/gtest.h>

#include <cctype>
#include <cstdio>
#include <random>
#include <string>

namespace zark::host {
namespace {

FormFields Decode(std::string_view text, FormResult expected = FormResult::Ok,
                  std::size_t maxFields = 100) {
  FormFields fields;
  EXPECT_EQ(DecodeForm(text, maxFields, fields), expected) << text;
  return fields;
}

TEST(HostWireForm, DecodesNamesAndValuesInOrder) {
  FormFields fields = Decode("api=A.B&version=1&rules=%5B%7B%22a%22%3A1%7D%5D");
  ASSERT_EQ(fields.size(), 3u);
  EXPECT_EQ(fields[0].name, "api");
  EXPECT_EQ(fields[0].value, "A.B");
  EXPECT_EQ(fields[1].name, "version");
  EXPECT_EQ(fields[2].name, "rules");
  EXPECT_EQ(fields[2].value, "[{\"a\":1}]");
}

TEST(HostWireForm, PlusIsASpaceAndHexIsEitherCase) {
  FormFields fields = Decode("a+b=c+d%2bE%2Bf");
  ASSERT_EQ(fields.size(), 1u);
  EXPECT_EQ(fields[0].name, "a b");
  EXPECT_EQ(fields[0].value, "c d+E+f");
}

TEST(HostWireForm, EmptyPiecesAreSkippedAndBareNamesHaveEmptyValues) {
  FormFields fields = Decode("&a=1&&flag&b=x=y&");
  ASSERT_EQ(fields.size(), 3u);
  EXPECT_EQ(fields[0].name, "a");
  EXPECT_EQ(fields[1].name, "flag");
  EXPECT_EQ(fields[1].value, "");
  EXPECT_EQ(fields[2].name, "b");
  EXPECT_EQ(fields[2].value, "x=y");
  EXPECT_TRUE(Decode("").empty());
}

TEST(HostWireForm, BrokenPercentEscapesAreRefused) {
  Decode("a=%zz", FormResult::BadEncoding);
  Decode("a=%4", FormResult::BadEncoding);
  Decode("a=%", FormResult::BadEncoding);
  Decode("%G1=x", FormResult::BadEncoding);
}

TEST(HostWireForm, EmptyNameIsRefused) {
  Decode("=value", FormResult::BadEncoding);
}

TEST(HostWireForm, FieldCountIsBounded) {
  Decode("a=1&b=2&c=3", FormResult::Ok, 3);
  Decode("a=1&b=2&c=3&d=4", FormResult::TooManyFields, 3);
  // Fields already held count too.
  FormFields fields = Decode("a=1&b=2");
  EXPECT_EQ(DecodeForm("c=3&d=4", 3, fields), FormResult::TooManyFields);
}

std::string Encode(const std::string &text) {
  std::string out;
  for (unsigned char c : text) {
    if (std::isalnum(c) || c == '-' || c == '_' || c == '.' || c == '~') {
      out.push_back(static_cast<char>(c));
    } else if (c == ' ') {
      out.push_back('+');
    } else {
      char escape[4];
      snprintf(escape, sizeof(escape), "%%%02x", c);
      out += escape;
    }
  }
  return out;
}

std::string RandomBytes(std::mt19937 &random, std::size_t maxLength) {
  std::uniform_int_distribution<std::size_t> length(0, maxLength);
  std::uniform_int_distribution<int> byte(0, 255);
  std::string text(length(random), '\0');
  for (char &c : text) {
    c = static_cast<char>(byte(random));
  }
  return text;
}

// Any bytes survive encoding and decoding unchanged, in order.
TEST(HostWireForm, EncodedFieldsOfAnyBytesDecodeBack) {
  std::mt19937 random(20240611);
  for (int round = 0; round < 2000; ++round) {
    FormFields sent;
    std::string text;
    const int count = static_cast<int>(random() % 6);
    for (int i = 0; i < count; ++i) {
      std::string name = RandomBytes(random, 12);
      if (name.empty()) {
        name = "n";
      }
      sent.push_back({name, RandomBytes(random, 40)});
      text += (i ? "&" : "") + Encode(name) + "=" + Encode(sent.back().value);
    }
    FormFields got;
    ASSERT_EQ(DecodeForm(text, 10, got), FormResult::Ok) << text;
    ASSERT_EQ(got.size(), sent.size()) << text;
    for (std::size_t i = 0; i < got.size(); ++i) {
      EXPECT_EQ(got[i].name, sent[i].name);
      EXPECT_EQ(got[i].value, sent[i].value);
    }
  }
}

// Arbitrary bytes never break the decoder or the value reader, and what the
// decoder accepts keeps its promises.
TEST(HostWireForm, ArbitraryBytesKeepTheDecodersPromises) {
  std::mt19937 random(7);
  const std::string alphabet = "a=&%+2F{}[]\"\\:,0x";
  for (int round = 0; round < 5000; ++round) {
    std::string text = RandomBytes(random, 64);
    // Half of the inputs from a small alphabet, to reach the interesting
    // paths more often.
    if (round % 2 == 0) {
      for (char &c : text) {
        c = alphabet[static_cast<unsigned char>(c) % alphabet.size()];
      }
    }
    FormFields fields;
    FormResult result = DecodeForm(text, 8, fields);
    EXPECT_LE(fields.size(), 8u);
    if (result == FormResult::Ok) {
      for (const FormField &field : fields) {
        EXPECT_FALSE(field.name.empty()) << text;
      }
    }
    // A string value is the text itself, unless the text was a JSON string.
    Json::Value value = ParamValue(text);
    if (value.isString() && value.asString() != text) {
      std::size_t first = text.find_first_not_of(" \t\r\n");
      ASSERT_NE(first, std::string::npos) << text;
      EXPECT_EQ(text[first], '"') << text;
    }
  }
}

TEST(HostWireValue, JsonTextBecomesItsValue) {
  EXPECT_EQ(ParamValue("{\"a\":[1,2]}")["a"][1].asInt(), 2);
  EXPECT_TRUE(ParamValue("[]").isArray());
  EXPECT_EQ(ParamValue("5"), Json::Value(5));
  EXPECT_EQ(ParamValue("-2.5"), Json::Value(-2.5));
  EXPECT_EQ(ParamValue("true"), Json::Value(true));
  EXPECT_TRUE(ParamValue("null").isNull());
  EXPECT_EQ(ParamValue("\"80\""), Json::Value("80"));
}

TEST(HostWireValue, OtherTextIsAPlainString) {
  EXPECT_EQ(ParamValue("ZARK.Core.PortForwarding.detect#0123abcd"),
            Json::Value("ZARK.Core.PortForwarding.detect#0123abcd"));
  EXPECT_EQ(ParamValue("{broken"), Json::Value("{broken"));
  EXPECT_EQ(ParamValue("1 2"), Json::Value("1 2"));
  EXPECT_EQ(ParamValue(""), Json::Value(""));
  EXPECT_EQ(ParamValue("tcp"), Json::Value("tcp"));
}

TEST(HostWireValue, StrictReaderRefusesLaxJson) {
  // Comments, single quotes, repeated keys, NaN and trailing text are not
  // JSON to the strict reader: the text stays a string.
  for (const char *text :
       {"[1] // note", "{'a':1}", "{\"a\":1,\"a\":2}", "NaN", "[1]x"}) {
    Json::Value value = ParamValue(text);
    ASSERT_TRUE(value.isString()) << text;
    EXPECT_EQ(value.asString(), text);
  }
}

TEST(HostWireValue, NestingIsBounded) {
  std::string fits = std::string(90, '[') + std::string(90, ']');
  EXPECT_TRUE(ParamValue(fits).isArray());
  std::string deep = std::string(5000, '[') + std::string(5000, ']');
  EXPECT_TRUE(ParamValue(deep).isString());
}

TEST(HostWireVersion, OnlyPositiveDecimalNumbers) {
  EXPECT_EQ(ParseVersion("1"), 1);
  EXPECT_EQ(ParseVersion("12"), 12);
  EXPECT_EQ(ParseVersion("2147483647"), 2147483647);
  for (const char *bad : {"", "0", "-1", "+1", " 1", "1 ", "1.0", "0x1",
                          "2147483648", "99999999999", "one"}) {
    EXPECT_FALSE(ParseVersion(bad).has_value()) << bad;
  }
}

FormFields Fields(std::initializer_list<FormField> list) {
  return list;
}

TEST(HostWireCall, SplitsAddressFromParameters) {
  ApiCall call;
  WireError error;
  ASSERT_TRUE(ParseApiCall(Fields({{"api", "A.B"},
                                   {"task_id_suffix", "5"},
                                   {"version", "2"},
                                   {"method", "save"},
                                   {"rules", "[{\"enable\":true}]"},
                                   {"name", "web"}}),
                           64, call, error));
  EXPECT_EQ(call.api, "A.B");
  EXPECT_EQ(call.method, "save");
  EXPECT_EQ(call.version, 2);
  EXPECT_EQ(call.params.size(), 3u);
  EXPECT_EQ(call.params["task_id_suffix"], Json::Value(5));
  EXPECT_TRUE(call.params["rules"][0]["enable"].asBool());
  EXPECT_EQ(call.params["name"], Json::Value("web"));
  EXPECT_FALSE(call.params.isMember("api"));
}

TEST(HostWireCall, MissingOrEmptyFieldsAre101) {
  struct Case {
    FormFields fields;
    const char *field;
  } cases[] = {
      {Fields({{"version", "1"}, {"method", "get"}}), "api"},
      {Fields({{"api", ""}, {"version", "1"}, {"method", "get"}}), "api"},
      {Fields({{"api", "A"}, {"version", "1"}}), "method"},
      {Fields({{"api", "A"}, {"method", "get"}}), "version"},
      {Fields({{"api", "A"}, {"version", "x1"}, {"method", "get"}}), "version"},
      {Fields({{"api", "A"}, {"version", "0"}, {"method", "get"}}), "version"},
  };
  for (const Case &c : cases) {
    ApiCall call;
    WireError error;
    EXPECT_FALSE(ParseApiCall(c.fields, 64, call, error));
    EXPECT_EQ(error.code, 101);
    EXPECT_EQ(error.errors["field"].asString(), c.field);
  }
}

TEST(HostWireCall, RepeatedFieldIs101) {
  ApiCall call;
  WireError error;
  EXPECT_FALSE(ParseApiCall(Fields({{"api", "A"},
                                    {"version", "1"},
                                    {"method", "get"},
                                    {"x", "1"},
                                    {"x", "2"}}),
                            64, call, error));
  EXPECT_EQ(error.code, 101);
  EXPECT_EQ(error.errors["field"].asString(), "x");
  EXPECT_EQ(error.errors["reason"].asString(), "repeated");
}

TEST(HostWireCall, ParameterCountIsBounded) {
  FormFields fields = Fields({{"api", "A"}, {"version", "1"}, {"method", "m"}});
  for (int i = 0; i < 4; ++i) {
    fields.push_back({"p" + std::to_string(i), "1"});
  }
  ApiCall call;
  WireError error;
  EXPECT_TRUE(ParseApiCall(fields, 4, call, error));
  fields.push_back({"p4", "1"});
  EXPECT_FALSE(ParseApiCall(fields, 4, call, error));
  EXPECT_EQ(error.code, 108);
  EXPECT_EQ(error.errors["limit"].asString(), "parameters");
  EXPECT_EQ(error.errors["max"].asInt(), 4);
}

TEST(HostWireAnswer, SuccessLeavesOutNullData) {
  EXPECT_EQ(SerializeAnswer(SuccessAnswer(Json::Value())),
            "{\"success\":true}");
  EXPECT_EQ(SerializeAnswer(SuccessAnswer(Json::Value(3))),
            "{\"data\":3,\"success\":true}");
}

TEST(HostWireAnswer, ErrorLeavesOutNullErrors) {
  EXPECT_EQ(SerializeAnswer(ErrorAnswer(104)),
            "{\"error\":{\"code\":104},\"success\":false}");
  Json::Value errors;
  errors["field"] = "api";
  EXPECT_EQ(SerializeAnswer(ErrorAnswer(101, errors)),
            "{\"error\":{\"code\":101,\"errors\":{\"field\":\"api\"}},"
            "\"success\":false}");
}

TEST(HostWireAnswer, ResponsePassesThroughUnchanged) {
  ZARK::APIResponse nothing;
  EXPECT_EQ(AnswerFromResponse(nothing), ErrorAnswer(109));

  ZARK::APIResponse success;
  Json::Value data;
  data["rules"] = Json::Value(Json::arrayValue);
  success.SetSuccess(data);
  EXPECT_EQ(AnswerFromResponse(success), SuccessAnswer(data));

  ZARK::APIResponse error;
  Json::Value errors;
  errors["sec"] = "rule";
  error.SetError(1521, errors);
  Json::Value answer = AnswerFromResponse(error);
  EXPECT_FALSE(answer["success"].asBool());
  EXPECT_EQ(answer["error"]["code"].asInt(), 1521);
  EXPECT_EQ(answer["error"]["errors"], errors);
}

TEST(HostWireAnswer, NonAsciiTextIsEscaped) {
  EXPECT_EQ(SerializeAnswer(SuccessAnswer(Json::Value("\xc3\xa9"))),
            "{\"data\":\"\\u00e9\",\"success\":true}");
}

} // namespace
} // namespace zark::host
