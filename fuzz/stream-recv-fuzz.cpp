// Feeds arbitrary bytes to the message receiver through a real socket pair.
// Any input must give 0 or a negative code: never a crash, a hang, a leak or
// memory out of proportion to the input.
#include <dirent.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>
#include <string>

#include "fuzz-socket.h"
#include "common/log.h"
#include "ipc/channel.h"
#include "ipc/pobject.h"
#include "ipc/stream.h"

namespace {

// Received files (binaries without a destination) land here and are
// removed after every input.
// A plain array, so that it is still there when the exit handler runs.
char gScratch[] = "/tmp/plovo-fuzz-XXXXXX";

std::string ScratchDir() {
  static const bool made = [] {
    if (mkdtemp(gScratch) == nullptr) abort();
    atexit([] { rmdir(gScratch); });  // emptied after every input
    return true;
  }();
  (void)made;
  return gScratch;
}

void EmptyScratchDir() {
  DIR* dir = opendir(ScratchDir().c_str());
  if (dir == nullptr) return;
  while (dirent* entry = readdir(dir)) {
    std::string name = entry->d_name;
    if (name != "." && name != "..") unlink((ScratchDir() + "/" + name).c_str());
  }
  closedir(dir);
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // A sink makes the receiver format its debug trace too, without syslog.
  Plovo::SetLogSink([](int, const std::string&) {});
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const int input = InputSocket(data, size);

  int result;
  {
    Channel channel(81920);
    if (channel.Open(input, true) != 0) abort();
    channel.SetTimeout(1);
    PStream stream;
    stream.SetDefaultRecvLocation(ScratchDir());
    PObject value;
    result = stream.Recv(channel, value);
  }
  EmptyScratchDir();
  if (result > 0) abort();
  return 0;
}
