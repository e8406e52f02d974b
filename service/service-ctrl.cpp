#include "service/service-ctrl.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <velt/mount.h>
#include <velt/vlibc.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <thread>

#include "common/log.h"
#include "common/no-throw.h"
#include "common/paths.h"
#include "common/unique-fd.h"
#include "common/utility.h"

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

ServiceStatus::ServiceStatus() : state(PLOVO_SERVICE_STATUS_UNKNOWN) {}
ServiceStatus::~ServiceStatus() = default;

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
