#include "webapi.h"

#include <gtest/gtest.h>

namespace {

Json::Value Params() {
  Json::Value params(Json::objectValue);
  params["task_id"] = "ZARK.Core.PortForwarding.detect#0123456789abcdef";
  params["count"] = 3;
  params["empty"] = Json::Value();
  return params;
}

TEST(WebAPIRequest, GetParamReturnsTheParameter) {
  const ZARK::APIRequest request(Params());
  EXPECT_EQ(request.GetParam("task_id", "").asString(),
            "ZARK.Core.PortForwarding.detect#0123456789abcdef");
  EXPECT_EQ(request.GetParam("count", 0).asInt(), 3);
}

TEST(WebAPIRequest, GetParamReturnsTheDefaultWhenAbsent) {
  const ZARK::APIRequest request(Params());
  EXPECT_EQ(request.GetParam("missing", "fallback").asString(), "fallback");
  EXPECT_EQ(request.GetParam("missing", 7).asInt(), 7);
  EXPECT_TRUE(request.GetParam("missing", Json::Value()).isNull());
}

TEST(WebAPIRequest, NullParameterIsPresent) {
  const ZARK::APIRequest request(Params());
  EXPECT_TRUE(request.HasParam("empty"));
  // Present: its own null value, not the default.
  EXPECT_TRUE(request.GetParam("empty", "fallback").isNull());
}

TEST(WebAPIRequest, HasParam) {
  const ZARK::APIRequest request(Params());
  EXPECT_TRUE(request.HasParam("task_id"));
  EXPECT_TRUE(request.HasParam("count"));
  EXPECT_FALSE(request.HasParam("missing"));
  EXPECT_FALSE(request.HasParam(""));
}

TEST(WebAPIRequest, DefaultRequestHasNoParameters) {
  const ZARK::APIRequest request;
  EXPECT_TRUE(request.GetParams().isObject());
  EXPECT_EQ(request.GetParams().size(), 0u);
  EXPECT_FALSE(request.HasParam("task_id"));
  EXPECT_EQ(request.GetParam("task_id", "x").asString(), "x");
}

TEST(WebAPIRequest, NonObjectParametersBecomeAnEmptyObject) {
  Json::Value array(Json::arrayValue);
  array.append("task_id");
  for (const Json::Value &params :
       {array, Json::Value("task_id"), Json::Value(5), Json::Value()}) {
    const ZARK::APIRequest request(params);
    EXPECT_TRUE(request.GetParams().isObject());
    EXPECT_EQ(request.GetParams().size(), 0u);
    EXPECT_FALSE(request.HasParam("task_id"));
    EXPECT_EQ(request.GetParam("task_id", "d").asString(), "d");
  }
}

TEST(WebAPIRequest, SetParamAddsAndReplaces) {
  ZARK::APIRequest request;
  request.SetParam("rules", Json::Value(Json::arrayValue));
  request.SetParam("count", 1);
  request.SetParam("count", 2);
  EXPECT_TRUE(request.GetParam("rules", Json::Value()).isArray());
  EXPECT_EQ(request.GetParam("count", 0).asInt(), 2);
}

TEST(WebAPIRequest, CopyIsIndependent) {
  ZARK::APIRequest request(Params());
  request.SetUser("admin");
  const ZARK::APIRequest copy = request;
  request.SetParam("count", 9);
  request.SetUser("guest");
  EXPECT_EQ(copy.GetParam("count", 0).asInt(), 3);
  EXPECT_EQ(copy.GetUser(), "admin");
}

} // namespace
