#include "daemon/engine/file-copy.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "common/tmp-name.h"
#include "ipc/error-code.h"

namespace plovod {

namespace {

const char kTemporaryPrefix[] = ".plovo-";
constexpr size_t kTemporaryLength = sizeof(kTemporaryPrefix) - 1 + 8;
// A cancel is seen between blocks: small enough for a second on the
// slowest card, large enough that the kernel copies efficiently.
constexpr size_t kBlock = 8 << 20;
// A batch is synced once: bounded so that a cancel or a full disk never
// waits long for the sync, and few folders are held open.
constexpr unsigned long long kBatchBytes = 64ull << 20;
constexpr size_t kBatchFiles = 256;

bool DestinationFull(int error) { return error == ENOSPC || error == EDQUOT; }

// A failure to write that concerns this file alone.
bool RefusedByDestination(int error) {
  return error == EFBIG || error == ENAMETOOLONG || error == EINVAL || error == EILSEQ;
}

}  // namespace

bool IsTemporary(const std::string& name) {
  return name.size() == kTemporaryLength && name.compare(0, sizeof(kTemporaryPrefix) - 1, kTemporaryPrefix) == 0;
}

Folder OpenBelow(int base, const std::string& relative, bool create) {
  auto dir = std::make_shared<Plovo::UniqueFd>(fcntl(base, F_DUPFD_CLOEXEC, 0));
  for (size_t begin = 0; dir->get() >= 0 && begin < relative.size();) {
    size_t end = relative.find('/', begin);
    if (end == std::string::npos) end = relative.size();
    const std::string part = relative.substr(begin, end - begin);
    begin = end + 1;
    if (part.empty()) continue;
    if (create && mkdirat(dir->get(), part.c_str(), 0755) != 0 && errno != EEXIST) return nullptr;
    dir->reset(openat(dir->get(), part.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  }
  return dir->get() >= 0 ? dir : nullptr;
}

int RemoveEntry(int folder, const std::string& name, int depth) {
  if (unlinkat(folder, name.c_str(), 0) == 0) return 0;
  if (errno != EISDIR && errno != EPERM) return -1;
  // A descriptor per level: a tree deeper than any run makes stays.
  if (depth > 256) return errno = ELOOP, -1;
  // A folder: its entries first, through the open folder, so that a link
  // inside is removed as a link and never followed.
  Plovo::UniqueFd dir(openat(folder, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (dir.get() < 0) return -1;
  DIR* stream = fdopendir(fcntl(dir.get(), F_DUPFD_CLOEXEC, 0));
  if (stream == nullptr) return -1;
  std::vector<std::string> names;
  while (const dirent* entry = readdir(stream)) {
    if (strcmp(entry->d_name, ".") != 0 && strcmp(entry->d_name, "..") != 0) names.push_back(entry->d_name);
  }
  closedir(stream);
  int result = 0;
  for (const std::string& child : names) {
    if (RemoveEntry(dir.get(), child, depth + 1) != 0) result = -1;
  }
  if (result == 0 && unlinkat(folder, name.c_str(), AT_REMOVEDIR) != 0) result = -1;
  return result;
}

Placer::Placer(int destinationRoot, RunControl& control, Dropped dropped)
    : root_(destinationRoot), control_(control), dropped_(std::move(dropped)) {}

int Placer::Transfer(int in, int out, bool& fromSource) {
  while (kernelCopy_) {
    if (control_.Cancelled()) return ECANCELED;
    const ssize_t n = copy_file_range(in, nullptr, out, nullptr, kBlock, 0);
    if (n == 0) return 0;
    if (n > 0) continue;
    if (errno == EINTR) continue;
    if (DestinationFull(errno) || errno == EFBIG) return fromSource = false, errno;
    if (errno == ENOSYS) kernelCopy_ = false;
    // Across file systems, or an error whose side it does not tell: the
    // plain copy goes on from where this one stopped and says which side
    // failed.
    break;
  }
  if (buffer_.empty()) buffer_.resize(1 << 20);
  for (;;) {
    if (control_.Cancelled()) return ECANCELED;
    const ssize_t got = read(in, buffer_.data(), buffer_.size());
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) return fromSource = true, errno;
    if (got == 0) return 0;
    for (ssize_t put = 0; put < got;) {
      const ssize_t n = write(out, buffer_.data() + put, got - put);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return fromSource = false, n < 0 ? errno : ENOSPC;
      put += n;
    }
  }
}

Placer::Outcome Placer::Copy(int from, const std::string& name, const struct stat& listed, const Folder& to,
                             const std::string& finalName, bool replace, const std::string& shown,
                             const Placed& placed, std::string& why, int& error) {
  // Not blocking, so that a FIFO put in the file's place cannot hold the
  // run (and with it every cancel) waiting for a writer.
  Plovo::UniqueFd in(openat(from, name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  struct stat st = listed;
  if (in.get() < 0 || fstat(in.get(), &st) != 0) {
    why = errno == ENOENT ? "the file went away" : errno == ELOOP ? "not a regular file" : strerror(errno);
    return kSkipped;
  }
  if (!S_ISREG(st.st_mode)) return why = "not a regular file", kSkipped;
  // The file listed is the file copied (and the one a move removes).
  if (st.st_ino != listed.st_ino || st.st_dev != listed.st_dev) return why = "the file was replaced meanwhile", kSkipped;
  const std::string temporary = kTemporaryPrefix + TmpNameGen::getInstance().getTmpName();
  Plovo::UniqueFd out(openat(to->get(), temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
  if (out.get() < 0) {
    if (DestinationFull(errno)) return error = P_ERR_DEST_QUOTA_FULL, kFailed;
    return error = P_ERR_FILE_OPERATION, kFailed;
  }
  control_.SetCopying(shown);
  bool fromSource = false;
  int failed = Transfer(in.get(), out.get(), fromSource);
  const struct timespec times[2] = {st.st_atim, st.st_mtim};
  if (failed == 0 && futimens(out.get(), times) != 0) failed = errno;
  if (failed == 0 && close(out.release()) != 0) failed = errno;
  control_.SetCopying("");
  if (failed != 0) {
    out.reset();
    unlinkat(to->get(), temporary.c_str(), 0);
    if (failed == ECANCELED) return error = control_.Reason(), kFailed;
    if (DestinationFull(failed)) return error = P_ERR_DEST_QUOTA_FULL, kFailed;
    if (fromSource || RefusedByDestination(failed)) {
      why = fromSource ? std::string("cannot read the file: ") + strerror(failed)
                       : std::string("the destination refuses the file: ") + strerror(failed);
      return kSkipped;
    }
    return error = P_ERR_FILE_OPERATION, kFailed;
  }
  waiting_.push_back({to, temporary, finalName, replace, placed, shown});
  waitingBytes_ += static_cast<unsigned long long>(st.st_size);
  if (waiting_.size() >= kBatchFiles || waitingBytes_ >= kBatchBytes) {
    if ((error = Commit()) != 0) return kFailed;
  }
  return kCopied;
}

int Placer::Commit() {
  if (waiting_.empty()) return 0;
  if (syncfs(root_) != 0) {
    const int result = DestinationFull(errno) ? P_ERR_DEST_QUOTA_FULL : P_ERR_FILE_OPERATION;
    Discard();
    return result;
  }
  std::vector<Waiting> batch;
  batch.swap(waiting_);
  waitingBytes_ = 0;
  int result = 0;
  for (Waiting& file : batch) {
    const int folder = file.folder->get();
    const char* temporary = file.temporary.c_str();
    if (result != 0) {
      unlinkat(folder, temporary, 0);
      continue;
    }
    int moved = file.replace ? renameat(folder, temporary, folder, file.name.c_str())
                             : renameat2(folder, temporary, folder, file.name.c_str(), RENAME_NOREPLACE);
    // A file system that cannot refuse to replace: look, then rename.
    if (moved != 0 && errno == EINVAL && !file.replace) {
      struct stat st {};
      errno = EEXIST;
      if (fstatat(folder, file.name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
        moved = renameat(folder, temporary, folder, file.name.c_str());
      }
    }
    if (moved == 0) {
      file.placed();
      continue;
    }
    // A file that appeared under the name meanwhile is the user's: kept.
    // A name the destination refuses concerns this file alone.
    if (errno == EEXIST) {
      dropped_(file.shown, "a file of that name appeared at the destination");
    } else if (RefusedByDestination(errno)) {
      dropped_(file.shown, std::string("the destination refuses the name: ") + strerror(errno));
    } else {
      result = P_ERR_FILE_OPERATION;
    }
    unlinkat(folder, temporary, 0);
  }
  return result;
}

void Placer::Discard() {
  for (const Waiting& file : waiting_) unlinkat(file.folder->get(), file.temporary.c_str(), 0);
  waiting_.clear();
  waitingBytes_ = 0;
}

}  // namespace plovod
