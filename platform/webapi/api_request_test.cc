#include "webapi/api_request.h"

#include <gtest/gtest.h>

#include "webapi/api_response.h"
#include "webapi/api_validator.h"
#include "webapi/webapi_util.h"

namespace {

class APIRequestTest : public ::testing::Test {
 protected:
  void Send(const std::string& name, const std::string& raw) { req_.AddRawParam(name, raw); }
  APIRequest req_;
};

TEST_F(APIRequestTest, DecodesJsonValuesAndKeepsRealsAsText) {
  Send("arr", "[\"a\",\"b\"]");
  Send("num", "72");
  Send("ver", "1.10");
  Send("word", "hello");
  Send("quoted", "\"5\"");
  Send("huge", "123456789012345678901234567890");
  Send("broken", "[\"a\"");
  EXPECT_TRUE(req_.GetParam("arr").isArray());
  EXPECT_EQ(72, req_.GetParam("num").asInt());
  EXPECT_EQ("1.10", req_.GetParam("ver").asString());
  EXPECT_EQ("hello", req_.GetParam("word").asString());
  EXPECT_EQ("5", req_.GetParam("quoted").asString());
  EXPECT_TRUE(req_.GetParam("huge").isString());
  EXPECT_EQ("[\"a\"", req_.GetParam("broken").asString());
  EXPECT_EQ("dflt", req_.GetParam("absent", "dflt").asString());
  EXPECT_TRUE(req_.HasParam("word"));
  EXPECT_FALSE(req_.HasParam("absent"));
}

TEST_F(APIRequestTest, JsonSpellingANulStaysText) {
  Send("id", "[\"demo-notes\\u0000/../../zzz\"]");
  Send("obj", "{\"a\\u0000b\": 1}");
  Send("s", "\"x\\u0000\"");
  for (const char* name : {"id", "obj", "s"}) {
    const Json::Value value = req_.GetParam(name);
    ASSERT_TRUE(value.isString()) << name;
    EXPECT_EQ(std::string::npos, value.asString().find('\0')) << name;
  }
  EXPECT_EQ("[\"demo-notes\\u0000/../../zzz\"]", req_.GetParam("id").asString());
}

TEST_F(APIRequestTest, StringReaderTakesScalarTextAndRefusesContainers) {
  Send("ver", "1.10");
  Send("n", "5");
  Send("obj", "{\"a\":1}");
  EXPECT_EQ("1.10", req_.GetAndCheckString("ver", PARAM_REQUIRED).Get());
  EXPECT_EQ("5", req_.GetAndCheckString("n", PARAM_REQUIRED).Get());
  auto obj = req_.GetAndCheckString("obj", PARAM_OPTIONAL);
  EXPECT_TRUE(obj.IsSet());
  EXPECT_TRUE(obj.IsInvalid());
  auto missing = req_.GetAndCheckString("missing", PARAM_REQUIRED);
  EXPECT_FALSE(missing.IsSet());
  EXPECT_TRUE(missing.IsInvalid());
  EXPECT_FALSE(req_.GetAndCheckString("missing", PARAM_OPTIONAL).IsInvalid());
}

TEST_F(APIRequestTest, TypedReadersAreStrict) {
  Send("i", "7");
  Send("big", "4294967296");
  Send("s", "\"7\"");
  Send("b", "true");
  Send("one", "pkg");
  Send("five", "5");
  EXPECT_EQ(7, req_.GetAndCheckInt("i", PARAM_REQUIRED).Get());
  EXPECT_TRUE(req_.GetAndCheckInt("big", PARAM_REQUIRED).IsInvalid());
  EXPECT_TRUE(req_.GetAndCheckInt("s", PARAM_REQUIRED).IsInvalid());
  EXPECT_TRUE(req_.GetAndCheckInt("b", PARAM_REQUIRED).IsInvalid());
  EXPECT_TRUE(req_.GetAndCheckBool("b", PARAM_REQUIRED).Get());
  EXPECT_TRUE(req_.GetAndCheckBool("i", PARAM_REQUIRED).IsInvalid());
  EXPECT_TRUE(req_.GetAndCheckObject("i", PARAM_REQUIRED).IsInvalid());
  auto unit = req_.GetAndCheckUnitArray("one", PARAM_REQUIRED);
  ASSERT_FALSE(unit.IsInvalid());
  EXPECT_EQ("pkg", unit.Get()[0].asString());
  EXPECT_TRUE(req_.GetAndCheckUnitArray("five", PARAM_REQUIRED).IsInvalid());
  EXPECT_TRUE(req_.GetAndCheckUnitArray("b", PARAM_REQUIRED).IsInvalid());
}

TEST_F(APIRequestTest, InitParamTakesPostedFields) {
  Send("old", "1");
  Json::Value params(Json::objectValue);
  params["postParam"]["file_tmp"] = "/tmp/x";
  params["other"] = 3;
  req_.InitParam(params, false);
  EXPECT_FALSE(req_.HasParam("old"));
  EXPECT_EQ("/tmp/x", req_.GetAndCheckString("file_tmp", PARAM_REQUIRED).Get());
  EXPECT_EQ("3", req_.GetAndCheckString("other", PARAM_REQUIRED).Get());
}

TEST_F(APIRequestTest, ValidatorMakesAParameterInvalid) {
  Send("n", "5");
  auto even = [](const Json::Value& v) { return v.asInt() % 2 == 0; };
  EXPECT_TRUE(req_.GetAndCheckInt("n", PARAM_REQUIRED, even).IsInvalid());
}

TEST(APIValidatorTest, BelongsForStringsAndEveryArrayElement) {
  Json::Value set;
  ASSERT_TRUE(WebAPIUtil::ParseJson("[\"a\",\"b\"]", set));
  Json::Value arr(Json::arrayValue);
  EXPECT_TRUE(APIValidator::IsBelong(arr, set));  // an empty array belongs to any set
  arr.append("a");
  EXPECT_TRUE(APIValidator::IsBelong(arr, set));
  arr.append("c");
  EXPECT_FALSE(APIValidator::IsBelong(arr, set));
  EXPECT_TRUE(APIValidator::IsBelong(std::string("b"), set));
  EXPECT_FALSE(APIValidator::IsBelong(Json::Value(5), set));
  EXPECT_TRUE(APIValidator::IsEqual("", ""));
}

TEST(APIResponseTest, EnvelopeShapes) {
  APIResponse r;
  EXPECT_EQ(100, r.ToEnvelope()["error"]["code"].asInt());
  r.SetError(4501);
  EXPECT_EQ(4501, r.GetError());
  EXPECT_FALSE(r.ToEnvelope()["error"].isMember("errors"));
  Json::Value details(Json::objectValue);
  details["message"] = "m";
  r.SetError(r.GetError(), details);
  EXPECT_EQ("m", r.ToEnvelope()["error"]["errors"]["message"].asString());
  r.SetSuccess();
  EXPECT_TRUE(r.ToEnvelope()["success"].asBool());
  EXPECT_FALSE(r.ToEnvelope().isMember("data"));
}

}  // namespace
