// plovo-notifier: tells the copy daemon about an event of the platform. A
// task's scheduler entry runs it when the task is due, the hot-plug hook
// when a removable device's share comes or goes.
//
//   plovo-notifier --execute-task N       {"action": "run_task", "task_id": N}
//   plovo-notifier --device-added SHARE   {"action": "device_added", "share_name": SHARE}
//   plovo-notifier --device-removed SHARE {"action": "device_removed", "share_name": SHARE}
//
// Every request asks for an acknowledgement ("need_ack": 1). Exits 0 when
// the daemon acknowledged, 1 when it answered an error or could not be
// reached, 2 for a usage error. Messages go to stderr (and syslog); stdout
// stays empty.
#include <syslog.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <utility>

#include "ipc/daemon-ipc.h"
#include "ipc/plovo-command.h"

namespace {

// A scheduler entry or hook must not hang for long on a daemon that
// accepts but never answers.
constexpr unsigned int kTimeLimit = 10;

int Usage(const std::string& why) {
  std::fprintf(stderr,
               "plovo-notifier: %s\n"
               "usage: plovo-notifier --execute-task N | --device-added SHARE | --device-removed SHARE\n",
               why.c_str());
  return 2;
}

// A task id: a positive decimal number of at most 64 bits, digits only.
bool ParseTaskId(const char* text, uint64_t* id) {
  if (text[0] == '\0') return false;
  for (const char* p = text; *p; ++p) {
    if (*p < '0' || *p > '9') return false;
  }
  errno = 0;
  const unsigned long long value = std::strtoull(text, nullptr, 10);
  if (errno == ERANGE || value == 0) return false;
  *id = value;
  return true;
}

// A share name is one path component of the NAS's root.
bool ValidShareName(const std::string& name) {
  return !name.empty() && name.find('/') == std::string::npos && name != "." && name != "..";
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 3) return Usage(argc < 3 ? "an option and its value are needed" : "too many arguments");
  const std::string option = argv[1];
  const char* value = argv[2];
  PObject request;
  if (option == "--execute-task") {
    uint64_t id = 0;
    static_assert(sizeof(unsigned long) == sizeof(uint64_t), "task ids are 64-bit");
    if (!ParseTaskId(value, &id)) return Usage(std::string("not a task id: '") + value + "'");
    Plovo::StartTaskCmd(id, request);
  } else if (option == "--device-added" || option == "--device-removed") {
    if (!ValidShareName(value)) return Usage(std::string("not a share name: '") + value + "'");
    request["action"] = option == "--device-added" ? "device_added" : "device_removed";
    request["need_ack"] = 1;
    request["share_name"] = value;
  } else {
    return Usage("unknown option " + option);
  }

  // The IPC layer's lines say which step failed and why.
  openlog("plovo-notifier", LOG_PERROR, LOG_USER);
  setlogmask(LOG_UPTO(LOG_INFO));
  const std::string action = request["action"].asString();
  DaemonIPC ipc;
  ipc.SetTimeLimit(kTimeLimit);
  PObject response;
  if (ipc.SendCommand(request, response) == 0) return 0;
  if (response.hasMember("error")) {
    const PObject& code = std::as_const(response)["error_code"];
    if (code.isInteger()) {
      std::fprintf(stderr, "plovo-notifier: %s: error %lld\n", action.c_str(),
                   static_cast<long long>(code.asInt64()));
    } else {
      std::fprintf(stderr, "plovo-notifier: %s: error without a code: %s\n", action.c_str(),
                   DaemonIPC::LogText(response).c_str());
    }
  } else if (response.isEmpty()) {
    std::fprintf(stderr, "plovo-notifier: %s: no answer from the daemon at %s\n", action.c_str(),
                 ipc.socketPath().c_str());
  } else {
    std::fprintf(stderr, "plovo-notifier: %s: the daemon did not acknowledge: %s\n", action.c_str(),
                 DaemonIPC::LogText(response).c_str());
  }
  return 1;
}
