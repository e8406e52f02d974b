#include "daemon/devices.h"

#include <json/value.h>

#include "common/velt-sdk-wrapper.h"
#include "velt/storage.h"

namespace plovod {

std::vector<PluggedDevice> ListPluggedDevices() {
  std::vector<PluggedDevice> found;
  Json::Value info;
  if (VELT::QXS::STORAGE_WEBUTILS::Storage::GetUSBInfo(info) < 0) return found;
  const Json::Value& devices = info["devices"];
  if (!devices.isArray()) return found;
  for (const Json::Value& device : devices) {
    if (!device.isObject() || !device["partitions"].isArray()) continue;
    for (const Json::Value& partition : device["partitions"]) {
      if (!partition.isObject() || !partition["share_name"].isString()) continue;
      PluggedDevice plugged;
      plugged.share_name = partition["share_name"].asString();
      plugged.share_path = MountedSharePath(plugged.share_name);
      if (plugged.share_path.empty()) continue;
      std::string devPath;
      if (SDK::GetDevPath(plugged.share_path, devPath) == 0) {
        SDK::GetUUID(plugged.share_path, devPath, plugged.uuid);
      }
      plugged.producer = device["producer"].isString() ? device["producer"].asString() : "";
      plugged.product = device["product"].isString() ? device["product"].asString() : "";
      const Json::Value& fs = partition["file_system"];
      plugged.fat = fs.isString() && (fs.asString() == "vfat" || fs.asString() == "fat" || fs.asString() == "fat32");
      found.push_back(plugged);
    }
  }
  return found;
}

bool FindPluggedDevice(const std::string& uuid, PluggedDevice& device) {
  if (uuid.empty()) return false;
  for (const PluggedDevice& plugged : ListPluggedDevices()) {
    if (plugged.uuid == uuid) {
      device = plugged;
      return true;
    }
  }
  return false;
}

std::string MountedSharePath(const std::string& name) {
  SDK::Share share;
  if (name.empty() || share.open(name) != 0 || !share.isMounted()) return "";
  return share.getMountPoint();
}

}  // namespace plovod
