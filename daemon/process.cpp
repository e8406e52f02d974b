#include "daemon/process.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/log.h"

namespace plovod {

namespace {

// Whether path still names the open file fd: a pid file removed or
// replaced after it was opened is no longer the one others look at.
bool StillNamed(const std::string& path, int fd) {
  struct stat named {}, open {};
  return stat(path.c_str(), &named) == 0 && fstat(fd, &open) == 0 && named.st_dev == open.st_dev &&
         named.st_ino == open.st_ino;
}

}  // namespace

bool TakePidFile(const std::string& path, Plovo::UniqueFd& held) {
  for (int attempt = 0; attempt < 3; ++attempt) {
    Plovo::UniqueFd fd(open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644));
    if (fd.get() < 0) {
      PLOVO_LOG(LOG_ERR, "cannot open %s: %s", path.c_str(), std::strerror(errno));
      return false;
    }
    if (flock(fd.get(), LOCK_EX | LOCK_NB) != 0) {
      PLOVO_LOG(LOG_ERR, "another plovod runs (%s is locked)", path.c_str());
      return false;
    }
    // Removed by the daemon that held it as it went: take the new one.
    if (!StillNamed(path, fd.get())) continue;
    const std::string pid = std::to_string(getpid()) + "\n";
    if (ftruncate(fd.get(), 0) != 0 ||
        write(fd.get(), pid.data(), pid.size()) != static_cast<ssize_t>(pid.size())) {
      PLOVO_LOG(LOG_ERR, "cannot write %s: %s", path.c_str(), std::strerror(errno));
      return false;
    }
    held = std::move(fd);
    return true;
  }
  PLOVO_LOG(LOG_ERR, "%s keeps changing", path.c_str());
  return false;
}

void ReleasePidFile(const std::string& path, Plovo::UniqueFd& held) {
  if (held.get() >= 0 && StillNamed(path, held.get())) unlink(path.c_str());
  held.reset();
}

void Daemonize(int* ready) {
  // Whatever its starter left open (a web server's sockets and pipes)
  // would stay held for as long as the daemon runs.
  close_range(STDERR_FILENO + 1, ~0U, 0);
  int report[2];
  if (pipe2(report, O_CLOEXEC) != 0) {
    std::perror("plovod: pipe");
    std::exit(1);
  }
  const pid_t child = fork();
  if (child < 0) {
    std::perror("plovod: fork");
    std::exit(1);
  }
  if (child > 0) {
    close(report[1]);
    char byte = 0;
    ssize_t n;
    do n = read(report[0], &byte, 1);
    while (n < 0 && errno == EINTR);
    std::_Exit(n == 1 ? 0 : 1);
  }
  close(report[0]);
  setsid();
  // Nobody reads the terminal of a background process, and an inherited
  // pipe would keep whoever started it waiting for the end of its output.
  const int null = open("/dev/null", O_RDWR);
  if (null >= 0) {
    dup2(null, STDIN_FILENO);
    dup2(null, STDOUT_FILENO);
    dup2(null, STDERR_FILENO);
    if (null > STDERR_FILENO) close(null);
  }
  *ready = report[1];
}

void ReportReady(int ready) {
  if (ready < 0) return;
  const char byte = 1;
  if (write(ready, &byte, 1) != 1) std::fprintf(stderr, "plovod: cannot report readiness\n");
  close(ready);
}

}  // namespace plovod
