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

// The value of a parameter the request carries, or "invalid".
template <typename T>
std::string Integral(const VELT::APIRequest& req, const char* key) {
  auto p = req.GetAndCheckIntegral<T>(key, PARAM_OPTIONAL, nullptr);
  EXPECT_TRUE(p.IsSet()) << key;
  if (p.IsInvalid()) return p.Get() == 0 ? "invalid" : "invalid, not 0";
  return std::to_string(p.Get());
}

TEST(APIRequestTest, IntegralAcceptsOnlyNumbersInRange) {
  VELT::APIRequest req = Request(R"({"u32max": 4294967295, "u32over": 4294967296,
      "u64max": 18446744073709551615, "whole": 3.0, "neg": -1, "frac": 1.5, "numstr": "5",
      "flag": true})");
  EXPECT_EQ("4294967295", Integral<uint32_t>(req, "u32max"));
  EXPECT_EQ("invalid", Integral<uint32_t>(req, "u32over"));
  EXPECT_EQ("4294967296", Integral<uint64_t>(req, "u32over"));
  EXPECT_EQ("18446744073709551615", Integral<uint64_t>(req, "u64max"));
  EXPECT_EQ("3", Integral<uint32_t>(req, "whole"));
  for (const char* key : {"neg", "frac", "numstr", "flag"}) {
    EXPECT_EQ("invalid", Integral<uint32_t>(req, key)) << key;
    EXPECT_EQ("invalid", Integral<uint64_t>(req, key)) << key;
  }
}

TEST(APIRequestTest, AbsentParameterDependsOnNecessityAndValidatorJudgesTheRest) {
  for (const char* params : {"{}", "[1]"}) {
    VELT::APIRequest req = Request(params);
    auto required = req.GetAndCheckString("x", PARAM_REQUIRED, nullptr);
    EXPECT_TRUE(required.IsInvalid() && !required.IsSet()) << params;
    auto optional = req.GetAndCheckIntegral<uint32_t>("x", PARAM_OPTIONAL,
                                                      [](const uint32_t&) { return false; });
    // The validator judges only values the request carries.
    EXPECT_TRUE(!optional.IsInvalid() && !optional.IsSet() && optional.Get() == 0) << params;
  }
  VELT::APIRequest req = Request(R"({"n": 7})");
  auto refused = req.GetAndCheckIntegral<uint64_t>("n", PARAM_OPTIONAL,
                                                   [](const uint64_t& v) { return v < 5; });
  EXPECT_TRUE(refused.IsInvalid() && refused.IsSet() && refused.Get() == 0);
}

TEST(APIRequestTest, ParametersNestedTooDeeplyMakeEveryReadInvalid) {
  const int bound = VELT::kMaxParamDepth;
  // Parameters "s" and "o" where "o" holds objects or arrays down to the
  // given depth, the parameter object counting as one.
  auto params = [](int depth, bool arrays) {
    const int inner = depth - 1;
    const std::string open = arrays ? "[" : "{\"o\": ", close = arrays ? "]" : "}";
    std::string o;
    for (int i = 1; i < inner; ++i) o += open;
    o += arrays ? "[]" : "{}";
    for (int i = 1; i < inner; ++i) o += close;
    return R"({"s": "x", "n": 1, "o": )" + o + "}";
  };
  const struct {
    int depth;
    bool arrays;
    bool valid;
  } cases[] = {
      {bound - 1, false, true}, {bound, false, true},   {bound, true, true},
      {bound + 1, false, false}, {bound + 1, true, false}, {3 * bound, true, false},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(std::to_string(c.depth) + (c.arrays ? " arrays" : " objects"));
    VELT::APIRequest req = Request(params(c.depth, c.arrays));
    auto s = req.GetAndCheckString("s", PARAM_REQUIRED, nullptr);
    auto n = req.GetAndCheckIntegral<uint32_t>("n", PARAM_REQUIRED, nullptr);
    auto o = req.GetAndCheckObject("o", PARAM_OPTIONAL, nullptr);
    auto absent = req.GetAndCheckBool("absent", PARAM_OPTIONAL, nullptr);
    EXPECT_EQ(c.valid, !s.IsInvalid() && s.Get() == "x");
    EXPECT_EQ(c.valid, !n.IsInvalid() && n.Get() == 1);
    EXPECT_EQ(c.valid && !c.arrays, !o.IsInvalid() && o.Get().isObject());
    EXPECT_EQ(c.valid, !absent.IsInvalid());
    EXPECT_EQ(c.valid, req.GetParams().isObject());
  }
}

}  // namespace
