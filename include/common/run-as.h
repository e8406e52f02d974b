// Raising the effective user and group ids to root for the length of a
// scope.
//
// The web server runs requests with its own ids; the steps that need root
// (the status lock, the repository, the databases) raise with a RunAsRoot
// guard and drop back when the guard ends, on every path. Nothing else in
// the module changes ids. The real and saved ids are never touched, so
// dropping back is always possible.
//
// The ids are changed for the calling thread only. The kernel keeps
// credentials per thread; the C library's set*id functions make every
// thread of the process follow, by signalling each one and waiting for it.
// The web server runs requests on several threads, so a process-wide change
// would let every other request run as root while one holds a guard, and
// would cost each raise and each restore a round of signals to every
// thread. Each guard therefore remembers its own thread's ids and restores
// only them; guards on different threads never see each other. A thread
// that starts another while it holds a guard hands root to the new thread,
// so do no such thing inside a guard's scope.
#ifndef PLOVO_COMMON_RUN_AS_H
#define PLOVO_COMMON_RUN_AS_H

#include <sys/types.h>

#include "common/log.h"

namespace Plovo {

class RunAsRoot {
 public:
  // Makes the effective user and group root (user first, since only root
  // may change the group, then the user again), each only where it
  // differs. A failure is logged as "<file>:<line> ERROR: IF_RUN_AS(0, 0)"
  // at LOG_AUTH | LOG_ERR with the guard's own file and line; ok() then
  // answers false.
  RunAsRoot(const char* file, int line);
  // Restores the ids the thread had when the guard began, group first. A
  // failure is logged at LOG_AUTH | LOG_CRIT as
  // "<file>:<line> ERROR: ~IF_RUN_AS(uid, gid)" with the ids it restores.
  ~RunAsRoot();
  RunAsRoot(const RunAsRoot&) = delete;
  RunAsRoot& operator=(const RunAsRoot&) = delete;

  bool ok() const { return ok_; }

 private:
  const char* file_;
  int line_;
  uid_t uid_;
  gid_t gid_;
  bool ok_ = false;
};

}  // namespace Plovo

// Declares a guard named `name` that raises to root for the rest of the scope.
#define PLOVO_RUN_AS_ROOT(name) ::Plovo::RunAsRoot name(PLOVO_FILE_NAME, __LINE__)

#endif
