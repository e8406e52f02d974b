#include "common/run-as.h"

#include <sys/syscall.h>
#include <unistd.h>

namespace Plovo {
namespace {

// The raw system calls change the calling thread's credentials only. The C
// library's setresuid and setresgid would change every thread of the
// process, signalling each one and waiting for it.
bool SetThreadEffectiveUid(uid_t uid) { return syscall(SYS_setresuid, -1, uid, -1) == 0; }
bool SetThreadEffectiveGid(gid_t gid) { return syscall(SYS_setresgid, -1, gid, -1) == 0; }

}  // namespace

RunAsRoot::RunAsRoot(const char* file, int line)
    : file_(file), line_(line), uid_(geteuid()), gid_(getegid()) {
  // A change that succeeded is known to hold, so the ids are read once.
  bool userRoot = uid_ == 0, groupRoot = gid_ == 0;
  if (!userRoot) userRoot = SetThreadEffectiveUid(0);
  if (!groupRoot) groupRoot = SetThreadEffectiveGid(0);
  if (!userRoot) userRoot = SetThreadEffectiveUid(0);
  ok_ = userRoot && groupRoot;
  if (!ok_) {
    LogWrite(LOG_AUTH | LOG_ERR, "%s:%d ERROR: %s(%d, %d)", file_, line_, "IF_RUN_AS", 0, 0);
  }
}

RunAsRoot::~RunAsRoot() {
  bool good = true;
  if (getegid() != gid_) {
    // Only root may set the group back.
    if (geteuid() != 0 && !SetThreadEffectiveUid(0)) good = false;
    if (!SetThreadEffectiveGid(gid_)) good = false;
  }
  // The user is restored even when the group could not be, so that a
  // failure never leaves the thread as root.
  if (geteuid() != uid_ && !SetThreadEffectiveUid(uid_)) good = false;
  if (!good) {
    LogWrite(LOG_AUTH | LOG_CRIT, "%s:%d ERROR: ~%s(%d, %d)", file_, line_, "IF_RUN_AS",
             static_cast<int>(uid_), static_cast<int>(gid_));
  }
}

}  // namespace Plovo
