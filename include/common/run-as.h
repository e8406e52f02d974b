// Raising the effective user and group ids for the length of a scope.
//
// The web server runs requests with its own ids; the steps that need root
// (the status lock, the repository, the databases) raise to root with a
// RunAs guard and drop back when the guard ends, on every path. Nothing
// else in the module changes ids. The real and saved ids are never
// touched, so dropping back is always possible.
//
// Ids are per process: a guard changes them for every thread of the web
// server until it ends, so keep the scope short.
#ifndef PLOVO_COMMON_RUN_AS_H
#define PLOVO_COMMON_RUN_AS_H

#include <sys/types.h>

namespace Plovo {

class RunAs {
 public:
  // Sets the effective ids to uid and gid (user, then group, then user
  // again, each only where it differs). A failure is logged as
  // "<file>:<line> ERROR: IF_RUN_AS(uid, gid)" at LOG_AUTH | LOG_ERR, with
  // the file and line of the guard's user; ok() then answers false.
  RunAs(uid_t uid, gid_t gid, const char* file, int line);
  // Restores the ids the constructor found: group first, then user. A
  // failure is logged at LOG_AUTH | LOG_CRIT as
  // "<file>:<line> ERROR: ~IF_RUN_AS(uid, gid)" with the ids it restores.
  ~RunAs();
  RunAs(const RunAs&) = delete;
  RunAs& operator=(const RunAs&) = delete;

  bool ok() const { return ok_; }

 private:
  uid_t savedUid_;
  gid_t savedGid_;
  const char* file_;
  int line_;
  bool ok_ = true;
};

}  // namespace Plovo

// Declares a guard named `name` that raises to root for the rest of the scope.
#define PLOVO_RUN_AS_ROOT(name) ::Plovo::RunAs name(0, 0, __FILE_NAME__, __LINE__)

#endif
