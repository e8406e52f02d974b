// How plovod becomes the package's one background daemon: the pid file it
// holds for its whole life and the hand-over from the process that started
// it to the one that serves.
#ifndef PLOVO_DAEMON_PROCESS_H
#define PLOVO_DAEMON_PROCESS_H

#include <string>

#include "common/unique-fd.h"

namespace plovod {

// Takes the pid file at path under an exclusive flock and writes this
// process's id into it. The lock lasts as long as held stays open, which
// is how the service control and a second daemon tell that this one runs.
// False, with a line in the log, when another process holds the file or it
// cannot be written; the file is then left as it was.
bool TakePidFile(const std::string& path, Plovo::UniqueFd& held);

// Removes the pid file, if it is still the one held, and lets go of it.
void ReleasePidFile(const std::string& path, Plovo::UniqueFd& held);

// Puts the process in the background. The starting process waits here and
// exits 0 once the daemon reports that it serves (ReportReady), or 1 when
// the daemon ends first; only the daemon returns, with *ready the pipe to
// report on. It runs in its own session, with stdin, stdout and stderr on
// /dev/null and nothing else its starter left open.
void Daemonize(int* ready);

// Tells the starting process that the daemon serves, and closes ready.
// Nothing for -1 (a daemon started in the foreground).
void ReportReady(int ready);

}  // namespace plovod

#endif
