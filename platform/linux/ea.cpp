// Extended-attribute data on a development host. What the platform keeps
// about "/a/b/name" lives beside it in "/a/b/@eaDir/name", a file or a
// whole folder tree; removing the data removes that entry.
#include "velt/ea.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <vector>

#include "dev-internal.h"

namespace {

// The entry that holds path's data: the last component moved one folder
// down, into "@eaDir". Trailing slashes do not count as a component.
bool StorePath(std::string path, std::string* store) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  size_t slash = path.rfind('/');
  std::string name = slash == std::string::npos ? path : path.substr(slash + 1);
  if (name.empty() || name == "." || name == "..") return false;  // "/" or a name that is no entry
  std::string dir = slash == std::string::npos ? std::string() : path.substr(0, slash + 1);
  *store = dir + "@eaDir/" + name;
  return true;
}

// Removes name under dirfd and, for a folder, everything in it, without
// following symbolic links. Gone already counts as removed. Returns 0 or
// the errno of the first step that failed; the rest is still attempted so
// that as little as possible is left behind.
int RemoveAt(int dirfd, const char* name) {
  struct stat st;
  if (fstatat(dirfd, name, &st, AT_SYMLINK_NOFOLLOW) != 0) return errno == ENOENT ? 0 : errno;
  if (!S_ISDIR(st.st_mode)) return unlinkat(dirfd, name, 0) == 0 || errno == ENOENT ? 0 : errno;

  int fd = openat(dirfd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) return errno;
  DIR* dir = fdopendir(fd);
  if (!dir) {
    int err = errno;
    close(fd);
    return err;
  }
  // The names are read first: entries removed while the folder is being
  // read may make some file systems skip or repeat others.
  std::vector<std::string> names;
  int err = 0;
  for (;;) {
    errno = 0;
    struct dirent* entry = readdir(dir);
    if (!entry) {
      err = errno;
      break;
    }
    std::string child = entry->d_name;
    if (child != "." && child != "..") names.push_back(std::move(child));
  }
  for (const std::string& child : names) {
    int childErr = RemoveAt(fd, child.c_str());
    if (err == 0) err = childErr;
  }
  closedir(dir);
  if (err != 0) return err;
  return unlinkat(dirfd, name, AT_REMOVEDIR) == 0 || errno == ENOENT ? 0 : errno;
}

}  // namespace

extern "C" {

int VELTEARemove(const char* path, int /*kind*/, int /*flags*/) {
  if (VELT_FAULT_HIT()) {
    // The caller reports errno; give it the reason the switch stands for.
    errno = EIO;
    return -1;
  }
  if (!path || !*path) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    errno = EINVAL;
    return -1;
  }
  // The development store keeps one entry per file with every kind of data
  // in it, so every kind means the whole entry.
  std::string store;
  if (!StorePath(path, &store)) return 0;
  int err = RemoveAt(AT_FDCWD, store.c_str());
  // "@eaDir" itself missing, or not a folder: there is no store.
  if (err == 0 || err == ENOTDIR) return 0;
  VELT_FAIL(VLIBC_ERR_IO);
  errno = err;
  return -1;
}

}  // extern "C"
