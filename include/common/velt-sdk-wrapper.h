// Thin wrappers over the platform's share and device services, in the
// shapes the module uses: a share object, the block device behind a path,
// a device's identity, and new identities.
//
// Failures are logged at debug level as "[DBG] velt-sdk-wrapper(<line>): ..."
// with the platform's error code; callers log their own error line. Every
// function may be called from several threads; one Share object belongs to
// one thread.
#ifndef PLOVO_COMMON_VELT_SDK_WRAPPER_H
#define PLOVO_COMMON_VELT_SDK_WRAPPER_H

#include <string>

#include "velt/share.h"

namespace SDK {

// One platform share, looked up by name. The description is released by
// close() or the destructor.
class Share {
 public:
  Share() = default;
  ~Share() { close(); }
  Share(const Share&) = delete;
  Share& operator=(const Share&) = delete;

  // Looks the share up; 0, or -1 when the platform does not know it (the
  // object is then closed).
  int open(const std::string& name);
  void close();

  // False for a closed object.
  bool isMounted() const;
  // Where the share is mounted; "" for a closed object.
  std::string getMountPoint() const;

 private:
  PVELTSHAREINFO info_ = nullptr;
};

// The block device that holds path (a mounted share's mount point or a
// path under it). 0, or -1 with devPath cleared.
int GetDevPath(const std::string& path, std::string& devPath);

// The identity of the device devPath whose share is mounted at path: the
// file system's own identity when it has one, otherwise the "uuid" key of
// the configuration file kept on the device under path. 0, or -1 with uuid
// cleared when it has neither.
int GetUUID(const std::string& path, const std::string& devPath, std::string& uuid);

// The base path the package uses on the volume volPath, as the platform
// gives it (its 256-byte answer). 0, or -1 with path cleared.
int PathGetShareBin(const std::string& volPath, std::string& path);

// A new random identity in the 36-character text form, lower case.
std::string GenerateUUID();

}  // namespace SDK

#endif
