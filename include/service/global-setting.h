// Package-wide settings kept in "/var/packages/Plovo/etc/setting.conf":
// the repository volume ("repo_vol_path") and the beep flag ("beep", "yes"
// or "no"). The file is read and written without a lock; every call opens
// it anew, so the functions may be called from several threads.
#ifndef PLOVO_SERVICE_GLOBAL_SETTING_H
#define PLOVO_SERVICE_GLOBAL_SETTING_H

#include <string>

namespace Plovo {

class GlobalSetting {
 public:
  // The longest repository volume path that reads back whole.
  static constexpr size_t kMaxRepoVolumePath = 63;

  // The repository's volume path (at most 63 bytes; a longer value is cut),
  // or "" when it cannot be read.
  static std::string GetRepoVolumePath();
  // True exactly when "beep" reads "yes" in any case.
  static bool GetBeep();
  // Writes "beep" as "yes" or "no"; false when the write fails.
  static bool SetBeep(bool enable);
  // Makes sure "beep" exists, writing "yes" when it is absent. False when
  // the file cannot be read or the write fails.
  static bool InitBeep();
};

}  // namespace Plovo

// Prepares the settings a service start needs; the result of InitBeep().
bool init_global_setting();

#endif
