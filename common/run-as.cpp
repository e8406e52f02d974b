#include "common/run-as.h"

#include <unistd.h>

#include "common/log.h"

namespace Plovo {

RunAs::RunAs(uid_t uid, gid_t gid, const char* file, int line)
    : savedUid_(geteuid()), savedGid_(getegid()), file_(file), line_(line) {
  if (savedUid_ == uid && savedGid_ == gid) return;
  // Changing the group needs root, so the user becomes root first and
  // takes its target id last.
  bool good = (geteuid() == 0 || setresuid(-1, 0, -1) == 0) &&
              (getegid() == gid || setresgid(-1, gid, -1) == 0) &&
              (geteuid() == uid || setresuid(-1, uid, -1) == 0);
  if (!good) {
    ok_ = false;
    LogWrite(LOG_AUTH | LOG_ERR, "%s:%d ERROR: %s(%d, %d)", file_, line_, "IF_RUN_AS",
             static_cast<int>(uid), static_cast<int>(gid));
  }
}

RunAs::~RunAs() {
  bool good = true;
  if (getegid() != savedGid_) {
    // Only root may set the group back.
    if (geteuid() != 0 && setresuid(-1, 0, -1) != 0) good = false;
    if (good && setresgid(-1, savedGid_, -1) != 0) good = false;
  }
  if (good && geteuid() != savedUid_ && setresuid(-1, savedUid_, -1) != 0) good = false;
  if (!good) {
    LogWrite(LOG_AUTH | LOG_CRIT, "%s:%d ERROR: ~%s(%d, %d)", file_, line_, "IF_RUN_AS",
             static_cast<int>(savedUid_), static_cast<int>(savedGid_));
  }
}

}  // namespace Plovo
