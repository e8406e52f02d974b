#include "common/velt-sdk-wrapper.h"

#include <uuid/uuid.h>

#include "common/file-op.h"
#include "common/log.h"

namespace SDK {

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

int PathGetShareBin(const std::string& volPath, std::string& path) {
  char buffer[256];
  path.clear();
  if (VELTShareBinPathGet(volPath.c_str(), buffer, sizeof buffer) < 0) {
    PLOVO_LIB_DBG("VELTShareBinPathGet(%s) failed, err=[0x%04X]", volPath.c_str(), VLIBCErrGet());
    return -1;
  }
  path = buffer;
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

}  // namespace SDK
