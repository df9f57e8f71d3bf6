#include "webapi.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

namespace {

using ZARK::APIResponse;

Json::Value Object(const std::string &key, const Json::Value &value) {
  Json::Value object(Json::objectValue);
  object[key] = value;
  return object;
}

TEST(WebAPIResponse, StartsUnanswered) {
  const APIResponse response;
  EXPECT_EQ(response.GetState(), APIResponse::State::None);
  EXPECT_FALSE(response.IsAnswered());
  EXPECT_FALSE(response.IsSuccess());
  EXPECT_EQ(response.GetErrorCode(), 0);
  EXPECT_TRUE(response.GetData().isNull());
  EXPECT_TRUE(response.GetErrorData().isNull());
}

TEST(WebAPIResponse, SetSuccessKeepsData) {
  APIResponse response;
  response.SetSuccess(Object("percentage", 40));
  EXPECT_EQ(response.GetState(), APIResponse::State::Success);
  EXPECT_TRUE(response.IsAnswered());
  EXPECT_TRUE(response.IsSuccess());
  EXPECT_EQ(response.GetData(), Object("percentage", 40));
  EXPECT_EQ(response.GetErrorCode(), 0);
}

TEST(WebAPIResponse, SetErrorKeepsCodeAndData) {
  APIResponse response;
  response.SetError(1501, Object("sec", "error"));
  EXPECT_EQ(response.GetState(), APIResponse::State::Error);
  EXPECT_TRUE(response.IsAnswered());
  EXPECT_FALSE(response.IsSuccess());
  EXPECT_EQ(response.GetErrorCode(), 1501);
  EXPECT_EQ(response.GetErrorData(), Object("sec", "error"));
}

TEST(WebAPIResponse, SetErrorWithoutDataHasNullData) {
  APIResponse response;
  response.SetError(114);
  EXPECT_EQ(response.GetErrorCode(), 114);
  EXPECT_TRUE(response.GetErrorData().isNull());
}

TEST(WebAPIResponse, LastCallWins) {
  APIResponse response;
  response.SetSuccess(Object("a", 1));
  response.SetError(1500, Object("b", 2));
  EXPECT_EQ(response.GetState(), APIResponse::State::Error);
  EXPECT_EQ(response.GetErrorCode(), 1500);
  EXPECT_EQ(response.GetErrorData(), Object("b", 2));
  EXPECT_TRUE(response.GetData().isNull());

  response.SetSuccess(Object("c", 3));
  EXPECT_EQ(response.GetState(), APIResponse::State::Success);
  EXPECT_EQ(response.GetData(), Object("c", 3));
  EXPECT_EQ(response.GetErrorCode(), 0);
  EXPECT_TRUE(response.GetErrorData().isNull());

  response.SetError(114);
  response.SetError(117);
  EXPECT_EQ(response.GetErrorCode(), 117);
}

// Records what it is told and reads the response back while being told,
// which only works when the response's lock is released.
class RecordingListener : public APIResponse::Listener {
public:
  explicit RecordingListener(const APIResponse &response)
      : mResponse(response) {}
  void OnSuccess(const Json::Value &data) override {
    mEvents.push_back("success " + data.toStyledString());
    mStatesSeen.push_back(mResponse.GetState());
  }
  void OnError(int code, const Json::Value &errors) override {
    mEvents.push_back("error " + std::to_string(code) + " " +
                      errors.toStyledString());
    mStatesSeen.push_back(mResponse.GetState());
  }
  std::vector<std::string> mEvents;
  std::vector<APIResponse::State> mStatesSeen;

private:
  const APIResponse &mResponse;
};

TEST(WebAPIResponse, ListenerIsToldOfEveryAnswerAfterItIsSet) {
  APIResponse response;
  auto listener = std::make_shared<RecordingListener>(response);
  response.SetListener(listener);
  response.SetSuccess(Object("a", 1));
  response.SetError(1503, Object("b", 2));
  response.SetSuccess(Object("a", 1));

  const std::vector<std::string> expected = {
      "success " + Object("a", 1).toStyledString(),
      "error 1503 " + Object("b", 2).toStyledString(),
      "success " + Object("a", 1).toStyledString()};
  EXPECT_EQ(listener->mEvents, expected);
  const std::vector<APIResponse::State> states = {APIResponse::State::Success,
                                                  APIResponse::State::Error,
                                                  APIResponse::State::Success};
  EXPECT_EQ(listener->mStatesSeen, states);
}

TEST(WebAPIResponse, ListenerCanBeRemoved) {
  APIResponse response;
  auto listener = std::make_shared<RecordingListener>(response);
  response.SetListener(listener);
  response.SetSuccess();
  response.SetListener(nullptr);
  response.SetError(1500);
  EXPECT_EQ(listener->mEvents.size(), 1u);
  EXPECT_EQ(response.GetErrorCode(), 1500);
}

} // namespace
