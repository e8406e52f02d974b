#include "common/velt-sdk-wrapper.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>
#include <uuid/uuid.h>

#include <thread>

#include "common/file-op.h"
#include "common/log.h"

namespace SDK {

namespace {

// An exclusive flock on a device's identity lock file, released with the
// object. The lock has a file of its own because the configuration file is
// replaced by rename on every write: a lock on it would stay with the old
// file while the next caller locks the new one unhindered. Each holder opens
// its own descriptor, so threads of one process exclude each other too.
class DeviceLock {
 public:
  DeviceLock() = default;
  ~DeviceLock() {
    if (fd_ >= 0) close(fd_);
  }
  DeviceLock(const DeviceLock&) = delete;
  DeviceLock& operator=(const DeviceLock&) = delete;

  // 0, or -1 (logged) when the file cannot be opened or locked within wait.
  int Acquire(const std::string& file, std::chrono::milliseconds wait) {
    // The device is the user's: the name may be a link or a fifo put there.
    fd_ = open(file.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0600);
    if (fd_ < 0) {
      PLOVO_LIB_ERR("Can not open lock file '%s', errno=%d", file.c_str(), errno);
      return -1;
    }
    // Polled rather than blocking, so that the wait has an end without
    // signals in the web server's process.
    const auto deadline = std::chrono::steady_clock::now() + wait;
    while (flock(fd_, LOCK_EX | LOCK_NB) != 0) {
      if (errno == EINTR) continue;
      if (errno != EWOULDBLOCK) {
        PLOVO_LIB_ERR("Can not lock file '%s', errno=%d", file.c_str(), errno);
        return -1;
      }
      if (std::chrono::steady_clock::now() >= deadline) {
        PLOVO_LIB_ERR("Lock file '%s' still held after %lld ms", file.c_str(),
                      static_cast<long long>(wait.count()));
        return -1;
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return 0;
  }

 private:
  int fd_ = -1;
};

}  // namespace

int Share::open(const std::string& name) {
  close();
  if (VELTShareInfoGet(name.c_str(), &info_) < 0) {
    PLOVO_LIB_DBG("VELTShareInfoGet(%s) failed, err=[0x%04X]", name.c_str(), VLIBCErrGet());
    info_ = nullptr;
    return -1;
  }
  return 0;
}

void Share::close() {
  VELTShareInfoFree(info_);
  info_ = nullptr;
}

bool Share::isMounted() const { return info_ && info_->isMounted == 1; }

std::string Share::getMountPoint() const { return info_ ? info_->szPath : ""; }

int GetDevPath(const std::string& path, std::string& devPath) {
  char buffer[4096];
  devPath.clear();
  if (VELTDevPathGet(path.c_str(), buffer, sizeof buffer) < 0) {
    PLOVO_LIB_DBG("VELTDevPathGet(%s) failed, err=[0x%04X]", path.c_str(), VLIBCErrGet());
    return -1;
  }
  devPath = buffer;
  return 0;
}

int GetUUID(const std::string& path, const std::string& devPath, std::string& uuid) {
  char buffer[256];
  uuid.clear();
  if (VELTDevFsUuidGet(devPath.c_str(), buffer, sizeof buffer) == 0) {
    uuid = buffer;
    return 0;
  }
  // A file system without an identity of its own (or one the platform
  // cannot read) is known by the identity once stored on the device.
  if (ReadPlovoConfig(path, "uuid", uuid) == 1 && !uuid.empty()) return 0;
  uuid.clear();
  PLOVO_LIB_DBG("No identity for device '%s' at '%s'", devPath.c_str(), path.c_str());
  return -1;
}

std::string GenerateUUID() {
  uuid_t id;
  char text[37];
  uuid_generate_random(id);
  uuid_unparse_lower(id, text);
  return text;
}

int GetOrCreateUUID(const std::string& path, const std::string& devPath, std::string& uuid,
                    std::chrono::milliseconds wait) {
  uuid.clear();
  // The lock file lives beside the configuration file, whose folder a
  // device fresh from another machine does not have yet.
  const std::string folder = path + "/@eaDir";
  if (FSMKDir(folder, false, static_cast<unsigned>(-1), static_cast<unsigned>(-1)) != 0) {
    PLOVO_LIB_ERR("Can not create folder '%s'", folder.c_str());
    return -1;
  }
  DeviceLock lock;
  if (lock.Acquire(PlovoConfigPath(path) + ".lock", wait) < 0) return -1;
  // Another caller may have stored one while this one waited.
  if (GetUUID(path, devPath, uuid) == 0) return 0;
  uuid = GenerateUUID();
  if (WritePlovoConfig(path, "uuid", uuid) < 0) return -1;
  return 1;
}

}  // namespace SDK
