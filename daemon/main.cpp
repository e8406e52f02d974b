// plovod, the package's copy daemon.
//
//   plovod [--foreground]
//
// Started without arguments, as the service start runs the package's
// daemon program, it puts itself in the background; its command returns 0
// once it serves, 1 when it could not start (a second plovod, no
// repository, a socket it cannot bind). --foreground keeps it in the
// terminal with its log on stderr.
//
// It holds "/var/run/plovod.pid" under an exclusive lock for its life,
// serves "/tmp/plovo-socket" and writes the running state (4) when it
// serves. A "stop" command, SIGTERM or SIGINT end it: its runs are
// cancelled and waited for, the task database is closed, the socket and
// the pid file are removed, the state becomes stopped (6), and it exits 0.
#include <signal.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <fstream>
#include <mutex>

#include "common/file-op.h"
#include "common/log.h"
#include "common/paths.h"
#include "daemon/daemon.h"
#include "daemon/process.h"
#include "ipc/command-server.h"
#include "service/global-setting.h"
#include "service/service-ctrl.h"

namespace {

// Where the log goes, from the first line on (a refused start says why):
// stderr in the foreground; in the background the
// system log, or, in a sandbox, "<root>/var/log/plovod.log", so that a
// development daemon's lines are found beside its files.
void ChooseLogSink(bool foreground) {
  if (foreground) {
    Plovo::SetLogSink([](int priority, const std::string& line) {
      if (LOG_PRI(priority) <= LOG_INFO) std::fprintf(stderr, "plovod: %s\n", line.c_str());
    });
    return;
  }
  if (Plovo::Path::Root().empty()) return;  // the system log, the library's default
  static std::mutex mutex;
  static std::ofstream file;
  FSMKDirP(Plovo::Path::Rooted("/var/log"), -1, -1);
  file.open(Plovo::Path::Rooted("/var/log/plovod.log"), std::ios::app);
  Plovo::SetLogSink([](int priority, const std::string& line) {
    if (LOG_PRI(priority) > LOG_INFO) return;
    std::lock_guard<std::mutex> lock(mutex);
    file << line << std::endl;
  });
}

}  // namespace

int main(int argc, char** argv) {
  const bool foreground = argc == 2 && std::strcmp(argv[1], "--foreground") == 0;
  if (argc != 1 && !foreground) {
    std::fprintf(stderr, "usage: plovod [--foreground]\n");
    return 2;
  }
  int ready = -1;
  if (!foreground) plovod::Daemonize(&ready);
  ChooseLogSink(foreground);

  // The end signals are taken by sigwait below; blocked before any thread
  // starts, so that no other thread is interrupted by them.
  sigset_t ends;
  sigemptyset(&ends);
  sigaddset(&ends, SIGINT);
  sigaddset(&ends, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &ends, nullptr);
  signal(SIGPIPE, SIG_IGN);  // a client that hangs up early must not end us

  // Before anything else is touched: a second daemon must leave the
  // first one's socket and state alone.
  const std::string pidFile = Plovo::Path::DaemonPidFile();
  Plovo::UniqueFd pidLock;
  if (!plovod::TakePidFile(pidFile, pidLock)) return 1;
  auto fail = [&](const char* why) {
    PLOVO_LOG(LOG_ERR, "%s", why);
    plovod::ReleasePidFile(pidFile, pidLock);
    return 1;
  };

  const std::string volume = Plovo::GlobalSetting::GetRepoVolumePath();
  if (volume.empty()) return fail("no repository volume is recorded");
  const pid_t self = getpid();
  plovod::Daemon daemon(volume + "/@Plovo", Plovo::GlobalSetting::GetBeep(), [self] { kill(self, SIGTERM); });
  if (daemon.Open() != 0) return fail("cannot open the task database");
  CommandServer server(daemon.Commands(), [&daemon](const PObject& request) { return daemon.Handle(request); },
                       [](const std::string& problem) { PLOVO_LOG(LOG_WARNING, "%s", problem.c_str()); });
  if (server.Start(Plovo::Path::DaemonSocket()) != 0) return fail("cannot listen on the daemon socket");
  ServiceStatus running;
  running.state = PLOVO_SERVICE_STATUS_RUNNING;
  if (SetServiceStatus(running) != 0) {
    server.Stop();
    return fail("cannot write the running state");
  }
  PLOVO_LOG(LOG_INFO, "serving %s", Plovo::Path::DaemonSocket().c_str());
  plovod::ReportReady(ready);

  int received = 0;
  sigwait(&ends, &received);
  PLOVO_LOG(LOG_INFO, "stopping");
  server.Stop();
  daemon.Shutdown();
  // Also when nobody asked the service control to stop it, the state must
  // not go on saying that the daemon serves.
  ServiceStatus stopped;
  stopped.state = PLOVO_SERVICE_STATUS_STOP;
  if (SetServiceStatus(stopped) != 0) PLOVO_LOG(LOG_ERR, "cannot write the stopped state");
  plovod::ReleasePidFile(pidFile, pidLock);
  PLOVO_LOG(LOG_INFO, "stopped");
  return 0;
}
