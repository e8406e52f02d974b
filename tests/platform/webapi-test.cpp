// The web server's request and response objects.
#include <gtest/gtest.h>
#include <json/reader.h>
#include <velt/webapi.h>

#include <cstdint>
#include <memory>
#include <string>

namespace {

using VELT::PARAM_OPTIONAL;
using VELT::PARAM_REQUIRED;

VELT::APIRequest Request(const std::string& params) {
  Json::Value value;
  std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
  EXPECT_TRUE(reader->parse(params.data(), params.data() + params.size(), &value, nullptr));
  return VELT::APIRequest("VELT.Plovo", 1, "get", value);
}

TEST(APIRequestTest, IntegralAcceptsOnlyNumbersInRange) {
  VELT::APIRequest req = Request(R"({"zero": 0, "u32max": 4294967295, "u32over": 4294967296,
      "u64max": 18446744073709551615, "neg": -1, "whole": 3.0, "frac": 1.5, "huge": 1e20,
      "numstr": "5", "flag": true, "null": null, "obj": {}})");
  struct Case {
    const char* key;
    bool valid32;
    bool valid64;
    uint64_t value;
  };
  const Case cases[] = {
      {"zero", true, true, 0},
      {"u32max", true, true, UINT32_MAX},
      {"u32over", false, true, 1ULL << 32},
      {"u64max", false, true, UINT64_MAX},
      {"whole", true, true, 3},
      {"neg", false, false, 0},
      {"frac", false, false, 0},
      {"huge", false, false, 0},
      {"numstr", false, false, 0},
      {"flag", false, false, 0},
      {"null", false, false, 0},
      {"obj", false, false, 0},
  };
  for (const Case& c : cases) {
    for (auto necessity : {PARAM_REQUIRED, PARAM_OPTIONAL}) {
      auto p32 = req.GetAndCheckIntegral<uint32_t>(c.key, necessity, nullptr);
      EXPECT_EQ(!c.valid32, p32.IsInvalid()) << c.key;
      EXPECT_TRUE(p32.IsSet()) << c.key;
      EXPECT_EQ(c.valid32 ? c.value : 0, p32.Get()) << c.key;
      auto p64 = req.GetAndCheckIntegral<uint64_t>(c.key, necessity, nullptr);
      EXPECT_EQ(!c.valid64, p64.IsInvalid()) << c.key;
      EXPECT_EQ(c.value, p64.Get()) << c.key;
    }
  }
}

TEST(APIRequestTest, OtherTypesMustMatchExactly) {
  VELT::APIRequest req = Request(R"({"s": "abc", "b": true, "o": {"a": 1}, "n": 1, "a": [1]})");
  EXPECT_EQ("abc", req.GetAndCheckString("s", PARAM_REQUIRED, nullptr).Get());
  EXPECT_TRUE(req.GetAndCheckBool("b", PARAM_REQUIRED, nullptr).Get());
  EXPECT_EQ(1, req.GetAndCheckObject("o", PARAM_REQUIRED, nullptr).Get()["a"].asInt());
  auto wrongBool = req.GetAndCheckBool("n", PARAM_OPTIONAL, nullptr);
  EXPECT_TRUE(wrongBool.IsInvalid() && wrongBool.IsSet() && !wrongBool.Get());
  EXPECT_TRUE(req.GetAndCheckString("n", PARAM_OPTIONAL, nullptr).IsInvalid());
  EXPECT_TRUE(req.GetAndCheckString("o", PARAM_OPTIONAL, nullptr).IsInvalid());
  EXPECT_TRUE(req.GetAndCheckObject("a", PARAM_OPTIONAL, nullptr).IsInvalid());
  EXPECT_TRUE(req.GetAndCheckObject("s", PARAM_OPTIONAL, nullptr).Get().isNull());
}

TEST(APIRequestTest, AbsentParameterDependsOnNecessity) {
  for (const char* params : {"{}", "null", "[1]"}) {
    VELT::APIRequest req = Request(params);
    auto required = req.GetAndCheckString("x", PARAM_REQUIRED, nullptr);
    EXPECT_TRUE(required.IsInvalid() && !required.IsSet()) << params;
    auto optional = req.GetAndCheckIntegral<uint32_t>("x", PARAM_OPTIONAL,
                                                      [](const uint32_t&) { return false; });
    // The validator judges only values the request carries.
    EXPECT_TRUE(!optional.IsInvalid() && !optional.IsSet() && optional.Get() == 0) << params;
    EXPECT_FALSE(req.GetAndCheckBool("x", PARAM_OPTIONAL, nullptr).IsInvalid()) << params;
    EXPECT_TRUE(req.GetAndCheckObject("x", PARAM_REQUIRED, nullptr).IsInvalid()) << params;
  }
}

TEST(APIRequestTest, ValidatorCanRefuseWellTypedValues) {
  VELT::APIRequest req = Request(R"({"n": 7, "s": "../x"})");
  auto refused = req.GetAndCheckIntegral<uint64_t>("n", PARAM_OPTIONAL,
                                                   [](const uint64_t& v) { return v < 5; });
  EXPECT_TRUE(refused.IsInvalid() && refused.IsSet() && refused.Get() == 0);
  auto noDots = [](const std::string& s) { return s.find("..") == std::string::npos; };
  EXPECT_TRUE(req.GetAndCheckString("s", PARAM_REQUIRED, noDots).IsInvalid());
  auto any = [](const std::string&) { return true; };
  EXPECT_EQ("../x", req.GetAndCheckString("s", PARAM_REQUIRED, any).Get());
}

TEST(APIResponseTest, CountsAnswers) {
  VELT::APIResponse response;
  EXPECT_FALSE(response.AnswerCount() || response.IsSuccess());
  Json::Value data;
  data["total"] = 2;
  response.SetSuccess(data);
  EXPECT_TRUE(response.AnswerCount() == 1 && response.IsSuccess());
  EXPECT_EQ(2, response.GetData()["total"].asInt());
  response.SetError(401);
  EXPECT_TRUE(response.AnswerCount() == 2 && !response.IsSuccess());
  EXPECT_EQ(401, response.GetErrorCode());
  EXPECT_TRUE(response.GetData().isNull());
}

}  // namespace
