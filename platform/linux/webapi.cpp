// The web server's request and response objects.
#include "velt/webapi.h"

#include <limits>
#include <type_traits>
#include <utility>
#include <vector>

namespace VELT {
namespace {

// The parameter named key, or null when the request does not carry it.
const Json::Value* FindParam(const Json::Value& params, const std::string& key) {
  if (!params.isObject()) return nullptr;
  return params.find(key.data(), key.data() + key.size());
}

// True when value nests more than limit objects and arrays in one another.
// Walked with an explicit stack: the value may be too deep for recursion,
// which is what is being checked.
bool NestedDeeperThan(const Json::Value& value, int limit) {
  std::vector<std::pair<const Json::Value*, int>> pending{{&value, 1}};
  while (!pending.empty()) {
    const auto [node, depth] = pending.back();
    pending.pop_back();
    if (!node->isArray() && !node->isObject()) continue;
    if (depth > limit) return true;
    for (const Json::Value& child : *node) pending.emplace_back(&child, depth + 1);
  }
  return false;
}

// The common rules: absent is invalid only when required; present with the
// wrong type, or refused by the validator, is invalid; an invalid or absent
// parameter carries the type's default value. Null params (parameters
// refused as a whole) make every parameter invalid.
template <typename T, typename Convert>
APIParameter<T> Check(const Json::Value* params, const std::string& key, PARAM_NECESSITY necessity,
                      APIRequest::Validator<T> validator, Convert convert) {
  if (!params) return APIParameter<T>(true, false, T{});
  const Json::Value* value = FindParam(*params, key);
  if (!value) return APIParameter<T>(necessity == PARAM_REQUIRED, false, T{});
  T converted{};
  if (!convert(*value, &converted)) return APIParameter<T>(true, true, T{});
  if (validator && !validator(converted)) return APIParameter<T>(true, true, T{});
  return APIParameter<T>(false, true, std::move(converted));
}

template <typename T>
bool ToIntegral(const Json::Value& value, T* out) {
  static_assert(std::is_integral<T>::value && !std::is_same<T, bool>::value, "integral only");
  // isInt64/isUInt64 accept integers and integral reals that fit, and refuse
  // strings and booleans.
  if constexpr (std::is_signed<T>::value) {
    if (!value.isInt64()) return false;
    Json::Int64 v = value.asInt64();
    if (v < static_cast<Json::Int64>(std::numeric_limits<T>::min()) ||
        v > static_cast<Json::Int64>(std::numeric_limits<T>::max())) {
      return false;
    }
    *out = static_cast<T>(v);
  } else {
    if (!value.isUInt64()) return false;
    Json::UInt64 v = value.asUInt64();
    if (v > static_cast<Json::UInt64>(std::numeric_limits<T>::max())) return false;
    *out = static_cast<T>(v);
  }
  return true;
}

}  // namespace

APIRequest::APIRequest(std::string api, int version, std::string method, Json::Value params)
    : api_(std::move(api)),
      version_(version),
      method_(std::move(method)),
      params_(std::move(params)) {
  // The value is dropped by jsoncpp's recursive destructor: a host hands
  // over only what its own parser (bounded by its stack limit) and copies
  // have already been through, so that depth is safe here too.
  if (NestedDeeperThan(params_, kMaxParamDepth)) {
    params_ = Json::Value();
    paramsTooDeep_ = true;
  }
}

template <typename T>
APIParameter<T> APIRequest::GetAndCheckIntegral(const std::string& key, PARAM_NECESSITY necessity,
                                                Validator<T> validator) const {
  return Check<T>(paramsTooDeep_ ? nullptr : &params_, key, necessity, validator, ToIntegral<T>);
}

template VELT_CXX_API APIParameter<uint64_t> APIRequest::GetAndCheckIntegral<uint64_t>(
    const std::string&, PARAM_NECESSITY, Validator<uint64_t>) const;
template VELT_CXX_API APIParameter<uint32_t> APIRequest::GetAndCheckIntegral<uint32_t>(
    const std::string&, PARAM_NECESSITY, Validator<uint32_t>) const;

APIParameter<std::string> APIRequest::GetAndCheckString(const std::string& key,
                                                        PARAM_NECESSITY necessity,
                                                        Validator<std::string> validator) const {
  return Check<std::string>(paramsTooDeep_ ? nullptr : &params_, key, necessity, validator,
                            [](const Json::Value& v, std::string* out) {
                              if (!v.isString()) return false;
                              *out = v.asString();
                              return true;
                            });
}

APIParameter<bool> APIRequest::GetAndCheckBool(const std::string& key, PARAM_NECESSITY necessity,
                                               Validator<bool> validator) const {
  return Check<bool>(paramsTooDeep_ ? nullptr : &params_, key, necessity, validator,
                     [](const Json::Value& v, bool* out) {
                       if (!v.isBool()) return false;
                       *out = v.asBool();
                       return true;
                     });
}

APIParameter<Json::Value> APIRequest::GetAndCheckObject(const std::string& key,
                                                        PARAM_NECESSITY necessity,
                                                        Validator<Json::Value> validator) const {
  return Check<Json::Value>(paramsTooDeep_ ? nullptr : &params_, key, necessity, validator,
                            [](const Json::Value& v, Json::Value* out) {
                              if (!v.isObject()) return false;
                              *out = v;
                              return true;
                            });
}

void APIResponse::SetSuccess(const Json::Value& data) {
  ++answers_;
  success_ = true;
  error_code_ = 0;
  data_ = data;
}

void APIResponse::SetError(int code, const Json::Value& data) {
  ++answers_;
  success_ = false;
  error_code_ = code;
  data_ = data;
}

}  // namespace VELT
