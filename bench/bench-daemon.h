// The daemon's side of a command exchange, for the benchmarks that send
// commands: server threads on the sandbox's daemon socket, and the raw
// client round trip they are measured against.
//
// Two servers answer one command per connection, both CommandServers on
// the sandbox's daemon socket, so that they accept alike. RawServer's
// connections are nothing but system calls (receive the expected bytes,
// send the answer's bytes); ListenerServer answers as the library's daemon
// side does (a decoded request and an encoded answer). Each checks what it
// received, so that a benchmark measuring a wrong request fails instead of
// reporting a figure.
#ifndef PLOVO_BENCH_BENCH_DAEMON_H
#define PLOVO_BENCH_BENCH_DAEMON_H

#include <cstddef>
#include <string>

#include "ipc/command-server.h"
#include "ipc/pobject.h"

namespace plovo_bench {

// The bytes of a string literal, embedded zero bytes included, for the
// wire form of a message written out by hand.
template <size_t N>
std::string WireBytes(const char (&literal)[N]) {
  return std::string(literal, N - 1);
}

// A connected stream socket to the Unix domain socket at path; -1 on
// failure.
int ConnectTo(const std::string& path);

// Receives exactly n bytes from a blocking socket; false when the peer
// closes first or on an error.
bool RecvAll(int fd, char* data, size_t n);

// The largest request or answer the raw loop moves; the bytes sit on the
// stack, as a raw client's would.
constexpr size_t kRawMessageLimit = 256;

// One raw client exchange: connect to path, send request, receive
// reply.size() bytes, compare them with reply, close. False on any failure
// or a different answer.
bool RawRoundTrip(const std::string& path, const std::string& request, const std::string& reply);

// Whether two values are of the same kinds with the same contents, maps
// key by key and arrays element by element.
bool SameValue(const PObject& a, const PObject& b);

// Answers the bytes reply to a connection that sends exactly the bytes
// request; a wrong request gets no answer, which fails the client.
class RawServer {
 public:
  RawServer(std::string request, std::string reply);
  // Listens on the daemon socket and starts serving.
  bool Start();

 private:
  void Serve(CommandServer::Connection& connection);

  std::string request_;
  std::string reply_;
  CommandServer server_;  // last: stops before what it serves with goes
};

// Answers reply to a request equal to expected (SameValue), and
// {"error": "unexpected request"} to any other, which makes
// DaemonIPC::SendCommand fail.
class ListenerServer {
 public:
  ListenerServer(PObject expected, PObject reply);
  // Listens on the daemon socket and starts serving.
  bool Start();

 private:
  PObject expected_;
  PObject reply_;
  PObject refusal_;
  CommandServer server_;  // last: stops before what it serves with goes
};

// The daemon's answer to a command that succeeded: {"ack": "ok"}.
PObject AckReply();

}  // namespace plovo_bench

#endif
