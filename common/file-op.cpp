#include "common/file-op.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <unistd.h>
#include <velt/ea.h>
#include <velt/vlibc.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <string>
#include <vector>

#include "common/error-text.h"
#include "common/log.h"
#include "common/unique-fd.h"

namespace {

constexpr size_t kCopyBufferSize = 33554432;  // 32 MiB
// Bytes asked of the kernel per copy call; it moves what it can and says
// how much, so this only bounds one call.
constexpr size_t kKernelChunk = size_t{1} << 30;
constexpr const char* kConfigName = ".VeltraPlovo.config";

std::string FSBaseName(const std::string& path) {
  size_t end = path.find_last_not_of('/');
  if (end == std::string::npos) return path.empty() ? path : "/";
  size_t slash = path.rfind('/', end);
  return path.substr(slash == std::string::npos ? 0 : slash + 1,
                     slash == std::string::npos ? end + 1 : end - slash);
}

int TypeOfMode(mode_t mode) {
  if (S_ISREG(mode)) return 1;
  if (S_ISDIR(mode)) return 2;
  if (S_ISLNK(mode)) return 3;
  if (S_ISCHR(mode) || S_ISBLK(mode)) return 5;
  if (S_ISFIFO(mode)) return 6;
  if (S_ISSOCK(mode)) return 7;
  return -1;
}

struct DirCloser {
  void operator()(DIR* dir) const { closedir(dir); }
};
using DirHandle = std::unique_ptr<DIR, DirCloser>;

// The entry names of a folder other than "." and "..". Read in full before
// the caller removes or moves any of them, because entries leaving a
// folder while it is read may make some file systems skip others. Returns
// 0, -1 when the folder cannot be opened, -2 when reading it fails.
int ListNames(const std::string& path, std::vector<std::string>* names) {
  DirHandle dir(opendir(path.c_str()));
  if (!dir) return -1;
  for (;;) {
    errno = 0;
    struct dirent* entry = readdir(dir.get());
    if (!entry) return errno == 0 ? 0 : -2;
    if (std::strcmp(entry->d_name, ".") != 0 && std::strcmp(entry->d_name, "..") != 0) {
      names->emplace_back(entry->d_name);
    }
  }
}

bool IsFolder(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

ssize_t WriteRetry(int fd, const char* data, size_t n) {
  ssize_t w;
  do {
    w = write(fd, data, n);
  } while (w < 0 && errno == EINTR);
  return w;
}

// Copies the rest of in to out inside the kernel, with no bytes passing
// through this process. copy_file_range first (it may clone or copy on the
// server); when that is refused before any byte moved (another file system,
// a kernel or file system without it), sendfile. Returns true when the copy
// reached the end of the source; false when the caller must go on with its
// own buffer from where this stopped (the file offsets of both descriptors
// have moved by exactly the bytes copied).
bool CopyInKernel(int in, int out) {
  bool range = true;
  bool copied = false;
  for (;;) {
    ssize_t n = range ? copy_file_range(in, nullptr, out, nullptr, kKernelChunk, 0)
                      : sendfile(out, in, nullptr, kKernelChunk);
    if (n > 0) {
      copied = true;
      continue;
    }
    // Files of pseudo file systems claim to be empty to the kernel copy;
    // read() shows what they hold. A truly empty file pays for the buffer
    // and one read.
    if (n == 0) return copied;
    if (errno == EINTR) continue;
    bool refused = errno == EXDEV || errno == EINVAL || errno == ENOSYS || errno == EOPNOTSUPP ||
                   errno == EBADF || errno == EPERM;
    if (range && !copied && refused) {
      range = false;
      continue;
    }
    // Refused by sendfile as well, or a real read or write error. The copy
    // call cannot tell which side failed; the buffer loop retries and
    // reports read and write errors (and a full disk) each by their name.
    return false;
  }
}

struct FreeDeleter {
  void operator()(char* p) const { std::free(p); }
};

// The copy through one 32 MiB buffer. 0, -1 or -2 (destination full).
int CopyWithBuffer(int in, int out) {
  std::unique_ptr<char, FreeDeleter> owned(static_cast<char*>(std::malloc(kCopyBufferSize)));
  char* buffer = owned.get();
  if (!buffer) {
    int err = errno;
    PLOVO_LIB_ERR("FSCopy: malloc(%d): %s (%d)", static_cast<int>(kCopyBufferSize),
                  Plovo::ErrorText(err).c_str(), err);
    return -1;
  }
  int result = 0;
  for (;;) {
    ssize_t n;
    do {
      n = read(in, buffer, kCopyBufferSize);
    } while (n < 0 && errno == EINTR);
    if (n == 0) break;
    if (n < 0) {
      int err = errno;
      PLOVO_LIB_ERR("CopyFile: read: %s (%d)", Plovo::ErrorText(err).c_str(), err);
      result = -1;
      break;
    }
    for (ssize_t done = 0; done < n && result == 0;) {
      ssize_t w = WriteRetry(out, buffer + done, static_cast<size_t>(n - done));
      if (w > 0) {
        done += w;
        continue;
      }
      // A write that takes nothing leaves errno untouched; a device that
      // accepts no more bytes is out of room.
      int err = w == 0 ? ENOSPC : errno;
      PLOVO_LIB_ERR("CopyFile: write: %s (%d)", Plovo::ErrorText(err).c_str(), err);
      result = err == ENOSPC ? -2 : -1;
    }
    if (result != 0) break;
  }
  return result;
}

}  // namespace

LocalFileInfo::LocalFileInfo() { Clear(); }

LocalFileInfo::~LocalFileInfo() = default;

void LocalFileInfo::Clear() {
  path.clear();
  name.clear();
  extra.clear();
  type = 0;
  mtime = 0;
  size = 0;
  exists = false;
  uid = 0;
  gid = 0;
}

int GetFileInfo(const std::string& path, LocalFileInfo& info) {
  info.Clear();
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) {
    int err = errno;
    if (err != ENOENT && err != ENOTDIR) {
      PLOVO_LIB_ERR("GetFileInfo: lstat(%s): %s (%d)",
                    path.c_str(), Plovo::ErrorText(err).c_str(), err);
      return -1;
    }
    // A missing path is an answer, not a failure: callers ask in order to
    // create or skip it.
    info.path = path;
    info.name = FSBaseName(path);
    info.type = 1;
    info.mtime = static_cast<int32_t>(time(nullptr));
    return 0;
  }
  int type = TypeOfMode(st.st_mode);
  if (type < 0) {
    PLOVO_LIB_ERR("GetFileInfo: unknown kind of file '%s' (mode %o)", path.c_str(),
                  static_cast<unsigned>(st.st_mode));
    return -1;
  }
  info.path = path;
  info.name = FSBaseName(path);
  info.type = type;
  info.mtime = static_cast<int32_t>(st.st_mtime);
  info.size = static_cast<int64_t>(st.st_size);
  info.exists = true;
  info.uid = st.st_uid;
  info.gid = st.st_gid;
  return 0;
}

int FSStat(const std::string& path, LocalFileInfo& info) { return GetFileInfo(path, info); }

bool IsFileExist(const std::string& path) {
  return !path.empty() && access(path.c_str(), F_OK) == 0;
}

int FSChown(const std::string& path, unsigned uid, unsigned gid) {
  if (chown(path.c_str(), static_cast<uid_t>(uid), static_cast<gid_t>(gid)) != 0) {
    int err = errno;
    PLOVO_LIB_ERR("FSChown: chown(%s, %d, %d): %s (%d)", path.c_str(), static_cast<int>(uid),
                  static_cast<int>(gid), Plovo::ErrorText(err).c_str(), err);
    return -1;
  }
  return 0;
}

int FSMKDirP(const std::string& path, unsigned uid, unsigned gid) {
  if (path.empty()) return -1;
  // Every prefix ending before a '/', then the whole path. Folders that
  // exist already are passed over and keep their owner.
  for (size_t at = path.find('/', 1);; at = path.find('/', at + 1)) {
    std::string prefix = at == std::string::npos ? path : path.substr(0, at);
    if (!prefix.empty() && prefix.back() != '/') {
      int err = mkdir(prefix.c_str(), 0777) == 0 ? 0 : errno;
      if (err == 0) {
        FSChown(prefix, uid, gid);
      } else if (err != EEXIST || !IsFolder(prefix)) {
        if (err == EEXIST) err = ENOTDIR;
        PLOVO_LIB_ERR("FSMKDirP: mkdir(%s): %s (%d)",
                      prefix.c_str(), Plovo::ErrorText(err).c_str(), err);
        return -1;
      }
    }
    if (at == std::string::npos) return 0;
  }
}

int FSMKDir(const std::string& path, bool recursive, unsigned uid, unsigned gid) {
  if (path.empty()) return -1;
  LocalFileInfo info;
  if (GetFileInfo(path, info) != 0) {
    PLOVO_LIB_ERR("FSMKDir: Can not get local file info '%s'", path.c_str());
    return -1;
  }
  if (!info.exists) {
    if (recursive ? FSMKDirP(path, uid, gid) != 0 : mkdir(path.c_str(), 0777) != 0) {
      if (!recursive) {  // FSMKDirP names the step that failed itself
        int err = errno;
        // Another caller made it since the look above: it is there, and
        // its owner is that caller's to set. Looked at without following a
        // link, as above: a link put there meanwhile is no folder.
        struct stat st;
        if (err == EEXIST && lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) return 0;
        PLOVO_LIB_ERR("FSMKDir: mkdir(%s): %s (%d)",
                      path.c_str(), Plovo::ErrorText(err).c_str(), err);
      }
      return -2;
    }
    FSChown(path, uid, gid);
    return 0;
  }
  if (info.type == 2) return 0;
  PLOVO_LIB_ERR("FSMKDir: Create a folder but local file system is not directory '%d'", info.type);
  return -1;
}

// The kernel copies first, so that the bytes do not pass through this
// process; the 32 MiB buffer is allocated only when the kernel refuses or
// fails (a destination that is not a regular file, such as a device, goes
// to the buffer at once).
int FSCopy(const std::string& source, const std::string& destination, bool removeSource) {
  Plovo::UniqueFd in(open(source.c_str(), O_RDONLY | O_CLOEXEC));
  if (!in) {
    int err = errno;
    PLOVO_LIB_ERR("CopyFile: open(%s): %s (%d)",
                  source.c_str(), Plovo::ErrorText(err).c_str(), err);
    return -1;
  }
  // Opening a file onto itself would truncate it before the first byte is
  // read; refuse before anything is lost.
  struct stat inStat, outStat;
  bool haveIn = fstat(in.get(), &inStat) == 0;
  if (haveIn && stat(destination.c_str(), &outStat) == 0 && inStat.st_dev == outStat.st_dev &&
      inStat.st_ino == outStat.st_ino) {
    PLOVO_LIB_ERR("FSCopy: '%s' and '%s' are the same file", source.c_str(), destination.c_str());
    return -1;
  }
  Plovo::UniqueFd out(open(destination.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666));
  if (!out) {
    int err = errno;
    PLOVO_LIB_ERR("CopyFile: open(%s): %s (%d)",
                  destination.c_str(), Plovo::ErrorText(err).c_str(), err);
    return -1;
  }
  bool regularOut = fstat(out.get(), &outStat) == 0 && S_ISREG(outStat.st_mode);
  bool kernel = haveIn && S_ISREG(inStat.st_mode) && regularOut;
  int result =
      kernel && CopyInKernel(in.get(), out.get()) ? 0 : CopyWithBuffer(in.get(), out.get());
  in.reset();

  // A file system that allocates at write-back may find the disk full only
  // now; for a move the source must not go while the copy is in doubt.
  // Devices and pipes have nothing to flush and refuse fsync.
  if (fsync(out.get()) != 0 && regularOut && result == 0) {
    int err = errno;
    PLOVO_LIB_ERR("CopyFile: fsync: %s (%d)", Plovo::ErrorText(err).c_str(), err);
    result = err == ENOSPC ? -2 : -1;
  }
  // The last write may fail only at close, so that close is checked here
  // rather than left to the owner.
  if (close(out.release()) != 0 && regularOut && result == 0 && errno != EINTR) {
    int err = errno;
    PLOVO_LIB_ERR("CopyFile: close: %s (%d)", Plovo::ErrorText(err).c_str(), err);
    result = err == ENOSPC ? -2 : -1;
  }
  if (result == 0 && removeSource && remove(source.c_str()) != 0) {
    int err = errno;
    PLOVO_LIB_ERR("FSCopy: remove(%s): %s (%d)",
                  source.c_str(), Plovo::ErrorText(err).c_str(), err);
    result = -1;
  }
  return result;
}

int FSRemove(const std::string& path, bool /*flag*/) {
  if (path.empty()) return -1;
  LocalFileInfo info;
  if (GetFileInfo(path, info) != 0) return -1;
  if (!info.exists) return 0;
  if (info.type == 2) {
    std::vector<std::string> names;
    int listed = ListNames(path, &names);
    if (listed == -1) {
      PLOVO_LIB_ERR("Failed to open dir '%s'", path.c_str());
      return -1;
    }
    if (listed != 0) {
      PLOVO_LIB_ERR("Failed to read dir '%s'", path.c_str());
      return -1;
    }
    // Goes on past a child that cannot be removed, so that as much as
    // possible is gone; the folder itself stays then (it is not empty).
    int childResult = 0;
    for (const std::string& name : names) {
      int r = FSRemove(path + "/" + name, false);
      if (childResult == 0) childResult = r;
    }
    if (childResult != 0) return childResult;
    if (rmdir(path.c_str()) != 0) {
      PLOVO_LIB_ERR("Failed to remove file '%s'", path.c_str());
      return -3;
    }
  } else if (remove(path.c_str()) != 0) {
    PLOVO_LIB_ERR("Failed to remove file '%s'", path.c_str());
    return -3;
  }
  if (VELTEARemove(path.c_str(), -1, 0) != 0) {
    int err = errno;
    PLOVO_LIB_ERR("Failed to remove ea '%s', [%d, %s]",
                  path.c_str(), err, Plovo::ErrorText(err).c_str());
    return -3;
  }
  return 0;
}

int FSRename(const std::string& source, const std::string& destination) {
  if (source.empty() || destination.empty()) return -1;
  LocalFileInfo info;
  if (FSStat(source, info) != 0 || !info.exists) return -2;
  if (rename(source.c_str(), destination.c_str()) == 0) return 0;
  int err = errno;
  if (err != EXDEV) {
    PLOVO_LIB_ERR("FSRename: rename(%s, %s): %s (%d)\n", source.c_str(), destination.c_str(),
                  Plovo::ErrorText(err).c_str(), err);
    return err == ENAMETOOLONG ? -100 : -3;
  }

  // Different file systems: move piece by piece, each file copied and then
  // removed, so that an interruption leaves every byte on one side or both.
  if (info.type == 1) return FSCopy(source, destination, true) == 0 ? 0 : -3;
  if (info.type != 2) return 0;  // links, devices, pipes: not carried over

  if (FSMKDir(destination, true, static_cast<unsigned>(-1), static_cast<unsigned>(-1)) != 0) {
    return -3;
  }
  std::vector<std::string> names;
  int listed = ListNames(source, &names);
  if (listed != 0) {
    if (listed == -1) {
      PLOVO_LIB_ERR("Failed to open dir '%s'", source.c_str());
    } else {
      PLOVO_LIB_ERR("Failed to read dir '%s'", source.c_str());
    }
    return -3;
  }
  for (const std::string& name : names) {
    if (FSRename(source + "/" + name, destination + "/" + name) != 0) return -3;
  }
  if (rmdir(source.c_str()) != 0) {
    err = errno;
    PLOVO_LIB_ERR("FSRename: rmdir(%s): %s (%d)",
                  source.c_str(), Plovo::ErrorText(err).c_str(), err);
    return -3;
  }
  return 0;
}

int TraverseDir(const std::string& path, int (*callback)(const std::string& path, void* context),
                void* context) {
  if (path.empty() || !callback) return -1;
  LocalFileInfo info;
  if (GetFileInfo(path, info) != 0 || !info.exists || info.type != 2) return -1;
  DirHandle dir(opendir(path.c_str()));
  if (!dir) return -2;
  if (callback(path, context) != 0) return -2;
  // readdir_r is deprecated; readdir is thread-safe on glibc as long as one
  // DIR stream is read by one thread, and this stream belongs to this call.
  for (;;) {
    errno = 0;
    struct dirent* entry = readdir(dir.get());
    if (!entry) return errno == 0 ? 0 : -2;
    if (std::strcmp(entry->d_name, ".") == 0 || std::strcmp(entry->d_name, "..") == 0) continue;
    std::string child = path + "/" + entry->d_name;
    bool folder = entry->d_type == DT_DIR;
    if (entry->d_type == DT_UNKNOWN) {
      // Some file systems do not fill in the kind; ask, without following links.
      struct stat st;
      folder = lstat(child.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
    }
    int r = folder ? TraverseDir(child, callback, context) : callback(child, context);
    if (r != 0) return -2;
  }
}

std::string PlovoConfigPath(const std::string& deviceRoot) {
  return deviceRoot + "/@eaDir/" + kConfigName;
}

int WritePlovoConfig(const std::string& deviceRoot, const std::string& key,
                     const std::string& value) {
  if (deviceRoot.empty() || key.empty() || value.empty()) return -1;
  // The key/value write makes the file but not its folder, and a drive
  // fresh from another machine has no "@eaDir" yet.
  std::string folder = deviceRoot + "/@eaDir";
  if (FSMKDir(folder, false, static_cast<unsigned>(-1), static_cast<unsigned>(-1)) != 0) {
    PLOVO_LIB_ERR("WritePlovoConfig: Can not create folder '%s'", folder.c_str());
    return -1;
  }
  std::string file = PlovoConfigPath(deviceRoot);
  if (VLIBCFileSetKeyValue(file.c_str(), key.c_str(), value.c_str(), "%s=\"%s\"\n") < 0) {
    PLOVO_LIB_ERR("VLIBCFileSetKeyValue() failed, path=[%s], key = %s, value = %s", file.c_str(),
                  key.c_str(), value.c_str());
    return -1;
  }
  return 0;
}

int ReadPlovoConfig(const std::string& deviceRoot, const std::string& key, std::string& value) {
  value.clear();
  if (deviceRoot.empty() || key.empty()) return -1;
  std::string file = PlovoConfigPath(deviceRoot);
  // 1024 bytes hold any identity the file carries (a UUID is 36). The read
  // cuts what does not fit, and a value that fills the buffer exactly may
  // have been cut, so it is read again with a larger buffer rather than
  // handed on shortened.
  constexpr size_t kMaxValue = size_t{1} << 20;
  for (size_t size = 1024; size <= kMaxValue; size *= 2) {
    std::vector<char> buffer(size);
    int r = VLIBCFileGetKeyValue(file.c_str(), key.c_str(), buffer.data(), size, 0);
    if (r == 0) return 0;
    if (r < 0) {
      if (VLIBCErrGet() == VLIBC_ERR_NOT_FOUND) return 0;  // no file yet: no key
      PLOVO_LIB_ERR("VLIBCFileGetKeyValue() failed, path=[%s], key = %s", file.c_str(),
                    key.c_str());
      return -1;
    }
    if (static_cast<size_t>(r) < size) {
      value.assign(buffer.data(), static_cast<size_t>(r) - 1);
      return 1;
    }
  }
  PLOVO_LIB_ERR("ReadPlovoConfig: value of %s in '%s' is longer than %d bytes", key.c_str(),
                file.c_str(), static_cast<int>(kMaxValue));
  return -1;
}
