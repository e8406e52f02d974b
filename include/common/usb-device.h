// The USB device behind a share: where it is mounted, the block device, its
// identity, and the producer and product names the storage service reports.
// A task is bound to its device by the identity, so that the device is
// recognised in whatever port (and whatever NAS) it is plugged into.
//
// Failures are logged at error level with the step that failed and
// returned as -1. Every function may be called from several threads and
// processes at once.
#ifndef PLOVO_COMMON_USB_DEVICE_H
#define PLOVO_COMMON_USB_DEVICE_H

#include <chrono>
#include <string>

namespace Plovo {

struct USBDevice {
  std::string share_path;  // the share's mount point
  std::string dev_path;    // the block device behind it
  std::string uuid;
  std::string producer;
  std::string product;
};

// Resolves the device behind the USB share shareName. The share must be
// known and mounted; a device without an identity gets a new one, stored on
// the device first (GetOrCreateUUID) so that later tasks find the same one;
// the storage service must list a partition shared as shareName. 0, or -1
// after one line naming the step; device is then partly filled.
int ResolveUSBDevice(const std::string& shareName, USBDevice& device);

// How long GetOrCreateUUID waits for another holder of the device's
// identity lock: long enough for any real writer, short enough that a stuck
// or hostile holder cannot hang a web request.
constexpr std::chrono::milliseconds kUuidLockWait{5000};

// For a device that has no identity yet: under an exclusive lock on
// "<path>/@eaDir/.VeltraPlovo.config.lock" (across processes and threads
// alike), looks again and, when there is still none, stores a new one in
// the device's configuration file, so that concurrent callers all end with
// the same identity. The lock has a file of its own because the
// configuration file is replaced by rename on every write, and a lock on it
// would stay with the old file. 1 when this call stored uuid, 0 when it
// found one stored meanwhile, -1 when the lock was not had within wait or
// the identity could not be stored (uuid then holds the identity that was
// not stored, or is empty when none was made).
int GetOrCreateUUID(const std::string& path, const std::string& devPath, std::string& uuid,
                    std::chrono::milliseconds wait = kUuidLockWait);

}  // namespace Plovo

#endif
