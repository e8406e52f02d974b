#include "daemon/process.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace plovod {

bool TakePidFile(const std::string& path, Plovo::UniqueFd& held) {
  Plovo::UniqueFd fd(open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644));
  if (fd.get() < 0) {
    std::fprintf(stderr, "plovod: cannot open %s: %s\n", path.c_str(), std::strerror(errno));
    return false;
  }
  if (flock(fd.get(), LOCK_EX | LOCK_NB) != 0) {
    std::fprintf(stderr, "plovod: another plovod runs (%s is locked)\n", path.c_str());
    return false;
  }
  const std::string pid = std::to_string(getpid()) + "\n";
  if (ftruncate(fd.get(), 0) != 0 ||
      write(fd.get(), pid.data(), pid.size()) != static_cast<ssize_t>(pid.size())) {
    std::fprintf(stderr, "plovod: cannot write %s: %s\n", path.c_str(), std::strerror(errno));
    return false;
  }
  held = std::move(fd);
  return true;
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
