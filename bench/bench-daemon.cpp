#include "bench-daemon.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "bench-support.h"
#include "common/paths.h"

namespace plovo_bench {

int ConnectTo(const std::string& path) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, path.c_str(), sizeof(addr.sun_path) - 1);
  if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
    close(fd);
    return -1;
  }
  return fd;
}

bool RecvAll(int fd, char* data, size_t n) {
  while (n > 0) {
    ssize_t r = recv(fd, data, n, 0);
    if (r < 0 && errno == EINTR) continue;
    if (r <= 0) return false;
    data += r;
    n -= static_cast<size_t>(r);
  }
  return true;
}

bool RawRoundTrip(const std::string& path, const std::string& request, const std::string& reply) {
  char got[kRawMessageLimit];
  if (reply.size() > sizeof(got)) return false;
  int fd = ConnectTo(path);
  bool ok = fd >= 0 && SendAll(fd, request.data(), request.size()) && RecvAll(fd, got, reply.size()) &&
            std::memcmp(got, reply.data(), reply.size()) == 0;
  if (fd >= 0) close(fd);
  return ok;
}

bool SameValue(const PObject& a, const PObject& b) {
  if (a.isNull() || b.isNull()) return a.isNull() && b.isNull();
  if (a.isMap() && b.isMap()) {
    const PObject::map_type& x = a.asMap();
    const PObject::map_type& y = b.asMap();
    if (x.size() != y.size()) return false;
    for (auto i = x.begin(), j = y.begin(); i != x.end(); ++i, ++j) {
      if (i->first != j->first || !SameValue(i->second, j->second)) return false;
    }
    return true;
  }
  if (a.isArray() && b.isArray()) {
    const PObject::array_type& x = a.asArray();
    const PObject::array_type& y = b.asArray();
    if (x.size() != y.size()) return false;
    for (size_t i = 0; i < x.size(); ++i) {
      if (!SameValue(x[i], y[i])) return false;
    }
    return true;
  }
  if (a.isInteger() && b.isInteger()) return a.asUInt64() == b.asUInt64();
  if (a.isString() && b.isString()) return a.asStringRef() == b.asStringRef();
  // Binaries and buffers never travel in a command.
  return false;
}

RawServer::RawServer(std::string request, std::string reply)
    : request_(std::move(request)),
      reply_(std::move(reply)),
      server_([this](CommandServer::Connection& connection) { Serve(connection); }) {}

bool RawServer::Start() {
  return request_.size() <= kRawMessageLimit && server_.Start(Plovo::Path::DaemonSocket()) == 0;
}

void RawServer::Serve(CommandServer::Connection& connection) {
  char request[kRawMessageLimit];
  if (RecvAll(connection.fd(), request, request_.size()) &&
      std::memcmp(request, request_.data(), request_.size()) == 0) {
    SendAll(connection.fd(), reply_.data(), reply_.size());
  }
}

ListenerServer::ListenerServer(PObject expected, PObject reply)
    : expected_(std::move(expected)),
      reply_(std::move(reply)),
      // Through the connection hook, so that the answer is sent as it is
      // rather than copied per request: the figure is the module's cost.
      server_([this](CommandServer::Connection& connection) {
        PObject request;
        if (connection.Recv(request) == 0) connection.Send(SameValue(request, expected_) ? reply_ : refusal_);
      }) {
  refusal_["error"] = "unexpected request";
}

bool ListenerServer::Start() { return server_.Start(Plovo::Path::DaemonSocket()) == 0; }

PObject AckReply() {
  PObject reply;
  reply["ack"] = "ok";
  return reply;
}

}  // namespace plovo_bench
