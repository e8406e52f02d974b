// The road of every action that forwards a command to the daemon: send,
// and turn a failure into the web error code with one log line under the
// calling action's own file and line.
#include <algorithm>

#include "common/log.h"
#include "ipc/daemon-ipc.h"
#include "webapi/plovo.h"

int PlovoHandle::SendToDaemon(const PObject& command, PObject& reply, const char* what,
                              std::initializer_list<int32_t> okCodes, const char* file, int line) {
  DaemonIPC daemon;
  if (daemon.SendCommand(command, reply) >= 0) return 0;
  // Some refusals leave the task as the user wants it (cancelling a task
  // that is not running): the daemon's word, in an answer that came whole.
  if (reply.hasMember("error_code") &&
      std::find(okCodes.begin(), okCodes.end(), reply["error_code"].asInt32()) != okCodes.end()) {
    return 0;
  }
  Plovo::LogWrite(LOG_ERR, "%s:%d Failed to send %s command, res=[%s]", Plovo::LogBaseName(file),
                  line, what, DaemonIPC::LogText(reply).c_str());
  return GetErrorCodeFromResponse(reply);
}

bool PlovoHandle::Forward(int built, const PObject& command, PObject& reply, const char* what,
                          std::initializer_list<int32_t> okCodes, const char* file, int line) {
  if (built != 0) {
    Plovo::LogWrite(LOG_ERR, "%s:%d Failed to get daemon command", Plovo::LogBaseName(file), line);
    response->SetError(401);
    return false;
  }
  if (int code = SendToDaemon(command, reply, what, okCodes, file, line)) {
    response->SetError(code);
    return false;
  }
  return true;
}

bool PlovoHandle::ForwardTaskIdCmd(int (*build)(unsigned long, PObject&), PObject& reply, const char* what,
                                   std::initializer_list<int32_t> okCodes, const char* file, int line) {
  const auto id = request->GetAndCheckIntegral<uint64_t>("id", VELT::PARAM_REQUIRED, nullptr);
  if (id.IsInvalid()) {
    response->SetError(402);
    return false;
  }
  PObject command;
  return Forward(build(id.Get(), command), command, reply, what, okCodes, file, line);
}

void PlovoHandle::SendTaskIdCmd(int (*build)(unsigned long, PObject&), std::initializer_list<int32_t> okCodes,
                                const char* file, int line) {
  PObject reply;
  if (ForwardTaskIdCmd(build, reply, "task", okCodes, file, line)) response->SetSuccess();
}
