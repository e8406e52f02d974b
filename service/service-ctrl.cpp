#include "service/service-ctrl.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>
#include <velt/mount.h>
#include <velt/vlibc.h>

#include <cstdlib>
#include <exception>

#include "common/log.h"
#include "common/paths.h"
#include "common/utility.h"

namespace {

// Holds the exclusive lock on "status.lock" for one read or write of the
// status file.
class StatusLock {
 public:
  StatusLock() {
    fd_ = open(Plovo::Path::StatusLockFile().c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0440);
    if (fd_ < 0) {
      PLOVO_LOG(LOG_ERR, "Failed to open plovo status lock file.");
      return;
    }
    if (flock(fd_, LOCK_EX) != 0) {
      PLOVO_LOG(LOG_ERR, "Failed to lock file.");
      return;
    }
    locked_ = true;
  }
  ~StatusLock() {
    if (fd_ < 0) return;
    if (locked_) flock(fd_, LOCK_UN);
    close(fd_);
  }
  StatusLock(const StatusLock&) = delete;
  StatusLock& operator=(const StatusLock&) = delete;

  bool locked() const { return locked_; }

 private:
  int fd_ = -1;
  bool locked_ = false;
};

// The status file's values fit easily; the buffer size is the file format's.
constexpr size_t kStatusValueSize = 1024;

}  // namespace

ServiceStatus::ServiceStatus() : state(PLOVO_SERVICE_STATUS_UNKNOWN) {}
ServiceStatus::~ServiceStatus() = default;

namespace {

int ReadServiceStatus(ServiceStatus& status) {
  StatusLock lock;
  if (!lock.locked()) return -1;

  const std::string file = Plovo::Path::StatusFile();
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

// Entry points of the module: nothing may be thrown to the caller.
int GetServiceStatus(ServiceStatus& status) {
  try {
    return ReadServiceStatus(status);
  } catch (const std::exception& e) {
    PLOVO_LOG(LOG_ERR, "Unexpected failure: %s", e.what());
    return -1;
  }
}

int SetServiceStatus(const ServiceStatus& status) {
  try {
    return WriteServiceStatus(status);
  } catch (const std::exception& e) {
    PLOVO_LOG(LOG_ERR, "Unexpected failure: %s", e.what());
    return -1;
  }
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
