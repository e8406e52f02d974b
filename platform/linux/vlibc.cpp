// Key/value files, processes and the last error.
#include "velt/vlibc.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "dev-internal.h"

namespace {

constexpr const char* kDefaultFormat = "%s=\"%s\"\n";

// A key must fit the line format: something before the '=' that cannot end
// the key early or break the line.
bool ValidKey(const char* key) { return key && *key && !std::strpbrk(key, "=\n"); }

// A line (without its newline) that holds `key`: the whole key, then '='.
bool LineHasKey(const std::string& content, size_t begin, size_t end, const std::string& key) {
  return end - begin > key.size() && content.compare(begin, key.size(), key) == 0 &&
         content[begin + key.size()] == '=';
}

// Calls fn(begin, end, hasNewline) for every line of content.
template <typename Fn>
void ForEachLine(const std::string& content, Fn fn) {
  size_t begin = 0;
  while (begin < content.size()) {
    size_t nl = content.find('\n', begin);
    size_t end = nl == std::string::npos ? content.size() : nl;
    if (!fn(begin, end, nl != std::string::npos)) return;
    begin = end + 1;
  }
}

// The value of the first line holding key, without its surrounding quotes.
// A value written without quotes is taken as it stands.
bool FindValue(const std::string& content, const std::string& key, std::string* value) {
  bool found = false;
  ForEachLine(content, [&](size_t begin, size_t end, bool) {
    if (!LineHasKey(content, begin, end, key)) return true;
    *value = content.substr(begin + key.size() + 1, end - begin - key.size() - 1);
    if (value->size() >= 2 && value->front() == '"' && value->back() == '"') {
      *value = value->substr(1, value->size() - 2);
    }
    found = true;
    return false;
  });
  return found;
}

// content with every line of key removed, and the first one replaced by
// entry when entry is not null. *matched tells whether any line held key.
std::string RewriteLines(const std::string& content, const std::string& key,
                         const std::string* entry, bool* matched) {
  std::string out;
  out.reserve(content.size() + (entry ? entry->size() : 0));
  *matched = false;
  ForEachLine(content, [&](size_t begin, size_t end, bool hasNewline) {
    if (LineHasKey(content, begin, end, key)) {
      if (entry && !*matched) out += *entry;
      *matched = true;
    } else {
      out.append(content, begin, end - begin + (hasNewline ? 1 : 0));
    }
    return true;
  });
  return out;
}

// Reads a key/value file; the last error is set on failure.
bool ReadKeyFile(const char* file, std::string* content, struct stat* st) {
  int err = velt_dev::ReadWholeFile(file, content, st);
  if (err == 0) return true;
  if (err == ENOENT) {
    VELT_FAIL(VLIBC_ERR_NOT_FOUND);
  } else {
    VELT_FAIL(VLIBC_ERR_IO);
  }
  return false;
}

// One key/value line in the caller's format, ending with a newline so that
// it never joins the next line.
bool FormatEntry(const char* format, const char* key, const char* value, std::string* entry) {
  int n = std::snprintf(nullptr, 0, format, key, value);
  if (n < 0) return false;
  entry->assign(static_cast<size_t>(n) + 1, '\0');
  std::snprintf(&(*entry)[0], entry->size(), format, key, value);
  entry->resize(static_cast<size_t>(n));
  if (entry->empty() || entry->back() != '\n') *entry += '\n';
  return true;
}

// The argument list of an exec: the program, then the arguments up to the
// first null.
void BuildArgv(const char* program, const char* const* args, char* argv[6]) {
  argv[0] = const_cast<char*>(program);
  int n = 1;
  for (int i = 0; i < 4 && args[i]; ++i) argv[n++] = const_cast<char*>(args[i]);
  argv[n] = nullptr;
}

// In a child after fork only async-signal-safe calls are allowed: report
// the exec's errno through the close-on-exec pipe and leave.
[[noreturn]] void ExecOrReport(const char* program, char* const argv[], int reportFd) {
  execv(program, argv);
  int err = errno;
  ssize_t ignored = write(reportFd, &err, sizeof err);
  (void)ignored;
  _exit(127);
}

// Reads the errno a child reported; 0 when the pipe closed without one,
// which means the program was started.
int ReadChildErrno(int fd) {
  int err = 0;
  ssize_t n;
  do {
    n = read(fd, &err, sizeof err);
  } while (n < 0 && errno == EINTR);
  return n > 0 ? (err ? err : EIO) : 0;
}

bool WaitChild(pid_t pid, int* status) {
  pid_t r;
  do {
    r = waitpid(pid, status, 0);
  } while (r < 0 && errno == EINTR);
  return r == pid;
}

}  // namespace

extern "C" {

int VLIBCFileGetKeyValue(const char* file, const char* key, char* buffer, size_t size,
                         int /*flags*/) {
  if (VELT_FAULT_HIT()) return -1;
  if (!file || !ValidKey(key) || !buffer || size == 0) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::string content;
  if (!ReadKeyFile(file, &content, nullptr)) return -1;
  std::string value;
  if (!FindValue(content, key, &value)) {
    buffer[0] = '\0';
    return 0;
  }
  size_t n = std::min({value.size(), size - 1, static_cast<size_t>(INT_MAX - 1)});
  std::memcpy(buffer, value.data(), n);
  buffer[n] = '\0';
  return static_cast<int>(n + 1);
}

int VLIBCFileSetKeyValue(const char* file, const char* key, const char* value, const char* format) {
  if (VELT_FAULT_HIT()) return -1;
  // A newline in the value would split the line and leave a stray line behind.
  if (!file || !*file || !ValidKey(key) || !value || std::strchr(value, '\n')) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::string entry;
  if (!FormatEntry(format ? format : kDefaultFormat, key, value, &entry)) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::string content;
  struct stat st;
  bool exists = true;
  int err = velt_dev::ReadWholeFile(file, &content, &st);
  if (err == ENOENT) {
    exists = false;
  } else if (err != 0) {
    VELT_FAIL(VLIBC_ERR_IO);
    return -1;
  }
  bool matched;
  std::string out = RewriteLines(content, key, &entry, &matched);
  if (!matched) {
    if (!out.empty() && out.back() != '\n') out += '\n';
    out += entry;
  }
  return velt_dev::ReplaceFile(file, out, exists ? &st : nullptr) ? 0 : -1;
}

int VLIBCFileCheckKeyValue(const char* file, const char* key, const char* value, int /*flags*/) {
  if (VELT_FAULT_HIT()) return -1;
  if (!file || !ValidKey(key) || !value) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::string content;
  if (!ReadKeyFile(file, &content, nullptr)) return -1;
  std::string found;
  return FindValue(content, key, &found) && found == value ? 1 : 0;
}

int VLIBCFileRemoveKey(const char* file, const char* key) {
  if (VELT_FAULT_HIT()) return -1;
  if (!file || !ValidKey(key)) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::string content;
  struct stat st;
  if (!ReadKeyFile(file, &content, &st)) return -1;
  bool matched;
  std::string out = RewriteLines(content, key, nullptr, &matched);
  if (!matched) return 0;
  return velt_dev::ReplaceFile(file, out, &st) ? 0 : -1;
}

int VLIBCFileExist(const char* path) {
  if (VELT_FAULT_HIT()) return 0;
  if (!path) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return 0;
  }
  struct stat st;
  return stat(path, &st) == 0 ? 1 : 0;
}

namespace {

// Runs program with its arguments. Waiting, the result is 0 when it exits
// with status 0. Not waiting, it is started through an intermediate process
// that leaves at once, so the program is never the caller's zombie, and the
// result is 0 once it has started. Either way an exec failure is learnt
// through a close-on-exec pipe.
int RunProgram(const char* program, const char* arg1, const char* arg2, const char* arg3,
               const char* arg4, bool wait) {
  if (!program || !*program) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  const char* args[4] = {arg1, arg2, arg3, arg4};
  char* argv[6];
  BuildArgv(program, args, argv);
  int report[2];
  if (pipe2(report, O_CLOEXEC) != 0) {
    VELT_FAIL(VLIBC_ERR_EXEC);
    return -1;
  }
  pid_t child = fork();
  if (child == 0) {
    close(report[0]);
    if (wait) ExecOrReport(program, argv, report[1]);
    pid_t program_pid = fork();
    if (program_pid == 0) ExecOrReport(program, argv, report[1]);
    if (program_pid < 0) {
      int err = errno;
      ssize_t ignored = write(report[1], &err, sizeof err);
      (void)ignored;
      _exit(1);
    }
    _exit(0);
  }
  close(report[1]);
  if (child < 0) {
    close(report[0]);
    VELT_FAIL(VLIBC_ERR_EXEC);
    return -1;
  }
  int status = 0;
  bool reaped = WaitChild(child, &status);
  // Returns once every copy of the pipe closed (at exec or exit), or with
  // the errno of the failed exec or fork.
  int execErr = ReadChildErrno(report[0]);
  close(report[0]);
  if (!reaped || execErr != 0 || !WIFEXITED(status) || WEXITSTATUS(status) != 0) {
    VELT_FAIL(VLIBC_ERR_EXEC);
    return -1;
  }
  return 0;
}

}  // namespace

int VLIBCExec(const char* program, const char* arg1, const char* arg2, const char* arg3,
              const char* arg4) {
  if (VELT_FAULT_HIT()) return -1;
  return RunProgram(program, arg1, arg2, arg3, arg4, true);
}

int VLIBCBackgroundExec(const char* program, const char* arg1, const char* arg2, const char* arg3,
                        const char* arg4) {
  if (VELT_FAULT_HIT()) return -1;
  return RunProgram(program, arg1, arg2, arg3, arg4, false);
}

int VLIBCReadPidFile(const char* path) {
  if (VELT_FAULT_HIT()) return -1;
  if (!path) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::string content;
  if (!ReadKeyFile(path, &content, nullptr)) return -1;
  const char* begin = content.c_str();
  char* end = nullptr;
  errno = 0;
  long pid = std::strtol(begin, &end, 10);
  bool number = end != begin && errno == 0;
  while (number && *end && std::strchr(" \t\r\n", *end)) ++end;
  if (!number || *end || pid < 1 || pid > INT_MAX) {
    VELT_FAIL(VLIBC_ERR_NOT_FOUND);
    return -1;
  }
  return static_cast<int>(pid);
}

int VLIBCProcAlive(int pid) {
  if (VELT_FAULT_HIT()) return 0;
  // kill() with 0 or a negative id would probe a whole process group.
  if (pid < 1) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return 0;
  }
  if (kill(pid, 0) == 0 || errno == EPERM) return 1;
  if (errno != ESRCH) VELT_FAIL(VLIBC_ERR_IO);
  return 0;
}

int VLIBCErrGet(void) { return velt_dev::LastErrorCode(); }
const char* VLIBCErrorGetFile(void) { return velt_dev::LastErrorFile(); }
int VLIBCErrorGetLine(void) { return velt_dev::LastErrorLine(); }

}  // extern "C"
