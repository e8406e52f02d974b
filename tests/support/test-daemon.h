// A stand-in for the copy daemon: a CommandServer on the sandbox's daemon
// socket that records every request it receives and answers
// each from a script.
//
// The script is a list of answers used in order, one per connection; the
// last one repeats. Without a script every request is answered {"ack": "ok"}.
#ifndef PLOVO_TESTS_SUPPORT_TEST_DAEMON_H
#define PLOVO_TESTS_SUPPORT_TEST_DAEMON_H

#include <atomic>
#include <mutex>
#include <string>
#include <vector>

#include "ipc/command-server.h"
#include "ipc/pobject.h"

namespace plovo_test {

// One message, or raw bytes sent as they are (no framing added), then close.
struct DaemonAnswer {
  bool isRaw = false;
  PObject map;
  std::string raw;

  static DaemonAnswer Reply(const PObject& map) { return {false, map, ""}; }
  static DaemonAnswer Ok();  // {"ack": "ok"}
  static DaemonAnswer Bytes(const std::string& raw) { return {true, PObject(), raw}; }
};

class TestDaemon {
 public:
  // Starts listening at once; fails the current test when the socket
  // cannot be opened.
  TestDaemon();

  void Script(std::vector<DaemonAnswer> answers);
  void Answer(const DaemonAnswer& answer) { Script({answer}); }

  // Every request received so far, in order.
  std::vector<PObject> Requests() const;
  // The last request received (null when none).
  PObject LastRequest() const;
  // Connections accepted so far, whatever happened on them.
  int Connections() const { return connections_.load(); }

 private:
  void Serve(CommandServer::Connection& connection);
  DaemonAnswer NextAnswer();

  mutable std::mutex mutex_;
  std::vector<DaemonAnswer> script_;
  size_t next_ = 0;
  std::vector<PObject> requests_;
  std::atomic<int> connections_{0};
  // Last, so that it stops before what its connections use goes.
  CommandServer server_;
};

}  // namespace plovo_test

#endif
