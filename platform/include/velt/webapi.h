/*
 * The platform web server's host objects, as a web-API module sees them.
 *
 * The server builds one APIRequest and one APIResponse per request, passes
 * both to the module's handler, and owns them; the module only reads the
 * request and answers through the response. A request and its response are
 * used by one thread at a time.
 */
#ifndef VELT_WEBAPI_H
#define VELT_WEBAPI_H

#include <json/value.h>

#include <cstdint>
#include <string>

#define VELT_CXX_API __attribute__((visibility("default")))

namespace VELT {

class APIRequest;
class APIResponse;

/* Whether a request parameter must be present. */
enum PARAM_NECESSITY {
  PARAM_REQUIRED = 0,  // absent or of the wrong type: the parameter is invalid
  PARAM_OPTIONAL = 1,  // absent: valid, with the type's default value
};

/* One row of a module's method table. A table ends with a row whose api is
 * NULL. */
typedef void (*APIHandler)(APIRequest* request, APIResponse* response);
struct APIDesc {
  const char* api;
  int version;
  const char* method;
  APIHandler handler;
};

/* One request parameter read with its type. */
template <typename T>
class VELT_CXX_API APIParameter {
 public:
  APIParameter() = default;
  APIParameter(bool invalid, bool set, T value)
      : invalid_(invalid), set_(set), value_(std::move(value)) {}

  /* True when a required parameter is missing, the value has the wrong type
   * or is out of the type's range, or the validator refused it. */
  bool IsInvalid() const { return invalid_; }
  /* True when the request carried the parameter. */
  bool IsSet() const { return set_; }
  /* The value; the type's default when the parameter is absent or invalid. */
  const T& Get() const { return value_; }

 private:
  bool invalid_ = true;
  bool set_ = false;
  T value_{};
};

/* The deepest nesting of objects and arrays a request's parameters may have,
 * the parameter object itself counting as one. Deeper parameters are
 * dropped when the request is built, and every parameter read is then
 * invalid: a module copies parameter values, and jsoncpp copies and frees a
 * value by recursion. */
constexpr int kMaxParamDepth = 64;

/* A request: API name, version, method name and the parameters, a JSON
 * object. */
class VELT_CXX_API APIRequest {
 public:
  template <typename T>
  using Validator = bool (*)(const T& value);

  APIRequest(std::string api, int version, std::string method, Json::Value params);

  const std::string& GetAPIName() const { return api_; }
  int GetAPIVersion() const { return version_; }
  std::string GetAPIMethod() const { return method_; }
  /* Null when the parameters were nested too deeply. */
  const Json::Value& GetParams() const { return params_; }

  /* Typed parameter readers. Integral accepts uint64_t and uint32_t: a JSON
   * integer (or integral number) in the type's range. String, Bool and
   * Object accept exactly a JSON string, boolean and object. The validator,
   * when not null, may refuse a well-typed value. */
  template <typename T>
  APIParameter<T> GetAndCheckIntegral(const std::string& key, PARAM_NECESSITY necessity,
                                      Validator<T> validator) const;
  APIParameter<std::string> GetAndCheckString(const std::string& key, PARAM_NECESSITY necessity,
                                              Validator<std::string> validator) const;
  APIParameter<bool> GetAndCheckBool(const std::string& key, PARAM_NECESSITY necessity,
                                     Validator<bool> validator) const;
  APIParameter<Json::Value> GetAndCheckObject(const std::string& key, PARAM_NECESSITY necessity,
                                              Validator<Json::Value> validator) const;

 private:
  std::string api_;
  int version_;
  std::string method_;
  Json::Value params_;
  bool paramsTooDeep_ = false;
};

extern template VELT_CXX_API APIParameter<uint64_t> APIRequest::GetAndCheckIntegral<uint64_t>(
    const std::string&, PARAM_NECESSITY, Validator<uint64_t>) const;
extern template VELT_CXX_API APIParameter<uint32_t> APIRequest::GetAndCheckIntegral<uint32_t>(
    const std::string&, PARAM_NECESSITY, Validator<uint32_t>) const;

/* The answer to one request. A module answers once; the host can tell a
 * request left unanswered (AnswerCount() 0) from one answered twice. */
class VELT_CXX_API APIResponse {
 public:
  /* Success with data (null when the method returns none). */
  void SetSuccess(const Json::Value& data = Json::Value());
  /* Failure with a numeric code and data (null unless the method names a
   * message). */
  void SetError(int code, const Json::Value& data = Json::Value());

  int AnswerCount() const { return answers_; }
  /* True when the last answer was SetSuccess. */
  bool IsSuccess() const { return success_; }
  int GetErrorCode() const { return error_code_; }
  const Json::Value& GetData() const { return data_; }

 private:
  int answers_ = 0;
  bool success_ = false;
  int error_code_ = 0;
  Json::Value data_;
};

}  // namespace VELT

#endif
