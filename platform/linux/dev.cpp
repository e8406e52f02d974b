// Development-platform controls and shared helpers: sandbox root, last error,
// fault switches, state files.
#include "velt/dev.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <json/reader.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <map>
#include <mutex>
#include <sstream>
#include <string>

#include "dev-internal.h"

namespace velt_dev {
namespace {

struct LastError {
  int code = VLIBC_ERR_NONE;
  const char* file = "";
  int line = 0;
};
thread_local LastError tLastError;

struct FaultSwitch {
  int nth;
  int times;
  int err;
  int calls;
};

struct FaultTable {
  std::mutex mutex;
  std::map<std::string, FaultSwitch, std::less<>> switches;
  // Lets the common case (no switch at all) skip the lock.
  std::atomic<bool> any{false};
};

// Never destroyed: platform calls may still run in other threads while the
// process exits.
FaultTable& Faults() {
  static FaultTable* table = new FaultTable;
  return *table;
}

}  // namespace

std::string Root() {
  const char* env = std::getenv("PLOVO_ROOT");
  std::string root = env ? env : "";
  while (!root.empty() && root.back() == '/') root.pop_back();
  return root;
}

std::string StateDir() { return Root() + "/velt-dev"; }

void SetLastError(int code, const char* file, int line) {
  tLastError.code = code;
  tLastError.file = file;
  tLastError.line = line;
}

int LastErrorCode() { return tLastError.code; }
const char* LastErrorFile() { return tLastError.file; }
int LastErrorLine() { return tLastError.line; }

bool FaultHit(const char* call, const char* file, int line) {
  FaultTable& table = Faults();
  if (!table.any.load(std::memory_order_acquire)) return false;
  int err;
  {
    std::lock_guard<std::mutex> lock(table.mutex);
    auto it = table.switches.find(call);
    if (it == table.switches.end()) return false;
    FaultSwitch& sw = it->second;
    ++sw.calls;
    if (sw.calls < sw.nth) return false;
    err = sw.err;
    if (sw.times >= 1 && sw.calls >= sw.nth + sw.times - 1) {
      table.switches.erase(it);
      if (table.switches.empty()) table.any.store(false, std::memory_order_release);
    }
  }
  SetLastError(err, file, line);
  return true;
}

int ReadWholeFile(const std::string& path, std::string* out, struct stat* st) {
  out->clear();
  // O_NONBLOCK: opening a FIFO would otherwise wait for a writer. It changes
  // nothing for the regular files read below.
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
  if (fd < 0) return errno;
  struct stat own;
  if (!st) st = &own;
  int result = 0;
  if (fstat(fd, st) != 0) {
    result = errno;
  } else if (!S_ISREG(st->st_mode)) {
    result = EINVAL;
  } else if (st->st_size > kMaxFileSize) {
    result = EFBIG;
  }
  char buf[8192];
  while (result == 0) {
    ssize_t n = read(fd, buf, sizeof buf);
    if (n > 0) {
      out->append(buf, static_cast<size_t>(n));
      // The file may have grown since fstat.
      if (out->size() > static_cast<size_t>(kMaxFileSize)) result = EFBIG;
    } else if (n == 0) {
      break;
    } else if (errno != EINTR) {
      result = errno;
    }
  }
  close(fd);
  if (result != 0) out->clear();
  return result;
}

int ReadJsonState(const std::string& name, Json::Value* root) {
  std::string text;
  int err = ReadWholeFile(StateDir() + "/" + name, &text, nullptr);
  if (err == ENOENT) return 0;
  if (err != 0) return -1;
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  std::string errors;
  std::istringstream in(text);
  try {
    return Json::parseFromStream(builder, in, root, &errors) ? 1 : -1;
  } catch (const std::exception&) {
    return -1;
  }
}

namespace {

bool WriteAll(int fd, const std::string& data) {
  size_t done = 0;
  while (done < data.size()) {
    ssize_t n = write(fd, data.data() + done, data.size() - done);
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    done += static_cast<size_t>(n);
  }
  return true;
}

}  // namespace

// Replaces file by data through a temporary file in the same folder, so that
// a reader sees the old or the new content, never a part. old is the stat of
// the file being replaced, null for a new file. No fsync: on a development
// host only readers running at the same time matter, not power loss.
bool ReplaceFile(const std::string& file, const std::string& data, const struct stat* old) {
  size_t slash = file.rfind('/');
  std::string dir = slash == std::string::npos ? "." : file.substr(0, slash);
  std::string base = slash == std::string::npos ? file : file.substr(slash + 1);
  std::string tmp = dir + "/." + base + ".XXXXXX";
  int fd = mkostemp(&tmp[0], O_CLOEXEC);
  if (fd < 0) {
    VELT_FAIL(errno == ENOENT ? VLIBC_ERR_NOT_FOUND : VLIBC_ERR_IO);
    return false;
  }
  bool ok = fchmod(fd, old ? (old->st_mode & 07777) : 0644) == 0;
  if (ok && old && (old->st_uid != geteuid() || old->st_gid != getegid())) {
    if (fchown(fd, old->st_uid, old->st_gid) != 0) {
      // Only root may give a file away; anyone else leaves it their own.
    }
  }
  ok = ok && WriteAll(fd, data);
  ok = (close(fd) == 0) && ok;
  ok = ok && rename(tmp.c_str(), file.c_str()) == 0;
  if (!ok) {
    VELT_FAIL(VLIBC_ERR_IO);
    unlink(tmp.c_str());
  }
  return ok;
}

}  // namespace velt_dev

extern "C" {

void VeltDevFailCall(const char* call, int nth, int times, int err) {
  if (!call) return;
  velt_dev::FaultTable& table = velt_dev::Faults();
  std::lock_guard<std::mutex> lock(table.mutex);
  table.switches[call] = velt_dev::FaultSwitch{nth < 1 ? 1 : nth, times, err, 0};
  table.any.store(true, std::memory_order_release);
}

void VeltDevClearFaults(void) {
  velt_dev::FaultTable& table = velt_dev::Faults();
  std::lock_guard<std::mutex> lock(table.mutex);
  table.switches.clear();
  table.any.store(false, std::memory_order_release);
}

const char* VeltDevStateDir(void) {
  thread_local std::string dir;
  dir = velt_dev::StateDir();
  return dir.c_str();
}

}  // extern "C"
