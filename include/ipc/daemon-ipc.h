// DaemonIPC: one command to the copy daemon and its answer, over one fresh
// connection to the daemon's socket (PLOVO_ROOT/tmp/plovo-socket in a
// sandbox).
//
// SendCommand returns 0 when the request was sent and either needs no
// answer (its "need_ack" member is false) or was answered with "ack": "ok"
// and no "error" member; -1 otherwise, after one error line naming the
// step. An answer with "error" is left in response so that the caller can
// read the daemon's error fields; an answer that could not be received
// whole leaves response empty, so that nothing of a broken answer is read
// as the daemon's word. Each call uses its own connection, so concurrent
// requests share nothing here.
//
// What a daemon can cost the caller is bounded: the whole exchange
// (connect, request, answer) ends within the time limit (kTimeLimit
// seconds unless set), an answer may hold at most PStream's size bound,
// and an answer never carries files (a binary value is refused and nothing
// is written).
#ifndef PLOVO_IPC_DAEMON_IPC_H
#define PLOVO_IPC_DAEMON_IPC_H

#include <cstddef>
#include <string>

#include "ipc/pobject.h"

class DaemonIPC {
 public:
  static constexpr unsigned int kTimeLimit = 30;
  // How much of a value's text one log line shows.
  static constexpr size_t kLogTextLimit = 4096;

  DaemonIPC();
  int SendCommand(const PObject& request, PObject& response);
  const std::string& socketPath() const { return m_socket_path; }
  // The limit of one whole exchange in seconds (0: none).
  void SetTimeLimit(unsigned int seconds) { m_time_limit = seconds; }

  // value's text for a log line: cut to kLogTextLimit bytes, with a note of
  // the whole text's size when it was cut.
  static std::string LogText(const PObject& value);

 private:
  std::string m_socket_path;
  unsigned int m_time_limit = kTimeLimit;
};

#endif
