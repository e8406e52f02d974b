// The local endpoints of the daemon protocol.
//
// IPCSender is the client end: it opens a channel to a Unix domain socket
// or a loopback TCP port (or adopts an accepted descriptor) and sends and
// receives whole PObject messages. IPCListener is the server end: the
// listening socket, a readiness wait and accept. Both own what they open
// and close it in close() and their destructors.
//
// Results: 0 or -1 unless a function says otherwise; the channel and stream
// layers log the details. One object is used by one thread at a time.
#ifndef PLOVO_IPC_SIMPLE_IPC_H
#define PLOVO_IPC_SIMPLE_IPC_H

#include <sys/time.h>

#include <string>

#include "ipc/channel.h"
#include "ipc/pobject.h"

class IPCSender {
 public:
  static constexpr unsigned long kCapacity = 81920;

  IPCSender() : m_channel(kCapacity) {}
  virtual ~IPCSender() { close(); }
  IPCSender(const IPCSender&) = delete;
  IPCSender& operator=(const IPCSender&) = delete;

  int connect(const std::string& path);  // Unix domain socket
  int connect(int port);                  // 127.0.0.1:port
  // Adopts an accepted descriptor (1-second linger, non-blocking).
  int assign(int fd);
  // Sends request; when that worked and wantReply is set, receives the
  // answer into reply and returns the receive's result.
  virtual int send(const PObject& request, bool wantReply, PObject& reply);
  virtual int send(const PObject& request);
  virtual int recv(PObject& reply);
  void close() { m_channel.Close(); }
  // For settings such as the time limit or TLS.
  Channel& channel() { return m_channel; }

 private:
  Channel m_channel;
};

class IPCListener {
 public:
  IPCListener() = default;
  ~IPCListener() { close(); }
  IPCListener(const IPCListener&) = delete;
  IPCListener& operator=(const IPCListener&) = delete;

  // Listens on a Unix domain socket at path (any file there is replaced).
  // 0 or -1.
  int prepare(const std::string& path);
  // Listens on 127.0.0.1 at the first free port from port on; returns that
  // port, or -1.
  int prepare(int port);
  // Waits up to the readiness timeout (3 s by default) for a connection.
  bool isReady();
  void setTimeout(timeval timeout) { m_timeout = timeout; }
  // The descriptor of one accepted connection, for IPCSender::assign; the
  // caller owns it. Negative when there is no socket or accept fails.
  int accept();
  // Closes the socket, removing the domain socket's file.
  void close();

  static int OpenSocket(int port);
  static int OpenDomainSocket(const std::string& path);
  static void CloseSocket(int fd);
  // Removes the file the socket is bound to, then closes it.
  static void CloseDomainSocket(int fd);

 private:
  // Binds fd to 127.0.0.1 at the first free port from firstPort on.
  int do_bind(int fd, int firstPort);

  timeval m_timeout{3, 0};
  int m_fd = -1;
  std::string m_path;
};

#endif
