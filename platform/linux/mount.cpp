// Volumes, declared in velt-dev/volumes.json under the sandbox root.
#include "velt/mount.h"

#include <json/value.h>
#include <sys/statvfs.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "dev-internal.h"

namespace {

struct Volume {
  std::string path;
  bool mounted = true;
  bool writable = true;
  int location = VELT_VOL_LOCATION_INTERNAL;
  unsigned long long freeBytes = 0;
  unsigned long long totalBytes = 0;
};

std::string StripTrailingSlashes(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

// Reads one flag; absent means true.
bool ReadFlag(const Json::Value& entry, const char* name, bool* flag) {
  const Json::Value& v = entry[name];
  if (v.isNull()) return true;
  if (!v.isBool()) return false;
  *flag = v.asBool();
  return true;
}

// Reads one byte count; *given tells whether the entry had it.
bool ReadBytes(const Json::Value& entry, const char* name, unsigned long long* bytes, bool* given) {
  const Json::Value& v = entry[name];
  *given = !v.isNull();
  if (!*given) return true;
  if (!v.isUInt64()) return false;
  *bytes = v.asUInt64();
  return true;
}

bool ParseVolume(const Json::Value& entry, Volume* vol) {
  if (!entry.isObject() || !entry["path"].isString()) return false;
  std::string path = entry["path"].asString();
  if (path.empty()) return false;
  vol->path = StripTrailingSlashes(path[0] == '/' ? path : velt_dev::Root() + "/" + path);
  if (vol->path.size() >= sizeof(VELTMOUNTVOLINFO::szPath)) return false;
  if (!ReadFlag(entry, "mounted", &vol->mounted) || !ReadFlag(entry, "writable", &vol->writable)) {
    return false;
  }
  const Json::Value& location = entry["location"];
  if (!location.isNull()) {
    if (!location.isString()) return false;
    if (location.asString() == "internal") {
      vol->location = VELT_VOL_LOCATION_INTERNAL;
    } else if (location.asString() == "external") {
      vol->location = VELT_VOL_LOCATION_EXTERNAL;
    } else {
      return false;
    }
  }
  bool freeGiven, totalGiven;
  if (!ReadBytes(entry, "free_bytes", &vol->freeBytes, &freeGiven) ||
      !ReadBytes(entry, "total_bytes", &vol->totalBytes, &totalGiven)) {
    return false;
  }
  if (!freeGiven || !totalGiven) {
    struct statvfs fs;
    bool measured = statvfs(vol->path.c_str(), &fs) == 0;
    if (!freeGiven) vol->freeBytes = measured ? 1ULL * fs.f_bavail * fs.f_frsize : 0;
    if (!totalGiven) vol->totalBytes = measured ? 1ULL * fs.f_blocks * fs.f_frsize : 0;
  }
  // A declared free space larger than the measured size would describe an
  // impossible volume.
  if (!totalGiven && vol->totalBytes < vol->freeBytes) vol->totalBytes = vol->freeBytes;
  return true;
}

// Reads the volume declarations, in file order. A missing file declares no
// volume. Sets the last error on failure.
bool LoadVolumes(std::vector<Volume>* volumes) {
  volumes->clear();
  Json::Value root;
  int read = velt_dev::ReadJsonState("volumes.json", &root);
  if (read == 0) return true;
  if (read < 0 || !root.isObject() || !(root["volumes"].isNull() || root["volumes"].isArray())) {
    VELT_FAIL(VLIBC_ERR_BAD_CONFIG);
    return false;
  }
  for (const Json::Value& entry : root["volumes"]) {
    Volume vol;
    if (!ParseVolume(entry, &vol)) {
      VELT_FAIL(VLIBC_ERR_BAD_CONFIG);
      return false;
    }
    volumes->push_back(std::move(vol));
  }
  return true;
}

PVELTMOUNTVOLINFO NewInfo(const Volume& vol) {
  auto* info = static_cast<PVELTMOUNTVOLINFO>(std::calloc(1, sizeof(VELTMOUNTVOLINFO)));
  if (!info) return nullptr;
  std::memcpy(info->szPath, vol.path.c_str(), vol.path.size() + 1);
  info->isMounted = vol.mounted ? 1 : 0;
  info->isWritable = vol.writable ? 1 : 0;
  info->location = vol.location;
  info->freeBytes = vol.freeBytes;
  info->totalBytes = vol.totalBytes;
  return info;
}

}  // namespace

extern "C" {

int VELTMountVolInfoGet(const char* path, PVELTMOUNTVOLINFO* ppInfo) {
  if (ppInfo) *ppInfo = nullptr;
  if (VELT_FAULT_HIT()) return -1;
  if (!path || !ppInfo) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::vector<Volume> volumes;
  if (!LoadVolumes(&volumes)) return -1;
  const std::string wanted = StripTrailingSlashes(path);
  for (const Volume& vol : volumes) {
    if (vol.path != wanted) continue;
    if (!vol.mounted) {
      VELT_FAIL(VLIBC_ERR_NOT_MOUNTED);
      return -1;
    }
    *ppInfo = NewInfo(vol);
    if (!*ppInfo) {
      VELT_FAIL(VLIBC_ERR_NO_MEMORY);
      return -1;
    }
    return 0;
  }
  VELT_FAIL(VLIBC_ERR_NOT_FOUND);
  return -1;
}

int VELTMountVolAllEnum(PVELTMOUNTVOLINFO* ppList) {
  if (ppList) *ppList = nullptr;
  if (VELT_FAULT_HIT()) return -1;
  if (!ppList) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::vector<Volume> volumes;
  if (!LoadVolumes(&volumes)) return -1;
  PVELTMOUNTVOLINFO head = nullptr;
  PVELTMOUNTVOLINFO* tail = &head;
  for (const Volume& vol : volumes) {
    *tail = NewInfo(vol);
    if (!*tail) {
      VELTMountVolInfoFree(head);
      VELT_FAIL(VLIBC_ERR_NO_MEMORY);
      return -1;
    }
    tail = &(*tail)->pNext;
  }
  *ppList = head;
  return static_cast<int>(volumes.size());
}

void VELTMountVolInfoFree(PVELTMOUNTVOLINFO pInfo) {
  while (pInfo) {
    PVELTMOUNTVOLINFO next = pInfo->pNext;
    std::free(pInfo);
    pInfo = next;
  }
}

}  // extern "C"
