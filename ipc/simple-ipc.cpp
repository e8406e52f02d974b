#include "ipc/simple-ipc.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "common/error-text.h"
#include "common/log.h"
#include "common/unique-fd.h"
#include "ipc/stream.h"

namespace {

constexpr int kBacklog = 8;

void LogSysError(const char* call) {
  PLOVO_LIB_ERR("%s: %s (%d)", call, Plovo::ErrorText(errno).c_str(), errno);
}

sockaddr_in Loopback(int port) {
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  addr.sin_port = htons(static_cast<uint16_t>(port));
  return addr;
}

// A listening loopback TCP socket: bindTo binds it and returns the port
// bound, or -1. Returns the descriptor or -1.
template <typename BindTo>
int ListenLoopback(BindTo bindTo) {
  Plovo::UniqueFd fd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, IPPROTO_TCP));
  if (!fd) {
    LogSysError("socket");
    return -1;
  }
  int port = bindTo(fd.get());
  if (port < 0) return -1;
  if (listen(fd.get(), kBacklog) != 0) {
    LogSysError("listen");
    return -1;
  }
  PLOVO_LIB_INFO("listening on port %d", port);
  return fd.release();
}

}  // namespace

// ---- IPCSender ---------------------------------------------------------------

int IPCSender::connect(const std::string& path) { return m_channel.Open(path.c_str()) == 0 ? 0 : -1; }

int IPCSender::connect(int port) { return m_channel.Open("127.0.0.1", port) == 0 ? 0 : -1; }

int IPCSender::assign(int fd) { return m_channel.Open(fd, true) == 0 ? 0 : -1; }

int IPCSender::send(const PObject& request) {
  PStream stream;
  return stream.Send(m_channel, request) == 0 ? 0 : -1;
}

int IPCSender::send(const PObject& request, bool wantReply, PObject& reply) {
  int ret = send(request);
  if (ret == 0 && wantReply) return recv(reply);
  return ret;
}

int IPCSender::recv(PObject& reply) {
  PStream stream;
  return stream.Recv(m_channel, reply) == 0 ? 0 : -1;
}

// ---- IPCListener -------------------------------------------------------------

int IPCListener::prepare(const std::string& path) {
  close();
  int fd = OpenDomainSocket(path);
  if (fd < 0) return -1;
  m_fd = fd;
  m_path = path;
  return 0;
}

int IPCListener::prepare(int port) {
  close();
  int bound = -1;
  int fd = ListenLoopback([&](int s) {
    bound = do_bind(s, port);
    if (bound < 0) PLOVO_LIB_ERR("find available port failed.");
    return bound;
  });
  if (fd < 0) return -1;
  m_fd = fd;
  return bound;
}

int IPCListener::do_bind(int fd, int firstPort) {
  for (int port = firstPort;; ++port) {
    PLOVO_LIB_INFO("Try to bind port: %d", port);
    if (port > 65535) {
      PLOVO_LIB_ERR("Port number exceeds 65536");
      return -1;
    }
    sockaddr_in addr = Loopback(port);
    if (bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0) {
      // Names the first port asked for, not the one bound; the line that
      // follows ("listening on port") names the bound one.
      PLOVO_LIB_INFO("Bind port %d success", firstPort);
      return port;
    }
    LogSysError("bind");
    PLOVO_LIB_INFO("Bind port %d failed, try next one", port);
  }
}

bool IPCListener::isReady() {
  if (m_fd < 0) return false;
  // poll(), not select(): the server may hold descriptors past FD_SETSIZE.
  pollfd p{m_fd, POLLIN, 0};
  int timeoutMs = static_cast<int>(m_timeout.tv_sec * 1000 + m_timeout.tv_usec / 1000);
  int n;
  do {
    n = poll(&p, 1, timeoutMs);
  } while (n < 0 && errno == EINTR);
  return n > 0 && (p.revents & POLLIN) != 0;
}

int IPCListener::accept() {
  if (m_fd < 0) return m_fd;
  int fd;
  do {
    fd = accept4(m_fd, nullptr, nullptr, SOCK_CLOEXEC);
  } while (fd < 0 && errno == EINTR);
  if (fd < 0) LogSysError("accept");
  return fd;
}

void IPCListener::close() {
  if (m_fd >= 0) {
    if (m_path.empty()) {
      CloseSocket(m_fd);
    } else {
      CloseDomainSocket(m_fd);
    }
  }
  m_fd = -1;
  m_path.clear();
}

int IPCListener::OpenSocket(int port) {
  if (port < 1) return -1;
  return ListenLoopback([port](int s) {
    sockaddr_in addr = Loopback(port);
    if (bind(s, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
      LogSysError("bind");
      return -1;
    }
    return port;
  });
}

int IPCListener::OpenDomainSocket(const std::string& path) {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  if (path.size() >= sizeof(addr.sun_path)) {
    // A cut path would bind somewhere else than the clients look.
    PLOVO_LIB_ERR("bind: %s (%d)", Plovo::ErrorText(ENAMETOOLONG).c_str(), ENAMETOOLONG);
    return -1;
  }
  memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  Plovo::UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!fd) {
    PLOVO_LIB_ERR("socket: %s (%d)", Plovo::ErrorText(errno).c_str(), errno);
    return -1;
  }
  unlink(path.c_str());
  int on = 1;
  setsockopt(fd.get(), SOL_SOCKET, SO_REUSEADDR, &on, sizeof(on));
  if (bind(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
    PLOVO_LIB_ERR("bind: %s (%d)", Plovo::ErrorText(errno).c_str(), errno);
    return -1;
  }
  if (listen(fd.get(), kBacklog) != 0) {
    PLOVO_LIB_ERR("listen: %s (%d)", Plovo::ErrorText(errno).c_str(), errno);
    return -1;
  }
  PLOVO_LIB_INFO("listening on domain socket '%s'", path.c_str());
  return fd.release();
}

void IPCListener::CloseSocket(int fd) {
  if (fd >= 0) ::close(fd);
}

void IPCListener::CloseDomainSocket(int fd) {
  if (fd < 0) return;
  sockaddr_un addr{};
  socklen_t length = sizeof(addr);
  if (getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &length) != 0) {
    PLOVO_LIB_ERR("getsockname: %s (%d).", Plovo::ErrorText(errno).c_str(), errno);
  } else if (addr.sun_path[0] != '\0') {
    unlink(addr.sun_path);
  }
  ::close(fd);
}
