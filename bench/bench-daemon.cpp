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
namespace {

sockaddr_un SocketAddress(const std::string& path) {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, path.c_str(), sizeof(addr.sun_path) - 1);
  return addr;
}

}  // namespace

int ConnectTo(const std::string& path) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  sockaddr_un addr = SocketAddress(path);
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

void Server::Stop() {
  if (!thread_.joinable()) return;
  stop_ = true;
  int fd = ConnectTo(path_);
  if (fd >= 0) close(fd);
  thread_.join();
}

void Server::Run() {
  thread_ = std::thread([this] {
    for (;;) {
      int fd = Accept();
      if (stop_) {
        if (fd >= 0) close(fd);
        return;
      }
      if (fd >= 0) Serve(fd);
    }
  });
}

RawServer::RawServer(std::string request, std::string reply)
    : request_(std::move(request)), reply_(std::move(reply)) {}

RawServer::~RawServer() {
  Stop();
  if (fd_ >= 0) close(fd_);
}

bool RawServer::Start() {
  if (request_.size() > kRawMessageLimit) return false;
  path_ = Plovo::Path::DaemonSocket();
  unlink(path_.c_str());
  fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un addr = SocketAddress(path_);
  if (fd_ < 0 || bind(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0 || listen(fd_, 8) != 0) {
    return false;
  }
  Run();
  return true;
}

int RawServer::Accept() { return accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC); }

void RawServer::Serve(int fd) {
  char request[kRawMessageLimit];
  if (RecvAll(fd, request, request_.size()) && std::memcmp(request, request_.data(), request_.size()) == 0) {
    SendAll(fd, reply_.data(), reply_.size());
  }
  close(fd);
}

ListenerServer::ListenerServer(PObject expected, PObject reply)
    : expected_(std::move(expected)), reply_(std::move(reply)) {
  refusal_["error"] = "unexpected request";
}

ListenerServer::~ListenerServer() { Stop(); }

bool ListenerServer::Start() {
  path_ = Plovo::Path::DaemonSocket();
  if (listener_.prepare(path_) != 0) return false;
  Run();
  return true;
}

int ListenerServer::Accept() { return listener_.accept(); }

void ListenerServer::Serve(int fd) {
  IPCSender peer;
  if (peer.assign(fd) != 0) {
    close(fd);
    return;
  }
  PObject request;
  if (peer.recv(request) != 0) return;
  peer.send(SameValue(request, expected_) ? reply_ : refusal_);
}

PObject AckReply() {
  PObject reply;
  reply["ack"] = "ok";
  return reply;
}

}  // namespace plovo_bench
