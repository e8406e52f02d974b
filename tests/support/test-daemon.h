// A stand-in for the copy daemon: a CommandServer on the sandbox's daemon
// socket (or any path) that records every request it receives and answers
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

struct DaemonAnswer {
  enum class Kind {
    Map,         // send map as one message
    Raw,         // send these bytes as they are, then close
    None,        // send nothing; keep the connection until the client closes it
    CloseEarly,  // close the connection without reading the request
  };
  Kind kind = Kind::Map;
  PObject map;
  std::string raw;
  int delayMs = 0;  // wait this long after reading the request

  static DaemonAnswer Reply(const PObject& map);
  static DaemonAnswer Ok();  // {"ack": "ok"}
  static DaemonAnswer Bytes(const std::string& raw);
  static DaemonAnswer Nothing();
  static DaemonAnswer Close();
  DaemonAnswer& After(int ms) {
    delayMs = ms;
    return *this;
  }
};

class TestDaemon {
 public:
  // Starts listening at once; an empty path means the sandbox's daemon
  // socket. Fails the current test when the socket cannot be opened.
  explicit TestDaemon(const std::string& socketPath = "");
  TestDaemon(const TestDaemon&) = delete;
  TestDaemon& operator=(const TestDaemon&) = delete;

  void Script(std::vector<DaemonAnswer> answers);
  void Answer(const DaemonAnswer& answer) { Script({answer}); }

  // Every request received so far, in order.
  std::vector<PObject> Requests() const;
  // The last request received (null when none).
  PObject LastRequest() const;
  // Connections accepted so far, whatever happened on them.
  int Connections() const { return connections_.load(); }
  const std::string& SocketPath() const { return path_; }

 private:
  void Serve(CommandServer::Connection& connection);
  DaemonAnswer NextAnswer();

  std::string path_;
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
