#include "common/usb-device.h"

#include <json/value.h>
#include <sys/file.h>
#include <fcntl.h>

#include <cerrno>
#include <thread>

#include "common/file-op.h"
#include "common/log.h"
#include "common/unique-fd.h"
#include "common/velt-sdk-wrapper.h"
#include "velt/storage.h"

namespace Plovo {
namespace {

// Takes an exclusive flock on file, polling rather than blocking so that
// the wait has an end without signals in the web server's process. Each
// caller opens its own descriptor, so threads of one process exclude each
// other too. The device is the user's: the name may be a link or a FIFO put
// there, hence O_NOFOLLOW and O_NONBLOCK.
UniqueFd LockFile(const std::string& file, std::chrono::milliseconds wait) {
  UniqueFd fd(open(file.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0600));
  if (!fd) {
    PLOVO_LIB_ERR("Can not open lock file '%s', errno=%d", file.c_str(), errno);
    return fd;
  }
  const auto deadline = std::chrono::steady_clock::now() + wait;
  while (flock(fd.get(), LOCK_EX | LOCK_NB) != 0) {
    if (errno == EINTR) continue;
    if (errno != EWOULDBLOCK) {
      PLOVO_LIB_ERR("Can not lock file '%s', errno=%d", file.c_str(), errno);
      return UniqueFd();
    }
    if (std::chrono::steady_clock::now() >= deadline) {
      PLOVO_LIB_ERR("Lock file '%s' still held after %lld ms", file.c_str(),
                    static_cast<long long>(wait.count()));
      return UniqueFd();
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return fd;
}

// The storage service's device list, checked for its "devices" array.
int GetAllUSBData(Json::Value& devices) {
  Json::Value info;
  if (VELT::QXS::STORAGE_WEBUTILS::Storage::GetUSBInfo(info) < 0) {
    PLOVO_LIB_ERR("Failed to get USBInfo");
  } else if (!info.isObject() || !info["devices"].isArray()) {
    PLOVO_LIB_ERR("USBInfo is invalid (%s)", info.toStyledString().c_str());
  } else {
    devices.swap(info["devices"]);
    return 0;
  }
  PLOVO_LIB_ERR("Failed to get all usb data");
  return -1;
}

std::string StringMember(const Json::Value& object, const char* key) {
  const Json::Value& v = object[key];
  return v.isString() ? v.asString() : "";
}

// The producer and product of the device that lists a partition shared as
// shareName; the first such device wins.
int GetUSBProducerProduct(const std::string& shareName, std::string& producer,
                          std::string& product) {
  Json::Value devices;
  if (GetAllUSBData(devices) < 0) return -1;
  for (const Json::Value& device : devices) {
    const Json::Value& partitions = device.isObject() ? device["partitions"] : Json::Value::nullSingleton();
    if (!partitions.isArray()) {
      PLOVO_LIB_DBG("USBData partitions is invalid (%s)", device.toStyledString().c_str());
      continue;
    }
    for (const Json::Value& partition : partitions) {
      if (partition.isObject() && partition["share_name"].isString() &&
          partition["share_name"].asString() == shareName) {
        producer = StringMember(device, "producer");
        product = StringMember(device, "product");
        return 0;
      }
    }
  }
  PLOVO_LIB_DBG("producer and product not found for share_name '%s'", shareName.c_str());
  return -1;
}

}  // namespace

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
  UniqueFd lock = LockFile(PlovoConfigPath(path) + ".lock", wait);
  if (!lock) return -1;
  // Another caller may have stored one while this one waited.
  if (SDK::GetUUID(path, devPath, uuid) == 0) return 0;
  uuid = SDK::GenerateUUID();
  if (WritePlovoConfig(path, "uuid", uuid) < 0) return -1;
  return 1;
}

int ResolveUSBDevice(const std::string& shareName, USBDevice& device) {
  const char* name = shareName.c_str();
  SDK::Share share;
  if (share.open(shareName) < 0) {
    PLOVO_LIB_ERR("Failed to open share '%s'", name);
    return -1;
  }
  if (!share.isMounted()) {
    PLOVO_LIB_ERR("Share '%s' is not mounted", name);
    return -1;
  }
  device.share_path = share.getMountPoint();
  share.close();

  if (SDK::GetDevPath(device.share_path, device.dev_path) < 0) {
    PLOVO_LIB_ERR("Failed to get dev_path for usb_share_path '%s'", device.share_path.c_str());
    return -1;
  }
  if (SDK::GetUUID(device.share_path, device.dev_path, device.uuid) < 0) {
    PLOVO_LIB_ERR("Failed to get uuid for dev_path '%s'", device.dev_path.c_str());
    // The identity goes onto the device itself, so that the device is
    // recognised by the same identity in any NAS it is plugged into.
    const int made = GetOrCreateUUID(device.share_path, device.dev_path, device.uuid);
    if (made < 0) {
      PLOVO_LIB_ERR("Failed to write Plovo config '%s', uuid '%s'", device.share_path.c_str(),
                    device.uuid.c_str());
      return -1;
    }
    if (made == 1) PLOVO_LIB_WARN("write uuid '%s' to config file", device.uuid.c_str());
  }
  if (GetUSBProducerProduct(shareName, device.producer, device.product) < 0) {
    PLOVO_LIB_ERR("Failed to get usb info for usb_share_name '%s'", name);
    return -1;
  }
  return 0;
}

}  // namespace Plovo
