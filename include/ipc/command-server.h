// CommandServer: the daemon's side of the command exchange. It listens on a
// Unix domain socket and serves it with kWorkers threads made once at
// Start: an idle worker waits for the next connection and serves it itself,
// so that a connection costs no thread start and no hand-over between
// threads, and a flood of clients waits in the listen queue instead of
// costing threads.
//
// A connection carries one request and one answer. The request's "action"
// picks its handler from the owner's table; an action the table lacks goes
// to the owner's unknown-action handler. The handler's answer is sent back
// unless the request holds "need_ack" with a false value (that client does
// not read) or the answer is null (the handler chose to send nothing).
// Failures to receive the request or send the answer go to the owner's
// report function, when there is one, as "unreadable request" and "the
// answer to <action> could not be sent"; the connection is then dropped.
//
// An owner that must serve a connection otherwise (answer bytes of its own,
// misbehave on purpose, stream) gives a connection hook instead of the
// table: it is called with each accepted connection and serves it whole.
//
// Results: Start returns 0 or -1 (the listener logs why). Ownership: the
// server owns the listening socket, every accepted connection and the
// threads; Stop and the destructor close and join them all and remove the
// socket file. An exception that escapes a handler or hook is logged and
// ends that connection only. Threads: handlers and hooks run on the worker
// threads, several at once, so what they share needs a lock; they must not
// call Stop. Start and Stop are called by the owner's thread.
#ifndef PLOVO_IPC_COMMAND_SERVER_H
#define PLOVO_IPC_COMMAND_SERVER_H

#include <atomic>
#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "common/unique-fd.h"
#include "ipc/pobject.h"
#include "ipc/simple-ipc.h"

class CommandServer {
 public:
  // Connections served at once.
  static constexpr int kWorkers = 8;
  // Seconds one connection's exchange may take in all, so that a client
  // that stalls gives its slot back.
  static constexpr unsigned int kTimeLimit = 5;

  // One accepted connection. The server closes it when the hook returns.
  class Connection {
   public:
    explicit Connection(int fd) : m_fd(fd), m_owned(fd) {}
    Connection(const Connection&) = delete;
    Connection& operator=(const Connection&) = delete;

    // Receive one message, send one; 0 or -1. The first use hands the
    // socket to a channel (non-blocking from then on, kTimeLimit).
    int Recv(PObject& message);
    int Send(const PObject& message);
    // The socket itself, for bytes written or read by hand. It blocks
    // until Recv or Send is first used.
    int fd() const { return m_fd; }

   private:
    bool Adopt();

    int m_fd;
    Plovo::UniqueFd m_owned;  // until the channel takes the socket over
    bool m_adopted = false;
    IPCSender m_sender;
  };

  // A request's answer; a null answer sends nothing.
  using Handler = std::function<PObject(const PObject& request)>;
  struct Command {
    std::string action;
    Handler handler;
  };
  using ConnectionHook = std::function<void(Connection& connection)>;
  using Report = std::function<void(const std::string& problem)>;

  // Answers each request from commands by its action, or with unknown
  // (which must be given).
  CommandServer(const std::vector<Command>& commands, Handler unknown, Report report = nullptr);
  // Serves each connection with hook.
  explicit CommandServer(ConnectionHook hook);
  ~CommandServer() { Stop(); }
  CommandServer(const CommandServer&) = delete;
  CommandServer& operator=(const CommandServer&) = delete;

  // Listens at path (a file there is replaced) and starts accepting. Once.
  int Start(const std::string& path);
  // Stops accepting, ends the open connections (their sockets are shut
  // down, so that a blocked read returns at once), joins every thread and
  // removes the socket file. Safe to call more than once.
  void Stop();

 private:
  void Exchange(Connection& connection);
  void Work();
  // The next connection, or -1 once the server stops.
  int NextConnection();

  std::map<std::string, Handler> m_commands;
  Handler m_unknown;
  Report m_report;
  ConnectionHook m_hook;

  IPCListener m_listener;
  std::vector<std::thread> m_workers;
  std::atomic<bool> m_stopping{false};
  std::mutex m_accepting;    // one idle worker at a time waits on the listener
  std::mutex m_mutex;
  std::set<int> m_serving;   // connections being served; guarded by m_mutex
};

#endif
