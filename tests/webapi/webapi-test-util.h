// Calls the module's Process the way the web server does, in a sandbox.
#ifndef PLOVO_TESTS_WEBAPI_TEST_UTIL_H
#define PLOVO_TESTS_WEBAPI_TEST_UTIL_H

#include <velt/webapi.h>

#include <string>

#include "log-capture.h"
#include "sandbox.h"
#include "webapi/plovo.h"

namespace plovo_test {

class WebApiTest : public SandboxTest {
 protected:
  // Sends one request of "VELT.Plovo" version 1 and returns the response.
  static VELT::APIResponse Call(const std::string& method,
                                const Json::Value& params = Json::Value(Json::objectValue)) {
    VELT::APIRequest request("VELT.Plovo", 1, method, params);
    VELT::APIResponse response;
    ::Process(&request, &response);
    return response;
  }
  // Whether a request without parameters, with no daemon listening, got
  // past the gate to its action: the task actions refuse the missing
  // parameters (402), "list" fails to reach the daemon, and
  // "get_global_setting" finds no repository volume.
  static bool ReachedAction(const VELT::APIResponse& response, const LogCapture& log) {
    return response.GetErrorCode() == 402 || log.Contains("Failed to send List command") ||
           log.Contains("No repo volume path");
  }
};

}  // namespace plovo_test

#endif
