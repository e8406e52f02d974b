// The task enumerations as the web interface writes them, and their
// conversions to the numbers the daemon and the databases use.
#include "webapi/plovo.h"

const std::string PlovoHandle::TYPE_IMPORT = "import_general";
const std::string PlovoHandle::TYPE_EXPORT = "export_general";
const std::string PlovoHandle::TYPE_IMPORT_PHOTO = "import_photo";
const std::string PlovoHandle::STRATEGY_VERSION = "versioning";
const std::string PlovoHandle::STRATEGY_MIRROR = "mirror";
const std::string PlovoHandle::STRATEGY_INCBKP = "incremental";
const std::string PlovoHandle::CONFLICT_RENAME = "rename";
const std::string PlovoHandle::CONFLICT_OVERWRITE = "overwrite";
const std::string PlovoHandle::ROTATION_OLDEST_VERSION = "oldest_version";
const std::string PlovoHandle::ROTATION_SMART_RECYCLE = "smart_recycle";

namespace {

// One enumeration's strings, indexed by value - 1.
template <typename Enum, size_t N>
Enum ToEnum(const std::string* const (&names)[N], const std::string& value) {
  for (size_t i = 0; i < N; ++i) {
    if (*names[i] == value) return static_cast<Enum>(i + 1);
  }
  return static_cast<Enum>(0);
}

template <size_t N>
std::string ToString(const std::string* const (&names)[N], int32_t value) {
  if (value < 1 || static_cast<size_t>(value) > N) return "";
  return *names[value - 1];
}

const std::string* const kTypeNames[] = {&PlovoHandle::TYPE_IMPORT, &PlovoHandle::TYPE_EXPORT,
                                         &PlovoHandle::TYPE_IMPORT_PHOTO};
const std::string* const kStrategyNames[] = {&PlovoHandle::STRATEGY_VERSION,
                                             &PlovoHandle::STRATEGY_MIRROR,
                                             &PlovoHandle::STRATEGY_INCBKP};
const std::string* const kConflictNames[] = {&PlovoHandle::CONFLICT_RENAME,
                                             &PlovoHandle::CONFLICT_OVERWRITE};
const std::string* const kRotationNames[] = {&PlovoHandle::ROTATION_OLDEST_VERSION,
                                             &PlovoHandle::ROTATION_SMART_RECYCLE};

}  // namespace

Registry::TASK_TYPE PlovoHandle::convertToEnumTT(const std::string& value) {
  return ToEnum<Registry::TASK_TYPE>(kTypeNames, value);
}
std::string PlovoHandle::convertToStringTT(Registry::TASK_TYPE value) {
  return ToString(kTypeNames, value);
}
Registry::COPY_STRATEGY PlovoHandle::convertToEnumCS(const std::string& value) {
  return ToEnum<Registry::COPY_STRATEGY>(kStrategyNames, value);
}
std::string PlovoHandle::convertToStringCS(Registry::COPY_STRATEGY value) {
  return ToString(kStrategyNames, value);
}
Registry::CONFLICT_POLICY PlovoHandle::convertToEnumCP(const std::string& value) {
  return ToEnum<Registry::CONFLICT_POLICY>(kConflictNames, value);
}
std::string PlovoHandle::convertToStringCP(Registry::CONFLICT_POLICY value) {
  return ToString(kConflictNames, value);
}
Registry::ROTATION_POLICY PlovoHandle::convertToEnumRP(const std::string& value) {
  return ToEnum<Registry::ROTATION_POLICY>(kRotationNames, value);
}
std::string PlovoHandle::convertToStringRP(Registry::ROTATION_POLICY value) {
  return ToString(kRotationNames, value);
}
