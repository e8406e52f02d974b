#include "daemon/runner.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <vector>

#include "common/file-op.h"
#include "common/log.h"
#include "common/no-throw.h"
#include "common/tmp-name.h"
#include "common/unique-fd.h"
#include "ipc/error-code.h"

namespace plovod {

// ---- RunControl --------------------------------------------------------------

void RunControl::SetCopying(const std::string& path) {
  std::lock_guard<std::mutex> lock(mutex_);
  copying_ = path;
}

std::string RunControl::Copying() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return copying_;
}

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
    finished_(started->plan, error);
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
  it->second->control.Cancel();
  return true;
}

void Runner::CancelOnShare(const std::string& share) {
  std::lock_guard<std::mutex> lock(mutex_);
  for (auto& [id, run] : runs_) {
    if (run->plan.device_share == share) run->control.Cancel();
  }
}

bool Runner::IsRunning(unsigned long id) const {
  std::lock_guard<std::mutex> lock(mutex_);
  auto it = runs_.find(id);
  return it != runs_.end() && !it->second->done;
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
    for (auto& [id, run] : runs_) run->control.Cancel();
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

bool SameFile(const struct stat& a, const struct stat& b) {
  return a.st_size == b.st_size && a.st_mtim.tv_sec == b.st_mtim.tv_sec &&
         a.st_mtim.tv_nsec == b.st_mtim.tv_nsec;
}

int WriteError(int error) { return error == ENOSPC || error == EDQUOT ? P_ERR_DEST_QUOTA_FULL : P_ERR_FILE_OPERATION; }

// Copies one file under a temporary name beside its destination and
// renames it into place once it is whole and synced.
int CopyFile(const std::string& source, const struct stat& sourceStat, const std::string& folder,
             const std::string& name, RunControl& control, std::vector<char>& buffer) {
  const std::string destination = folder + "/" + name;
  struct stat existing {};
  if (lstat(destination.c_str(), &existing) == 0 && S_ISREG(existing.st_mode) && SameFile(existing, sourceStat)) {
    return P_SUCCESS;
  }
  Plovo::UniqueFd in(open(source.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  if (in.get() < 0) return errno == ENOENT ? P_ERR_SOURCE_MISSING : P_ERR_FILE_OPERATION;
  const std::string temporary = folder + "/.plovo-" + TmpNameGen::getInstance().getTmpName();
  Plovo::UniqueFd out(open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
  if (out.get() < 0) return WriteError(errno);
  control.SetCopying(source);
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
  const struct timespec times[2] = {sourceStat.st_atim, sourceStat.st_mtim};
  if (result == P_SUCCESS && (fsync(out.get()) != 0 || futimens(out.get(), times) != 0)) {
    result = WriteError(errno);
  }
  if (result == P_SUCCESS && close(out.release()) != 0) result = WriteError(errno);
  if (result == P_SUCCESS && rename(temporary.c_str(), destination.c_str()) != 0) result = P_ERR_FILE_OPERATION;
  if (result != P_SUCCESS) unlink(temporary.c_str());
  control.SetCopying("");
  return result;
}

}  // namespace

int CopyNewFiles(const RunPlan& plan, RunControl& control) {
  struct stat st {};
  if (stat(plan.source.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) return P_ERR_SOURCE_ROOT_MISSING;
  if (FSMKDirP(plan.destination, -1, -1) != 0) return P_ERR_DEST_ROOT_MISSING;
  std::vector<char> buffer(kBlock);
  // Folders still to copy, relative to both roots; a list rather than
  // recursion, since the depth is the device's.
  std::vector<std::string> pending{""};
  while (!pending.empty()) {
    const std::string relative = pending.back();
    pending.pop_back();
    DIR* dir = opendir((plan.source + relative).c_str());
    if (dir == nullptr) return P_ERR_FILE_OPERATION;
    std::vector<std::string> names;
    while (const dirent* entry = readdir(dir)) {
      const std::string name = entry->d_name;
      if (name != "." && name != ".." && name != "@eaDir") names.push_back(name);
    }
    closedir(dir);
    for (const std::string& name : names) {
      if (control.Cancelled()) return P_ERR_STOPPED;
      const std::string source = plan.source + relative + "/" + name;
      if (lstat(source.c_str(), &st) != 0) continue;  // gone meanwhile
      const std::string folder = plan.destination + relative;
      if (S_ISDIR(st.st_mode)) {
        if (mkdir((folder + "/" + name).c_str(), 0755) != 0 && errno != EEXIST) return WriteError(errno);
        pending.push_back(relative + "/" + name);
      } else if (S_ISREG(st.st_mode)) {
        if (int error = CopyFile(source, st, folder, name, control, buffer)) return error;
      }
    }
  }
  return P_SUCCESS;
}

}  // namespace plovod
