#include "daemon/runner.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <vector>

#include "common/log.h"
#include "common/no-throw.h"
#include "common/tmp-name.h"
#include "common/unique-fd.h"
#include "ipc/error-code.h"

namespace plovod {

// ---- Runner ------------------------------------------------------------------

bool Runner::Start(const RunPlan& plan) {
  std::lock_guard<std::mutex> lock(mutex_);
  Reap();
  if (stopping_ || runs_.count(plan.id) != 0) return false;
  auto run = std::make_unique<Run>();
  run->plan = plan;
  Run* started = run.get();
  run->thread = std::thread([this, started] {
    const int error = Plovo::NoThrow([&] { return job_(started->plan, started->control); },
                                     static_cast<int>(P_ERR_SYSTEM));
    finished_(started->plan, started->control.stats, error);
    std::lock_guard<std::mutex> lock(mutex_);
    started->done = true;
  });
  runs_[plan.id] = std::move(run);
  return true;
}

void Runner::Reap() {
  for (auto it = runs_.begin(); it != runs_.end();) {
    if (!it->second->done) {
      ++it;
      continue;
    }
    it->second->thread.join();
    it = runs_.erase(it);
  }
}

bool Runner::Cancel(unsigned long id) {
  std::lock_guard<std::mutex> lock(mutex_);
  auto it = runs_.find(id);
  if (it == runs_.end() || it->second->done) return false;
  it->second->control.Cancel(P_ERR_STOPPED);
  return true;
}

void Runner::CancelOnShare(const std::string& share) {
  std::lock_guard<std::mutex> lock(mutex_);
  for (auto& [id, run] : runs_) {
    if (run->plan.device_share == share) run->control.Cancel(P_ERR_SHARE_NOT_MOUNTED);
  }
}

bool Runner::IsRunning(unsigned long id) const {
  std::lock_guard<std::mutex> lock(mutex_);
  auto it = runs_.find(id);
  return it != runs_.end() && !it->second->done;
}

bool Runner::BusyOnShare(const std::string& share, unsigned long except) const {
  std::lock_guard<std::mutex> lock(mutex_);
  for (const auto& [id, run] : runs_) {
    if (id != except && !run->done && run->plan.device_share == share) return true;
  }
  return false;
}

std::set<unsigned long> Runner::Running() const {
  std::lock_guard<std::mutex> lock(mutex_);
  std::set<unsigned long> ids;
  for (const auto& [id, run] : runs_) {
    if (!run->done) ids.insert(id);
  }
  return ids;
}

std::string Runner::Copying(unsigned long id) const {
  std::lock_guard<std::mutex> lock(mutex_);
  auto it = runs_.find(id);
  return it == runs_.end() || it->second->done ? "" : it->second->control.Copying();
}

void Runner::StopAll() {
  std::map<unsigned long, std::unique_ptr<Run>> runs;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    stopping_ = true;
    for (auto& [id, run] : runs_) run->control.Cancel(P_ERR_STOPPED);
    runs.swap(runs_);
  }
  // Without the lock: a run's last step takes it.
  for (auto& [id, run] : runs) run->thread.join();
}

// ---- CopyNewFiles ------------------------------------------------------------

namespace {

// Small enough that a cancel is seen within a fraction of a second on the
// slowest device.
constexpr size_t kBlock = 1 << 20;
const char kTemporaryPrefix[] = ".plovo-";
constexpr size_t kTemporaryLength = sizeof(kTemporaryPrefix) - 1 + 8;

int WriteError(int error) { return error == ENOSPC || error == EDQUOT ? P_ERR_DEST_QUOTA_FULL : P_ERR_FILE_OPERATION; }

// A copy's temporary name: one a run that was killed left behind is no
// file of the user's, and is never copied on.
bool IsTemporary(const std::string& name) {
  return name.size() == kTemporaryLength && name.compare(0, sizeof(kTemporaryPrefix) - 1, kTemporaryPrefix) == 0;
}

// The folder relative ("a/b", "" for base itself) below the open folder
// base, never through a link: a link on the card or in the NAS folder,
// even one put there during the run, would lead the copy out of its
// folders. Missing folders are made when create is set. -1 on failure.
int OpenBelow(int base, const std::string& relative, bool create) {
  Plovo::UniqueFd dir(fcntl(base, F_DUPFD_CLOEXEC, 0));
  for (size_t begin = 0; dir.get() >= 0 && begin < relative.size();) {
    size_t end = relative.find('/', begin);
    if (end == std::string::npos) end = relative.size();
    const std::string part = relative.substr(begin, end - begin);
    begin = end + 1;
    if (part.empty()) continue;
    if (create && mkdirat(dir.get(), part.c_str(), 0755) != 0 && errno != EEXIST) return -1;
    dir.reset(openat(dir.get(), part.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  }
  return dir.release();
}

// Puts the finished temporary file in place unless a file of that name
// appeared meanwhile; that one is kept and the copy dropped.
int PlaceFile(int folder, const std::string& temporary, const std::string& name) {
  if (renameat2(folder, temporary.c_str(), folder, name.c_str(), RENAME_NOREPLACE) == 0) return P_SUCCESS;
  if (errno == EEXIST) return unlinkat(folder, temporary.c_str(), 0), P_SUCCESS;
  // A file system that cannot refuse to replace: look, then rename.
  struct stat st {};
  if (errno == EINVAL && fstatat(folder, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 &&
      renameat(folder, temporary.c_str(), folder, name.c_str()) == 0) {
    return P_SUCCESS;
  }
  return P_ERR_FILE_OPERATION;
}

// Copies the file name of the folder from into the folder to, under a
// temporary name there, and puts it in place once it is whole and synced.
// A name that exists at the destination, of whatever kind, is left alone:
// it may be the user's own. Anything but a regular file is skipped.
int CopyFile(int from, int to, const std::string& name, const std::string& shown, RunControl& control,
             std::vector<char>& buffer) {
  struct stat st {};
  if (fstatat(to, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0) return P_SUCCESS;
  // Not blocking, so that a FIFO put in the file's place cannot hold the
  // run (and with it every cancel) waiting for a writer.
  Plovo::UniqueFd in(openat(from, name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (in.get() < 0) return errno == ENOENT ? P_ERR_SOURCE_MISSING : errno == ELOOP ? P_SUCCESS : P_ERR_FILE_OPERATION;
  if (fstat(in.get(), &st) != 0) return P_ERR_FILE_OPERATION;
  if (!S_ISREG(st.st_mode)) return P_SUCCESS;
  const std::string temporary = kTemporaryPrefix + TmpNameGen::getInstance().getTmpName();
  Plovo::UniqueFd out(openat(to, temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
  if (out.get() < 0) return WriteError(errno);
  control.SetCopying(shown);
  int result = P_SUCCESS;
  for (;;) {
    if (control.Cancelled()) {
      result = P_ERR_STOPPED;
      break;
    }
    const ssize_t got = read(in.get(), buffer.data(), buffer.size());
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) {
      if (got < 0) result = P_ERR_FILE_OPERATION;
      break;
    }
    for (ssize_t put = 0; put < got && result == P_SUCCESS;) {
      const ssize_t n = write(out.get(), buffer.data() + put, got - put);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) result = WriteError(n < 0 ? errno : ENOSPC);
      else put += n;
    }
    if (result != P_SUCCESS) break;
  }
  const struct timespec times[2] = {st.st_atim, st.st_mtim};
  if (result == P_SUCCESS && (fsync(out.get()) != 0 || futimens(out.get(), times) != 0)) {
    result = WriteError(errno);
  }
  if (result == P_SUCCESS && close(out.release()) != 0) result = WriteError(errno);
  if (result == P_SUCCESS) result = PlaceFile(to, temporary, name);
  if (result != P_SUCCESS) unlinkat(to, temporary.c_str(), 0);
  control.SetCopying("");
  return result;
}

// The names of the open folder dir, without ".", ".." and the platform's
// "@eaDir"; false when it cannot be read.
bool ListNames(int dir, std::vector<std::string>& names) {
  DIR* stream = fdopendir(fcntl(dir, F_DUPFD_CLOEXEC, 0));
  if (stream == nullptr) return false;
  rewinddir(stream);
  while (const dirent* entry = readdir(stream)) {
    const std::string name = entry->d_name;
    if (name != "." && name != ".." && name != "@eaDir") names.push_back(name);
  }
  closedir(stream);
  return true;
}

}  // namespace

int CopyNewFiles(const RunPlan& plan, RunControl& control) {
  Plovo::UniqueFd sourceShare(open(plan.source_root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  Plovo::UniqueFd destinationShare(open(plan.destination_root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (sourceShare.get() < 0) return P_ERR_SOURCE_ROOT_MISSING;
  if (destinationShare.get() < 0) return P_ERR_DEST_ROOT_MISSING;
  Plovo::UniqueFd source(OpenBelow(sourceShare.get(), plan.source.substr(plan.source_root.size()), false));
  if (source.get() < 0) return P_ERR_SOURCE_ROOT_MISSING;
  Plovo::UniqueFd destination(
      OpenBelow(destinationShare.get(), plan.destination.substr(plan.destination_root.size()), true));
  if (destination.get() < 0) return P_ERR_DEST_ROOT_MISSING;
  std::vector<char> buffer(kBlock);
  // Folders still to copy, relative to both; a list rather than recursion,
  // since the depth is the device's, and paths rather than open folders,
  // since a wide tree would run out of descriptors.
  std::vector<std::string> pending{""};
  while (!pending.empty()) {
    const std::string relative = pending.back();
    pending.pop_back();
    Plovo::UniqueFd from(OpenBelow(source.get(), relative, false));
    Plovo::UniqueFd to(OpenBelow(destination.get(), relative, true));
    std::vector<std::string> names;
    if (from.get() < 0 || !ListNames(from.get(), names)) return P_ERR_FILE_OPERATION;
    if (to.get() < 0) return WriteError(errno);
    for (const std::string& name : names) {
      if (control.Cancelled()) return P_ERR_STOPPED;
      struct stat st {};
      if (IsTemporary(name) || fstatat(from.get(), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) continue;
      const std::string path = relative.empty() ? name : relative + "/" + name;
      if (S_ISDIR(st.st_mode)) {
        pending.push_back(path);
      } else if (S_ISREG(st.st_mode)) {
        if (int error = CopyFile(from.get(), to.get(), name, plan.source + "/" + path, control, buffer)) return error;
      }
    }
  }
  return P_SUCCESS;
}

}  // namespace plovod
