// DaemonIPC: one command to the copy daemon and its answer, over one fresh
// connection to the daemon's socket (PLOVO_ROOT/tmp/plovo-socket in a
// sandbox).
//
// SendCommand returns 0 when the request was sent and either needs no
// answer (its "need_ack" member is false) or was answered with "ack": "ok"
// and no "error" member; -1 otherwise, after one error line naming the
// step. An answer with "error" is left in response so that the caller can
// read the daemon's error fields. Each call uses its own connection, so
// concurrent requests share nothing here.
#ifndef PLOVO_IPC_DAEMON_IPC_H
#define PLOVO_IPC_DAEMON_IPC_H

#include <string>

#include "ipc/pobject.h"

class DaemonIPC {
 public:
  DaemonIPC();
  int SendCommand(const PObject& request, PObject& response);
  const std::string& socketPath() const { return m_socket_path; }

 private:
  std::string m_socket_path;
};

#endif
