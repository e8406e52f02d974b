// The removable devices plugged in now, and the NAS shares, as the
// platform reports them. Nothing is cached: every answer reads the
// platform anew, so that a device plugged in or pulled out shows at once,
// whether or not the hot-plug hook told the daemon.
#ifndef PLOVO_DAEMON_DEVICES_H
#define PLOVO_DAEMON_DEVICES_H

#include <string>
#include <vector>

namespace plovod {

// One partition of a plugged-in device that is shared and mounted.
struct PluggedDevice {
  std::string uuid;        // the identity tasks are bound to; "" when it has none yet
  std::string share_name;  // e.g. usbshare1
  std::string share_path;  // its mount point
  std::string producer;
  std::string product;
  // Its partition's file system is FAT (the platform says "vfat", "fat"
  // or "fat32"): no file of 4 GiB or more, no name with "*:<>?\| in it.
  bool fat = false;
};

// Every mounted partition the storage service lists, in its order. A
// partition whose share is unknown or unmounted is left out; an empty list
// when the storage service cannot be read.
std::vector<PluggedDevice> ListPluggedDevices();

// The mounted partition whose device has identity uuid; false when none.
bool FindPluggedDevice(const std::string& uuid, PluggedDevice& device);

// Where the share name is mounted; "" when it is unknown or not mounted.
std::string MountedSharePath(const std::string& name);

}  // namespace plovod

#endif
