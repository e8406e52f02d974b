// Shares and removable devices, declared in velt-dev/storage.json under the
// sandbox root (which an eject rewrites), and the file-system identity of a
// device read with libblkid.
#include <blkid/blkid.h>
#include <fcntl.h>
#include <json/writer.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "dev-internal.h"
#include "velt/log.h"
#include "velt/share.h"
#include "velt/storage.h"

namespace {

struct Share {
  std::string name;
  std::string path;     // mount point, resolved under the root
  bool mounted = true;
  std::string devPath;  // empty: the device is unknown
};

std::string Resolve(const std::string& path) {
  std::string resolved = path[0] == '/' ? path : velt_dev::Root() + "/" + path;
  while (resolved.size() > 1 && resolved.back() == '/') resolved.pop_back();
  return resolved;
}

// Reads an optional non-empty string member; false when it is anything else.
bool ReadString(const Json::Value& entry, const char* key, std::string* out) {
  const Json::Value& v = entry[key];
  if (v.isNull()) return true;
  if (!v.isString() || v.asString().empty()) return false;
  *out = v.asString();
  return true;
}

// Reads an optional bool member; false when it has another type.
bool ReadBool(const Json::Value& entry, const char* key, bool* out) {
  const Json::Value& v = entry[key];
  if (v.isNull()) return true;
  if (!v.isBool()) return false;
  *out = v.asBool();
  return true;
}

bool ParseShare(const Json::Value& entry, Share* share) {
  if (!entry.isObject() || !ReadString(entry, "name", &share->name) || share->name.empty()) {
    return false;
  }
  std::string path = share->name, dev;
  if (!ReadString(entry, "path", &path) || !ReadString(entry, "dev_path", &dev) ||
      !ReadBool(entry, "mounted", &share->mounted)) {
    return false;
  }
  share->path = Resolve(path);
  if (!dev.empty()) share->devPath = Resolve(dev);
  return true;
}

// Reads storage.json into *doc; a missing file declares nothing (an empty
// object). Sets the last error when the file cannot be read or is not JSON.
bool ReadStorage(Json::Value* doc) {
  const int read = velt_dev::ReadJsonState("storage.json", doc);
  if (read == 0) *doc = Json::Value(Json::objectValue);
  if (read < 0) {
    VELT_FAIL(VLIBC_ERR_BAD_CONFIG);
    return false;
  }
  return true;
}

// Checks a storage.json document. The shares are checked strictly and
// give one Share per entry, in file order; the "devices" member is the
// storage service's answer and is handed on as it stands, whatever its
// shape. Sets the last error on failure.
bool ParseStorage(const Json::Value& doc, std::vector<Share>* shares, Json::Value* devices) {
  const Json::Value& declared = doc.isObject() ? doc["shares"] : doc;
  if (!doc.isObject() || !(declared.isNull() || declared.isArray())) {
    VELT_FAIL(VLIBC_ERR_BAD_CONFIG);
    return false;
  }
  if (shares) {
    for (const Json::Value& entry : declared) {
      Share share;
      if (!ParseShare(entry, &share)) {
        VELT_FAIL(VLIBC_ERR_BAD_CONFIG);
        return false;
      }
      shares->push_back(std::move(share));
    }
  }
  if (devices) {
    *devices = doc.isMember("devices") ? doc["devices"] : Json::Value(Json::arrayValue);
  }
  return true;
}

bool LoadStorage(std::vector<Share>* shares, Json::Value* devices) {
  Json::Value doc;
  return ReadStorage(&doc) && ParseStorage(doc, shares, devices);
}

// The system-log event of an ejected device (docs/platform.md).
constexpr unsigned int kEventShareEjected = 0x11A00101;

// Marks the share unmounted in file; the caller holds the file's lock.
// Every other member of the document is written back as it was read.
bool MarkEjected(const std::string& file, const std::string& name) {
  Json::Value doc;
  std::vector<Share> shares;
  if (!ReadStorage(&doc) || !ParseStorage(doc, &shares, nullptr)) return false;
  // The first share of the name, as VELTShareInfoGet finds it.
  Json::ArrayIndex index = 0;
  while (index < shares.size() && shares[index].name != name) ++index;
  if (index == shares.size()) {
    VELT_FAIL(VLIBC_ERR_NOT_FOUND);
    return false;
  }
  if (!shares[index].mounted) {
    VELT_FAIL(VLIBC_ERR_NOT_MOUNTED);
    return false;
  }
  doc["shares"][index]["mounted"] = false;
  Json::StreamWriterBuilder writer;
  writer["indentation"] = "  ";
  writer["emitUTF8"] = true;
  struct stat old {};
  const bool exists = stat(file.c_str(), &old) == 0;
  return velt_dev::ReplaceFile(file, Json::writeString(writer, doc) + "\n", exists ? &old : nullptr);
}

bool CopyOut(const std::string& value, char* out, size_t size) {
  if (value.size() >= size) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return false;
  }
  std::memcpy(out, value.c_str(), value.size() + 1);
  return true;
}

// Whether path is mountPoint or lies under it.
bool Holds(const std::string& mountPoint, const std::string& path) {
  if (path.compare(0, mountPoint.size(), mountPoint) != 0) return false;
  return path.size() == mountPoint.size() || path[mountPoint.size()] == '/' || mountPoint == "/";
}

}  // namespace

extern "C" {

int VELTShareInfoGet(const char* name, PVELTSHAREINFO* ppInfo) {
  if (ppInfo) *ppInfo = nullptr;
  if (VELT_FAULT_HIT()) return -1;
  if (!name || !ppInfo) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::vector<Share> shares;
  if (!LoadStorage(&shares, nullptr)) return -1;
  for (const Share& share : shares) {
    if (share.name != name) continue;
    if (share.name.size() >= sizeof(VELTSHAREINFO::szName) ||
        share.path.size() >= sizeof(VELTSHAREINFO::szPath)) {
      VELT_FAIL(VLIBC_ERR_BAD_CONFIG);
      return -1;
    }
    auto* info = static_cast<PVELTSHAREINFO>(std::calloc(1, sizeof(VELTSHAREINFO)));
    if (!info) {
      VELT_FAIL(VLIBC_ERR_NO_MEMORY);
      return -1;
    }
    std::memcpy(info->szName, share.name.c_str(), share.name.size() + 1);
    std::memcpy(info->szPath, share.path.c_str(), share.path.size() + 1);
    info->isMounted = share.mounted ? 1 : 0;
    *ppInfo = info;
    return 0;
  }
  VELT_FAIL(VLIBC_ERR_NOT_FOUND);
  return -1;
}

void VELTShareInfoFree(PVELTSHAREINFO pInfo) { std::free(pInfo); }

int VELTDevPathGet(const char* path, char* devPath, size_t size) {
  if (devPath && size > 0) devPath[0] = '\0';
  if (VELT_FAULT_HIT()) return -1;
  if (!path || path[0] != '/' || !devPath || size == 0) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::vector<Share> shares;
  if (!LoadStorage(&shares, nullptr)) return -1;
  const std::string wanted = Resolve(path);
  // The innermost mount point holds the path, as in a real mount table.
  const Share* holder = nullptr;
  for (const Share& share : shares) {
    if (share.mounted && Holds(share.path, wanted) &&
        (!holder || share.path.size() > holder->path.size())) {
      holder = &share;
    }
  }
  if (!holder || holder->devPath.empty()) {
    VELT_FAIL(VLIBC_ERR_NOT_FOUND);
    return -1;
  }
  return CopyOut(holder->devPath, devPath, size) ? 0 : -1;
}

// A development host has no per-volume place of its own for package data:
// the volume path itself is the base.
int VELTShareBinPathGet(const char* volPath, char* binPath, size_t size) {
  if (binPath && size > 0) binPath[0] = '\0';
  if (VELT_FAULT_HIT()) return -1;
  if (!volPath || volPath[0] == '\0' || !binPath || size == 0) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  return CopyOut(volPath, binPath, size) ? 0 : -1;
}

int VELTDevFsUuidGet(const char* devPath, char* uuid, size_t size) {
  if (uuid && size > 0) uuid[0] = '\0';
  if (VELT_FAULT_HIT()) return -1;
  if (!devPath || devPath[0] == '\0' || !uuid || size == 0) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  blkid_probe probe = blkid_new_probe_from_filename(devPath);
  if (!probe) {
    VELT_FAIL(errno == ENOENT ? VLIBC_ERR_NOT_FOUND : VLIBC_ERR_IO);
    return -1;
  }
  blkid_probe_enable_superblocks(probe, 1);
  blkid_probe_set_superblocks_flags(probe, BLKID_SUBLKS_UUID);
  // 0: one file system found; 1: none; negative: unreadable or ambiguous.
  int found = blkid_do_safeprobe(probe);
  const char* value = nullptr;
  size_t length = 0;
  int result = -1;
  if (found < 0) {
    VELT_FAIL(VLIBC_ERR_IO);
  } else if (found == 1 || blkid_probe_lookup_value(probe, "UUID", &value, &length) != 0 ||
             !value || value[0] == '\0') {
    VELT_FAIL(VLIBC_ERR_NOT_FOUND);
  } else if (CopyOut(value, uuid, size)) {
    result = 0;
  }
  blkid_free_probe(probe);
  return result;
}

// The development form of an eject: the share is marked unmounted in
// storage.json and the event goes to the system log.
int VELTShareEject(const char* name) {
  if (VELT_FAULT_HIT()) return -1;
  if (!name || name[0] == '\0') {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  const std::string file = velt_dev::StateDir() + "/storage.json";
  // Each eject rewrites the whole file: two at once without the lock would
  // each write back the other's share as still mounted.
  const int lock = open((file + ".lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  if (lock < 0) {
    // Without the state folder nothing is declared, so no share is known.
    VELT_FAIL(errno == ENOENT ? VLIBC_ERR_NOT_FOUND : VLIBC_ERR_IO);
    return -1;
  }
  int locked;
  do {
    locked = flock(lock, LOCK_EX);
  } while (locked != 0 && errno == EINTR);
  bool ok = locked == 0;
  if (!ok) VELT_FAIL(VLIBC_ERR_IO);
  ok = ok && MarkEjected(file, name);
  if (ok) {
    // The device is gone whether or not the event can be logged; a failed
    // log line must not turn the eject into a failure or touch the caller's
    // last error.
    const int code = velt_dev::LastErrorCode();
    const char* source = velt_dev::LastErrorFile();
    const int line = velt_dev::LastErrorLine();
    if (VELTLogSet1(VELT_LOG_CATEGORY_SYSTEM, VELT_LOG_LEVEL_INFO, kEventShareEjected, "Storage", name,
                    "ejected", nullptr) != 0) {
      velt_dev::SetLastError(code, source, line);
    }
  }
  close(lock);
  return ok ? 0 : -1;
}

}  // extern "C"

namespace VELT {
namespace QXS {
namespace STORAGE_WEBUTILS {

int Storage::GetUSBInfo(Json::Value& info) {
  info = Json::Value();
  if (VELT_FAULT_HIT()) return -1;
  Json::Value devices;
  if (!LoadStorage(nullptr, &devices)) return -1;
  info = Json::Value(Json::objectValue);
  info["devices"].swap(devices);
  return 0;
}

}  // namespace STORAGE_WEBUTILS
}  // namespace QXS
}  // namespace VELT
