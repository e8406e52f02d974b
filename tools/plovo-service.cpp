// plovo-service: the host of the module's service entry points, as the
// package's service control and the platform's usage collector call them.
//
//   plovo-service [--module PATH] start|stop|status|stats
//
// start, stop and stats load the module (by default the one installed
// beside this program), call StartService, StopService or
// CollectUageStatistics and exit 0 when it returned 0, 1 otherwise. status
// prints the service state as {"state":N,"error":"TAG"} (exit 1 when it
// cannot be read). Usage and loading errors exit 2. The module's log lines
// go to syslog and stderr; stdout carries only what the entry point prints.
#include <dlfcn.h>
#include <json/writer.h>
#include <syslog.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "module-path.h"
#include "service/service-ctrl.h"

namespace {

int Usage(const char* why) {
  std::fprintf(stderr,
               "plovo-service: %s\n"
               "usage: plovo-service [--module PATH] start|stop|status|stats\n",
               why);
  return 2;
}

}  // namespace

int main(int argc, char** argv) {
  std::string modulePath = DefaultModulePath();
  int arg = 1;
  if (arg < argc && std::strcmp(argv[arg], "--module") == 0) {
    if (arg + 1 >= argc) return Usage("--module needs a path");
    modulePath = argv[arg + 1];
    arg += 2;
  }
  if (arg + 1 != argc) return Usage(arg >= argc ? "no command given" : "too many arguments");
  const std::string command = argv[arg];
  const char* entry = command == "start"   ? "StartService"
                      : command == "stop"  ? "StopService"
                      : command == "stats" ? "CollectUageStatistics"
                      : command == "status" ? "GetServiceStatus"
                                            : nullptr;
  if (!entry) return Usage(("unknown command " + command).c_str());

  openlog("plovo-service", LOG_PERROR, LOG_USER);
  setlogmask(LOG_UPTO(LOG_INFO));
  void* module = dlopen(modulePath.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (!module) {
    std::fprintf(stderr, "plovo-service: cannot load module: %s\n", dlerror());
    return 2;
  }
  void* symbol = dlsym(module, entry);
  if (!symbol) {
    std::fprintf(stderr, "plovo-service: %s lacks %s\n", modulePath.c_str(), entry);
    return 2;
  }

  if (command == "status") {
    ServiceStatus status;
    if (reinterpret_cast<int (*)(ServiceStatus&)>(symbol)(status) != 0) return 1;
    // By hand, so that "state" comes first as the line is documented.
    std::printf("{\"state\":%d,\"error\":%s}\n", status.state,
                Json::valueToQuotedString(status.error.c_str()).c_str());
    return 0;
  }
  return reinterpret_cast<int (*)()>(symbol)() == 0 ? 0 : 1;
}
