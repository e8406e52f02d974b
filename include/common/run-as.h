// Raising the effective user and group ids to root for the length of a
// scope.
//
// The web server runs requests with its own ids; the steps that need root
// (the status lock, the repository, the databases) raise with a RunAsRoot
// guard and drop back when the guard ends, on every path. Nothing else in
// the module changes ids. The real and saved ids are never touched, so
// dropping back is always possible.
//
// Ids belong to the whole process, and the server runs requests on several
// threads. The guards therefore share one record: the first guard to start
// remembers the ids and raises, the last one to end restores them. While any
// guard lives, every thread of the process runs as root, so keep scopes
// short.
#ifndef PLOVO_COMMON_RUN_AS_H
#define PLOVO_COMMON_RUN_AS_H

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
  // The last guard to end restores the remembered ids, group first. A
  // failure is logged at LOG_AUTH | LOG_CRIT as
  // "<file>:<line> ERROR: ~IF_RUN_AS(uid, gid)" with the ids it restores.
  ~RunAsRoot();
  RunAsRoot(const RunAsRoot&) = delete;
  RunAsRoot& operator=(const RunAsRoot&) = delete;

  bool ok() const { return ok_; }

 private:
  const char* file_;
  int line_;
  bool ok_ = false;
};

}  // namespace Plovo

// Declares a guard named `name` that raises to root for the rest of the scope.
#define PLOVO_RUN_AS_ROOT(name) ::Plovo::RunAsRoot name(PLOVO_FILE_NAME, __LINE__)

#endif
