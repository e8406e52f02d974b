// The package's run-time state: the service state file, the package's
// enabled flag, the repository volume checks and the daemon's liveness.
//
// The state file "/var/packages/Plovo/etc/status" is shared by every web
// server process and the copy daemon; all reads and writes hold an
// exclusive flock on "status.lock" for one read or one write of both keys,
// so "state" and "error" always travel as a pair. Every function may be
// called from several threads and processes. The state files need root (or
// the package's user) to open; callers raise privileges around them.
#ifndef PLOVO_SERVICE_SERVICE_CTRL_H
#define PLOVO_SERVICE_SERVICE_CTRL_H

#include <chrono>
#include <string>

#include "common/export.h"

enum PLOVO_SERVICE_STATUS {
  PLOVO_SERVICE_STATUS_UNKNOWN = 0,      // a fresh record, not yet read
  PLOVO_SERVICE_STATUS_NO_REPO = 1,      // no volume can hold the repository
  PLOVO_SERVICE_STATUS_INIT = 2,         // the service prepares its environment
  PLOVO_SERVICE_STATUS_UPGRADING = 3,    // the database installer/updater runs
  PLOVO_SERVICE_STATUS_RUNNING = 4,      // written by the daemon; all methods served
  PLOVO_SERVICE_STATUS_MOVING_REPO = 5,  // the repository moves to another volume
  PLOVO_SERVICE_STATUS_STOP = 6,         // stopped
  PLOVO_SERVICE_STATUS_ERROR = 7,        // start or move failed; see `error`
};

// The pair kept in the status file. `state` holds a PLOVO_SERVICE_STATUS
// value, or whatever number the file holds; `error` is a tag such as
// "err_sys" or "err_upgrade_failed", empty when there is none.
// Defined here so that a program which loads the module can make one to
// pass to the exported GetServiceStatus.
struct ServiceStatus {
  ServiceStatus() : state(PLOVO_SERVICE_STATUS_UNKNOWN) {}
  ~ServiceStatus() = default;

  int state;
  std::string error;
};

// Reads both keys under the lock into status. Returns 0, or -1 when the lock
// file cannot be opened or locked within the lock wait (5 seconds), the
// status file exists but is not a regular file, or either key cannot be
// read (a state read before the failure stays in status.state).
PLOVO_EXPORT int GetServiceStatus(ServiceStatus& status);

// Writes both keys under the lock. Returns 0, or -1 when the lock cannot be
// taken within the lock wait, the status file is not a regular file, or a
// key cannot be written ("error" is not written after a failed "state").
PLOVO_EXPORT int SetServiceStatus(const ServiceStatus& status);

// Replaces the 5-second wait for "status.lock" in every later read and
// write; zero or less restores it. For tests, which cannot wait that long.
void SetServiceStatusLockWait(std::chrono::milliseconds wait);

// True when the package is enabled ("/var/packages/Plovo/enabled" exists).
bool IsPkgEnable();

// True when volumePath exists and the platform knows it as a mounted volume.
bool IsRepoMounted(const std::string& volumePath);

// True when volumePath is a mounted, writable, internal volume: one that may
// hold the repository.
bool IsRepoValid(const std::string& volumePath);

// The daemon's liveness from "/var/run/plovod.pid": 0 alive, 1 pid file
// present but the process gone, 3 no usable pid file.
int StatusService();

// Serialises the service's start, stop and repository move, between
// processes and between threads, for the whole of each: two moves at once
// would delete each other's copies, and a start beside a move would run
// the installer on a half-copied repository. Blocks until the exclusive
// flock on "/var/packages/Plovo/etc/service.lock" is taken. Not
// re-entrant: whoever holds it calls the ...Locked functions below.
class ServiceLock {
 public:
  ServiceLock();
  ~ServiceLock();
  ServiceLock(const ServiceLock&) = delete;
  ServiceLock& operator=(const ServiceLock&) = delete;

  // False when the lock file cannot be opened or locked (logged).
  bool locked() const { return locked_; }

 private:
  int fd_ = -1;
  bool locked_ = false;
};

// Brings the enabled package to a running daemon: settles the repository
// volume (the recorded one, else an existing "@Plovo" on a mounted volume,
// else the first mounted, writable, internal volume), creates the
// repository, runs the installer and migrations, shows the scheduler
// entries and starts the daemon program, which writes the running state
// itself. States written on the way: 2, 3; 1 when no volume can hold the
// repository (the daemon is then not started); 7 with "err_upgrade_failed"
// or "err_sys" on a failure. 0 on success, when the package is disabled
// (nothing is done), when the daemon already runs (nothing is done) and in
// state 1; -1 on failure. Blocks while the installer and the daemon's
// start run, under the ServiceLock.
PLOVO_EXPORT int StartService(void);

// Stops the daemon: the "stop" command, then SIGTERM to the process of the
// pid file, waiting up to ten seconds (probing every 100 ms) before
// SIGKILL; then hides the scheduler entries and writes state 6. The daemon
// holds its pid file under an exclusive flock for its whole life: a pid
// file nobody holds, or whose process is gone, is stale, so it is removed
// and counts as stopped, and the process it names (some other program by
// now) is left alone. 0, or -1 when there is no pid file or the signal
// cannot be sent (the state is then left alone). Under the ServiceLock.
PLOVO_EXPORT int StopService(void);

// StartService and StopService for a caller that already holds the
// ServiceLock: a repository move stops and starts the service under its
// own.
int StartServiceLocked();
int StopServiceLocked();

// Replaces the ten seconds StopService waits for the daemon to go before
// it kills it; zero or less restores them. For tests.
void SetStopServiceWait(std::chrono::milliseconds wait);

#endif
