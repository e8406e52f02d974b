// A stand-in module for testing plovo-api's own output: "echo" succeeds with
// the request's parameters, "fail" answers error 499 with data "no", and
// "silent" leaves the request unanswered.
#include <velt/webapi.h>

#define ECHO_EXPORT extern "C" __attribute__((visibility("default")))

ECHO_EXPORT void Process(VELT::APIRequest* request, VELT::APIResponse* response) {
  const std::string method = request->GetAPIMethod();
  if (method == "echo") response->SetSuccess(request->GetParams());
  if (method == "fail") response->SetError(499, Json::Value("no"));
}

namespace {
const VELT::APIDesc kTable[] = {{"VELT.Plovo", 1, "echo", Process}, {nullptr, 0, nullptr, nullptr}};
}

ECHO_EXPORT const VELT::APIDesc* GetAPITable() { return kTable; }
