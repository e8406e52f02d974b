// The task enumerations as numbers, the form they take in daemon messages
// and the task database (the web API carries them as strings). 0 is
// unknown in each. They are 32-bit signed, as the records hold them.
#ifndef PLOVO_COMMON_REGISTRY_H
#define PLOVO_COMMON_REGISTRY_H

#include <cstdint>

namespace Registry {

enum TASK_TYPE : int32_t {
  TASK_TYPE_UNKNOWN = 0,
  TASK_TYPE_IMPORT_GENERAL = 1,  // device to NAS
  TASK_TYPE_EXPORT_GENERAL = 2,  // NAS to device
  TASK_TYPE_IMPORT_PHOTO = 3,    // device to NAS, photos and videos
};

enum COPY_STRATEGY : int32_t {
  COPY_STRATEGY_UNKNOWN = 0,
  COPY_STRATEGY_VERSIONING = 1,
  COPY_STRATEGY_MIRROR = 2,
  COPY_STRATEGY_INCREMENTAL = 3,
};

enum CONFLICT_POLICY : int32_t {
  CONFLICT_POLICY_UNKNOWN = 0,
  CONFLICT_POLICY_RENAME = 1,
  CONFLICT_POLICY_OVERWRITE = 2,
};

enum ROTATION_POLICY : int32_t {
  ROTATION_POLICY_UNKNOWN = 0,
  ROTATION_POLICY_OLDEST_VERSION = 1,
  ROTATION_POLICY_SMART_RECYCLE = 2,
};

}  // namespace Registry

#endif
