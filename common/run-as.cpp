#include "common/run-as.h"

#include <unistd.h>

#include <mutex>

namespace Plovo {
namespace {

// The ids the process had before the first living guard raised them.
struct Raised {
  std::mutex mutex;
  int guards = 0;
  uid_t uid = 0;
  gid_t gid = 0;
};

Raised& SharedRecord() {
  static Raised record;
  return record;
}

}  // namespace

RunAsRoot::RunAsRoot(const char* file, int line) : file_(file), line_(line) {
  Raised& raised = SharedRecord();
  std::lock_guard<std::mutex> lock(raised.mutex);
  if (raised.guards++ == 0) {
    raised.uid = geteuid();
    raised.gid = getegid();
    if (geteuid() != 0) setresuid(-1, 0, -1);
    if (getegid() != 0) setresgid(-1, 0, -1);
    if (geteuid() != 0) setresuid(-1, 0, -1);
  }
  ok_ = geteuid() == 0 && getegid() == 0;
  if (!ok_) {
    LogWrite(LOG_AUTH | LOG_ERR, "%s:%d ERROR: %s(%d, %d)", file_, line_, "IF_RUN_AS", 0, 0);
  }
}

RunAsRoot::~RunAsRoot() {
  Raised& raised = SharedRecord();
  std::lock_guard<std::mutex> lock(raised.mutex);
  if (--raised.guards > 0) return;
  bool good = true;
  if (getegid() != raised.gid) {
    // Only root may set the group back.
    if (geteuid() != 0 && setresuid(-1, 0, -1) != 0) good = false;
    if (setresgid(-1, raised.gid, -1) != 0) good = false;
  }
  // The user is restored even when the group could not be, so that a
  // failure never leaves the process as root.
  if (geteuid() != raised.uid && setresuid(-1, raised.uid, -1) != 0) good = false;
  if (!good) {
    LogWrite(LOG_AUTH | LOG_CRIT, "%s:%d ERROR: ~%s(%d, %d)", file_, line_, "IF_RUN_AS",
             static_cast<int>(raised.uid), static_cast<int>(raised.gid));
  }
}

}  // namespace Plovo
