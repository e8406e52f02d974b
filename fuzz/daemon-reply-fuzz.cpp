// Feeds arbitrary bytes to DaemonIPC as the daemon's answer, over the
// sandbox's daemon socket, exactly as the module sends a command and reads
// the answer. Any input must give 0 or -1: never a crash, a hang, a leak,
// memory out of proportion to the input, or a file anywhere (an answer never
// carries files; the scratch root holds only its socket afterwards, and the
// root and working folders are as they were).
#include <dirent.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdint>
#include <set>
#include <string>
#include <thread>

#include "common/log.h"
#include "common/paths.h"
#include "ipc/daemon-ipc.h"
#include "ipc/pobject.h"

namespace {

char gScratch[] = "/tmp/plovo-fuzz-XXXXXX";
int gListener = -1;
std::set<std::string> gRootBefore, gCwdBefore, gTmpBefore;

std::set<std::string> Entries(const std::string& dir) {
  std::set<std::string> names;
  if (DIR* d = opendir(dir.c_str())) {
    while (dirent* e = readdir(d)) names.insert(e->d_name);
    closedir(d);
  }
  return names;
}

void RemoveScratch() {
  unlink(Plovo::Path::DaemonSocket().c_str());
  rmdir((std::string(gScratch) + "/tmp").c_str());
  rmdir(gScratch);
}

// One connection: the command is read and dropped, the input is the answer.
void Answer(const uint8_t* data, size_t size) {
  int fd = accept(gListener, nullptr, nullptr);
  if (fd < 0) return;
  size_t written = 0;
  while (written < size) {
    ssize_t n = send(fd, data + written, size - written, MSG_NOSIGNAL);
    if (n <= 0) break;  // the client has given up
    written += static_cast<size_t>(n);
  }
  shutdown(fd, SHUT_WR);
  char drain[4096];
  while (recv(fd, drain, sizeof(drain), 0) > 0) {
  }
  close(fd);
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  Plovo::SetLogSink([](int, const std::string&) {});
  if (mkdtemp(gScratch) == nullptr) abort();
  setenv("PLOVO_ROOT", gScratch, 1);
  if (mkdir((std::string(gScratch) + "/tmp").c_str(), 0700) != 0) abort();
  gListener = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  Plovo::Path::DaemonSocket().copy(addr.sun_path, sizeof(addr.sun_path) - 1);
  if (bind(gListener, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0 || listen(gListener, 4) != 0) abort();
  atexit(RemoveScratch);
  gRootBefore = Entries("/");
  gCwdBefore = Entries(".");
  gTmpBefore = Entries(std::string(gScratch) + "/tmp");
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::thread daemon(Answer, data, size);
  PObject command;
  command["action"] = "list_task";
  PObject response;
  DaemonIPC ipc;
  ipc.SetTimeLimit(1);
  int result = ipc.SendCommand(command, response);
  daemon.join();
  if (result != 0 && result != -1) abort();
  if (Entries("/") != gRootBefore || Entries(".") != gCwdBefore ||
      Entries(std::string(gScratch) + "/tmp") != gTmpBefore) {
    abort();  // a file was written
  }
  return 0;
}
