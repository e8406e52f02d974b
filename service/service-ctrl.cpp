#include "service/service-ctrl.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>
#include <velt/log.h>
#include <velt/mount.h>
#include <velt/vlibc.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <thread>

#include "common/error-text.h"
#include "common/file-op.h"
#include "common/log.h"
#include "common/no-throw.h"
#include "common/paths.h"
#include "common/unique-fd.h"
#include "common/utility.h"
#include "common/velt-sdk-wrapper.h"
#include "ipc/daemon-ipc.h"
#include "ipc/pobject.h"
#include "service/global-setting.h"
#include "service/repo-volume.h"
#include "service/schedule.h"
#include "updater/updater-core.h"

namespace {

// A holder keeps "status.lock" for one read or write of two short lines, so
// a longer wait means a stuck holder: the request then fails (the gate
// answers "not ready") instead of hanging its server thread.
constexpr std::chrono::milliseconds kStatusLockWait = std::chrono::seconds(5);
// flock has no timeout; a waiter retries at this pace until its deadline.
constexpr std::chrono::milliseconds kStatusLockRetry{1};

std::atomic<std::chrono::milliseconds::rep> gStatusLockWaitMs{kStatusLockWait.count()};

// Takes the exclusive flock on fd, giving up after wait. False on timeout
// (*timedOut set) or on any other flock failure.
bool LockWithin(int fd, std::chrono::milliseconds wait, bool* timedOut) {
  const auto deadline = std::chrono::steady_clock::now() + wait;
  *timedOut = false;
  for (;;) {
    if (flock(fd, LOCK_EX | LOCK_NB) == 0) return true;
    // A signal says nothing about the holder: ask again at once, without
    // spending the wait on it.
    if (errno == EINTR) continue;
    if (errno != EWOULDBLOCK) return false;
    if (std::chrono::steady_clock::now() >= deadline) {
      *timedOut = true;
      return false;
    }
    std::this_thread::sleep_for(kStatusLockRetry);
  }
}

// Holds the exclusive lock on "status.lock" for one read or write of the
// status file.
class StatusLock {
 public:
  StatusLock()
      : fd_(open(Plovo::Path::StatusLockFile().c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0440)) {
    if (!fd_) {
      PLOVO_LOG(LOG_ERR, "Failed to open plovo status lock file.");
      return;
    }
    const std::chrono::milliseconds wait(gStatusLockWaitMs.load());
    bool timedOut = false;
    if (!LockWithin(fd_.get(), wait, &timedOut)) {
      PLOVO_LOG(LOG_ERR, "Failed to lock file.");
      if (timedOut) {
        PLOVO_LOG(LOG_ERR, "The plovo status lock is still held after %lld ms.",
                  static_cast<long long>(wait.count()));
      }
      return;
    }
    locked_ = true;
  }
  ~StatusLock() {
    if (locked_) flock(fd_.get(), LOCK_UN);
  }
  StatusLock(const StatusLock&) = delete;
  StatusLock& operator=(const StatusLock&) = delete;

  bool locked() const { return locked_; }

 private:
  Plovo::UniqueFd fd_;
  bool locked_ = false;
};

// The status file's values fit easily; the buffer size is the file format's.
constexpr size_t kStatusValueSize = 1024;

// The status file is read or replaced only when it is a plain file (or
// missing, which the key/value calls report themselves): a FIFO would block
// the request for good, a device such as /dev/zero would be read without
// end, and a symbolic link could lead to either. Only root and the package
// may write its folder, so the file is not swapped between this check and
// the read.
bool StatusFileIsPlain(const std::string& file) {
  struct stat st;
  if (lstat(file.c_str(), &st) != 0 || S_ISREG(st.st_mode)) return true;
  PLOVO_LOG(LOG_ERR, "Plovo status file is not a regular file.");
  return false;
}

}  // namespace

void SetServiceStatusLockWait(std::chrono::milliseconds wait) {
  gStatusLockWaitMs.store(wait.count() > 0 ? wait.count() : kStatusLockWait.count());
}

namespace {

int ReadServiceStatus(ServiceStatus& status) {
  StatusLock lock;
  if (!lock.locked()) return -1;

  const std::string file = Plovo::Path::StatusFile();
  if (!StatusFileIsPlain(file)) return -1;
  char value[kStatusValueSize] = {};
  if (VLIBCFileGetKeyValue(file.c_str(), "state", value, sizeof(value), 0) < 1) {
    PLOVO_LOG(LOG_ERR, "Failed to get plovo service state.");
    return -1;
  }
  status.state = static_cast<int>(std::strtol(value, nullptr, 10));

  if (VLIBCFileGetKeyValue(file.c_str(), "error", value, sizeof(value), 0) < 1) {
    PLOVO_LOG(LOG_ERR, "Failed to get plovo service error state.");
    return -1;
  }
  status.error = value;
  return 0;
}

int WriteServiceStatus(const ServiceStatus& status) {
  StatusLock lock;
  if (!lock.locked()) return -1;

  const std::string file = Plovo::Path::StatusFile();
  if (!StatusFileIsPlain(file)) return -1;
  const std::string state = Plovo::NumToString(status.state);
  if (VLIBCFileSetKeyValue(file.c_str(), "state", state.c_str(), "%s=\"%s\"\n") < 0) {
    PLOVO_LOG(LOG_ERR, "Failed to set plovo service state to [%d].", status.state);
    return -1;
  }
  if (VLIBCFileSetKeyValue(file.c_str(), "error", status.error.c_str(), "%s=\"%s\"\n") < 0) {
    PLOVO_LOG(LOG_ERR, "Failed to set plovo service error to [%s].", status.error.c_str());
    return -1;
  }
  return 0;
}

}  // namespace

int GetServiceStatus(ServiceStatus& status) {
  return Plovo::NoThrow([&] { return ReadServiceStatus(status); }, -1);
}

int SetServiceStatus(const ServiceStatus& status) {
  return Plovo::NoThrow([&] { return WriteServiceStatus(status); }, -1);
}

bool IsPkgEnable() { return VLIBCFileExist(Plovo::Path::EnabledFile().c_str()) == 1; }

bool IsRepoMounted(const std::string& volumePath) {
  if (volumePath.empty()) return false;
  if (VLIBCFileExist(volumePath.c_str()) != 1) {
    PLOVO_LOG(LOG_ERR, "Repo volumn path not exist '%s'", volumePath.c_str());
    return false;
  }
  PVELTMOUNTVOLINFO info = nullptr;
  if (VELTMountVolInfoGet(volumePath.c_str(), &info) != 0) {
    PLOVO_LOG(LOG_ERR, "Plovo repo NOT mounted '%s'", volumePath.c_str());
    return false;
  }
  VELTMountVolInfoFree(info);
  return true;
}

bool IsRepoValid(const std::string& volumePath) {
  if (volumePath.empty()) return false;
  PVELTMOUNTVOLINFO info = nullptr;
  if (VELTMountVolInfoGet(volumePath.c_str(), &info) != 0) {
    PLOVO_LOG(LOG_ERR, "Plovo repo NOT mounted '%s'", volumePath.c_str());
    return false;
  }
  const bool usable = info->isMounted == 1 && info->isWritable == 1;
  const int location = info->location;
  VELTMountVolInfoFree(info);
  if (!usable) {
    PLOVO_LOG(LOG_ERR, "volume not mounted or writable");
    return false;
  }
  if (location != VELT_VOL_LOCATION_INTERNAL) {
    PLOVO_LOG(LOG_ERR, "volume not internal (%d)", location);
    return false;
  }
  return true;
}

int StatusService() {
  const int pid = VLIBCReadPidFile(Plovo::Path::DaemonPidFile().c_str());
  if (pid < 1) return 3;
  return VLIBCProcAlive(pid) ? 0 : 1;
}

namespace {

constexpr unsigned int kEventServiceStarted = 0x11B01050;
constexpr unsigned int kEventServiceStopped = 0x11B01051;

// A daemon that has not gone this long after SIGTERM is killed. It is
// probed often, so that one which exits at once is seen gone at once.
constexpr std::chrono::milliseconds kStopWait = std::chrono::seconds(10);
constexpr std::chrono::milliseconds kStopProbe{100};
std::atomic<std::chrono::milliseconds::rep> gStopWaitMs{kStopWait.count()};

// The volumes the platform knows, freed with the object.
class VolumeList {
 public:
  VolumeList() {
    if (VELTMountVolAllEnum(&head_) < 0) {
      PLOVO_LOG(LOG_ERR, "VELTMountVolAllEnum() failed[0x%04X %s:%d]",
                static_cast<unsigned>(VLIBCErrGet()), VLIBCErrorGetFile(), VLIBCErrorGetLine());
      head_ = nullptr;
    }
  }
  ~VolumeList() { VELTMountVolInfoFree(head_); }
  VolumeList(const VolumeList&) = delete;
  VolumeList& operator=(const VolumeList&) = delete;

  PVELTMOUNTVOLINFO head() const { return head_; }

 private:
  PVELTMOUNTVOLINFO head_ = nullptr;
};

// The base path the package uses on a volume. A path that would not read
// back whole from setting.conf is no use as the repository's.
bool BasePath(const char* volume, std::string& base) {
  if (SDK::PathGetShareBin(volume, base) != 0) return false;
  if (base.size() > Plovo::GlobalSetting::kMaxRepoVolumePath) {
    PLOVO_LOG(LOG_ERR, "volume path too long [%s]", base.c_str());
    return false;
  }
  return true;
}

// The mounted volume whose base path already holds a repository, in the
// platform's order; "" when none does.
std::string FindExistingRepo() {
  VolumeList volumes;
  for (PVELTMOUNTVOLINFO v = volumes.head(); v; v = v->pNext) {
    std::string base;
    if (v->isMounted != 1 || !BasePath(v->szPath, base)) continue;
    if (IsFileExist(base + "/@Plovo")) return base;
  }
  return "";
}

// The first mounted, writable, internal volume's base path; "" when none.
std::string ChooseRepoVolume() {
  VolumeList volumes;
  for (PVELTMOUNTVOLINFO v = volumes.head(); v; v = v->pNext) {
    if (v->isMounted != 1 || v->isWritable != 1) {
      PLOVO_LOG(LOG_ERR, "volume not mounted or writable");
      continue;
    }
    if (v->location != VELT_VOL_LOCATION_INTERNAL) {
      PLOVO_LOG(LOG_ERR, "volume not internal (%d)", v->location);
      continue;
    }
    std::string base;
    if (BasePath(v->szPath, base)) return base;
  }
  return "";
}

bool WriteState(int state) {
  ServiceStatus status;
  status.state = state;
  return SetServiceStatus(status) == 0;
}

// Whether the process pid has ended. One that has exited but is not yet
// collected by its parent (init, for a daemon) still answers signal 0,
// for as long as the parent takes; it is gone all the same.
bool ProcessGone(int pid) {
  if (kill(pid, 0) != 0) return errno == ESRCH;
  char path[32];
  std::snprintf(path, sizeof path, "/proc/%d/stat", pid);
  FILE* file = std::fopen(path, "re");
  if (!file) return errno == ENOENT;
  char line[512] = {};
  const size_t n = std::fread(line, 1, sizeof line - 1, file);
  std::fclose(file);
  // "<pid> (<name>) <state> ...": the name may hold ") " itself.
  const char* close = std::strrchr(line, ')');
  return n > 0 && close && (close[1] == ' ') && (close[2] == 'Z' || close[2] == 'X');
}

// Whether some process holds the pid file's lock, as the daemon does for
// its whole life.
bool PidFileHeld(const std::string& pidFile) {
  // Without O_NONBLOCK a FIFO put in its place would hold the stop forever.
  Plovo::UniqueFd fd(open(pidFile.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
  if (!fd) return false;
  if (flock(fd.get(), LOCK_SH | LOCK_NB) == 0) {
    flock(fd.get(), LOCK_UN);
    return false;
  }
  return errno == EWOULDBLOCK;
}

// Whether pid runs the package's daemon program (reached through whatever
// link names it).
bool RunsDaemonProgram(int pid) {
  char link[32];
  std::snprintf(link, sizeof link, "/proc/%d/exe", pid);
  char exe[PATH_MAX];
  const ssize_t n = readlink(link, exe, sizeof exe - 1);
  if (n <= 0) return false;
  exe[n] = '\0';
  char* program = realpath(Plovo::Path::DaemonProgram().c_str(), nullptr);
  const bool same = program && std::strcmp(program, exe) == 0;
  std::free(program);
  return same;
}

// Whether the process a pid file names is the package's daemon. A pid file
// outlives a daemon that crashed, and after a restart its number may be
// any other program's, which must be neither signalled nor taken for a
// running daemon.
bool IsDaemon(int pid, const std::string& pidFile) {
  return PidFileHeld(pidFile) || RunsDaemonProgram(pid);
}

// Settles which volume holds the repository before anything is prepared
// on it. 1: repo is usable; 0: no volume can hold one (state 1 written,
// the start ends there with result); -1: the start fails.
int SettleRepoVolume(std::string& repo, int& result) {
  if (repo.empty()) {
    const std::string existing = FindExistingRepo();
    if (!existing.empty()) {
      if (SetRepoVolumePath(existing)) {
        PLOVO_LOG(LOG_INFO, "Success to reuse repo path [%s].", existing.c_str());
      } else {
        PLOVO_LOG(LOG_ERR, "Failed to reuse repo path [%s].", existing.c_str());
      }
      repo = existing;
    }
  }
  if (IsRepoValid(repo)) return 1;
  // A recorded volume that is gone (not mounted at boot, removed) holds no
  // repository to move. Choosing another volume here would hide the old
  // one when it comes back; the user chooses instead, in state 1, and
  // until then the record keeps naming the old volume.
  if (!repo.empty() && !IsFileExist(repo + "/@Plovo")) {
    PLOVO_LOG(LOG_ERR, "Repo volume [%s] holds no repository.", repo.c_str());
    if (!WriteState(PLOVO_SERVICE_STATUS_NO_REPO)) {
      PLOVO_LOG(LOG_ERR, "fail to SetServiceStatus()");
      result = -1;
    }
    return 0;
  }

  const std::string chosen = ChooseRepoVolume();
  if (chosen.empty()) {
    if (!WriteState(PLOVO_SERVICE_STATUS_NO_REPO)) {
      PLOVO_LOG(LOG_ERR, "fail to SetServiceStatus()");
      result = -1;
      return 0;
    }
    result = SetRepoVolumePath("") ? 0 : -1;
    return 0;
  }
  if (!repo.empty()) {
    if (!move_repo_volume(repo, chosen)) return -1;
    PLOVO_LOG(LOG_ERR, "Repo volume [%s] was not valid, create new repo volume as [%s].",
              repo.c_str(), chosen.c_str());
    if (MakeRepo(chosen) != 0) return -1;
  } else {
    if (MakeRepo(chosen) != 0) return -1;
    PLOVO_LOG(LOG_ERR, "Repo volume was empty, create default repo volume as [%s].",
              chosen.c_str());
  }
  if (!SetRepoVolumePath(chosen)) return -1;
  // The old repository goes only once the new volume is recorded.
  if (!repo.empty()) RetireRepo(repo);
  repo = chosen;
  return 1;
}

// Prepares the repository on repo and starts the daemon. 0 when the
// daemon started; -1 on failure, with status.error set when the failure
// has a tag of its own.
int PrepareAndRun(const std::string& repo, UpdaterCore& updater, ServiceStatus& status) {
  if (!WriteState(PLOVO_SERVICE_STATUS_INIT)) {
    PLOVO_LOG(LOG_ERR, "fail to update plovo status to init.");
    return -1;
  }
  if (!init_global_setting()) return -1;
  if (MakeRepo(repo) != 0) {
    PLOVO_LOG(LOG_ERR, "Failed to MakeRepo '%s'", repo.c_str());
    PLOVO_LOG(LOG_ERR, "fail to prepare env.");
    return -1;
  }
  if (!WriteState(PLOVO_SERVICE_STATUS_UPGRADING)) {
    PLOVO_LOG(LOG_ERR, "fail to update plovo status to upgrading.");
    return -1;
  }
  if (updater.Update(repo + "/@Plovo") != 0) {
    status.error = "err_upgrade_failed";
    PLOVO_LOG(LOG_ERR, "fail to run updater");
    return -1;
  }
  if (!Plovo::ShowAllSchedule()) {
    PLOVO_LOG(LOG_ERR, "fail to ShowAllSchedule");
    return -1;
  }
  // The daemon puts itself in the background; the state "running" is its
  // own to write once it serves.
  if (VLIBCExec(Plovo::Path::DaemonProgram().c_str(), nullptr, nullptr, nullptr, nullptr) < 0) {
    PLOVO_LOG(LOG_ERR, "Failed to start daemon\n");
    status.error = "err_sys";
    PLOVO_LOG(LOG_ERR, "fail to run daemon");
    return -1;
  }
  VELTLogSet1(VELT_LOG_CATEGORY_SYSTEM, VELT_LOG_LEVEL_INFO, kEventServiceStarted, "Plovo", "", "",
              "");
  return 0;
}

int Start() {
  ServiceStatus status;
  UpdaterCore updater;
  if (!IsPkgEnable()) return 0;
  // A second daemon would refuse to start, and the installer would run
  // under the first one's feet.
  const std::string pidFile = Plovo::Path::DaemonPidFile();
  const int pid = VLIBCReadPidFile(pidFile.c_str());
  if (pid >= 1 && !ProcessGone(pid) && IsDaemon(pid, pidFile)) {
    PLOVO_LOG(LOG_INFO, "daemon is already running");
    return 0;
  }

  std::string repo = Plovo::GlobalSetting::GetRepoVolumePath();
  int result = 0;
  const int settled = SettleRepoVolume(repo, result);
  if (settled == 0) return result;
  if (settled > 0 && PrepareAndRun(repo, updater, status) == 0) return 0;

  status.state = PLOVO_SERVICE_STATUS_ERROR;
  if (status.error.empty()) status.error = "err_sys";
  if (SetServiceStatus(status) != 0) PLOVO_LOG(LOG_ERR, "fail to update plovo status to error.");
  return -1;
}

// Ends the daemon of pid, which has been asked to stop: SIGTERM, then
// SIGKILL when it outlives the wait. 0 when it is gone or killed.
int EndDaemon(int pid) {
  if (kill(pid, SIGTERM) != 0) {
    if (errno == ESRCH) {
      PLOVO_LOG(LOG_INFO, "pid does not exist\n");
      unlink(Plovo::Path::DaemonPidFile().c_str());
      return 0;
    }
    const int err = errno;
    PLOVO_LOG(LOG_ERR, "Kill daemon: %s (%d)\n", Plovo::ErrorText(err).c_str(), err);
    return -1;
  }
  const auto deadline =
      std::chrono::steady_clock::now() + std::chrono::milliseconds(gStopWaitMs.load());
  for (;;) {
    if (ProcessGone(pid)) {
      PLOVO_LOG(LOG_INFO, "daemon is dead\n");
      return 0;
    }
    if (std::chrono::steady_clock::now() >= deadline) break;
    std::this_thread::sleep_for(kStopProbe);
  }
  kill(pid, SIGKILL);
  PLOVO_LOG(LOG_WARNING, "forcelly kill daemon\n");
  // Whatever comes next (a repository move) must not find the daemon still
  // holding its files; SIGKILL takes effect at once, so this is short.
  for (int i = 0; i < 10 && !ProcessGone(pid); ++i) std::this_thread::sleep_for(kStopProbe);
  return 0;
}

int Stop() {
  const std::string pidFile = Plovo::Path::DaemonPidFile();
  // Read before the stop command: a daemon that obeys it removes its pid
  // file on the way out, and the process would then be lost from sight
  // while it may still be finishing.
  const int pid = VLIBCReadPidFile(pidFile.c_str());
  const bool stale = pid >= 1 && !IsDaemon(pid, pidFile);

  PObject command;
  command["action"] = "stop";
  command["need_ack"] = 0;
  PObject reply;
  if (DaemonIPC().SendCommand(command, reply) < 0) {
    PLOVO_LOG(LOG_ERR, "StopDaemon: Plovo failed to stop daemon, try to kill it.\n");
  }

  int result = -1;
  if (pid < 1) {
    PLOVO_LOG(LOG_ERR, "Failed to read '%s'\n", pidFile.c_str());
  } else if (stale) {
    PLOVO_LOG(LOG_INFO, "pid does not exist\n");
    unlink(pidFile.c_str());
    result = 0;
  } else {
    result = EndDaemon(pid);
  }
  if (result != 0) {
    PLOVO_LOG(LOG_ERR, "Failed to kill daemon\n");
    return -1;
  }

  if (!Plovo::HideAllSchedule()) PLOVO_LOG(LOG_ERR, "fail to HideAllSchedule");
  if (!WriteState(PLOVO_SERVICE_STATUS_STOP)) {
    PLOVO_LOG(LOG_ERR, "fail to update plovo status to stop.");
  }
  VELTLogSet1(VELT_LOG_CATEGORY_SYSTEM, VELT_LOG_LEVEL_INFO, kEventServiceStopped, "Plovo", "", "",
              "");
  return 0;
}

}  // namespace

ServiceLock::ServiceLock() {
  fd_ = open(Plovo::Path::ServiceLockFile().c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  if (fd_ < 0) {
    PLOVO_LOG(LOG_ERR, "Failed to open plovo service lock file.");
    return;
  }
  int locked;
  do locked = flock(fd_, LOCK_EX);
  while (locked != 0 && errno == EINTR);
  if (locked != 0) {
    PLOVO_LOG(LOG_ERR, "Failed to lock file.");
    close(fd_);
    fd_ = -1;
    return;
  }
  locked_ = true;
}

ServiceLock::~ServiceLock() {
  if (fd_ >= 0) close(fd_);  // releases the flock
}

void SetStopServiceWait(std::chrono::milliseconds wait) {
  gStopWaitMs.store(wait.count() > 0 ? wait.count() : kStopWait.count());
}

int StartServiceLocked() { return Plovo::NoThrow(Start, -1); }

int StopServiceLocked() { return Plovo::NoThrow(Stop, -1); }

int StartService(void) {
  // A disabled package is left exactly as it is, lock file included.
  if (!IsPkgEnable()) return 0;
  ServiceLock lock;
  return lock.locked() ? StartServiceLocked() : -1;
}

int StopService(void) {
  ServiceLock lock;
  return lock.locked() ? StopServiceLocked() : -1;
}
