// One small command and its small answer over a fresh connection to the
// daemon socket: DaemonIPC::SendCommand against a listener thread built from
// IPCListener and IPCSender, and the same bytes sent by a raw connect, send,
// receive, close loop to a raw accept, receive, send, close thread.
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>
#include <thread>

#include "bench-support.h"
#include "common/paths.h"
#include "ipc/daemon-ipc.h"
#include "ipc/pobject.h"
#include "ipc/simple-ipc.h"

namespace {

// The wire bytes of {"action": "run_task", "task_id": 7} and {"ack": "ok"},
// so that the raw loop moves what DaemonIPC moves.
const char kRequestBytes[] =
    "\x42"
    "\x10\x00\x06" "action" "\x10\x00\x08" "run_task"
    "\x10\x00\x07" "task_id" "\x01\x01\x07"
    "\x40";
const char kReplyBytes[] =
    "\x42"
    "\x10\x00\x03" "ack" "\x10\x00\x02" "ok"
    "\x40";
constexpr size_t kRequestSize = sizeof(kRequestBytes) - 1;
constexpr size_t kReplySize = sizeof(kReplyBytes) - 1;

PObject Request() {
  PObject request;
  request["action"] = "run_task";
  request["task_id"] = 7;
  return request;
}

sockaddr_un SocketAddress(const std::string& path) {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, path.c_str(), sizeof(addr.sun_path) - 1);
  return addr;
}

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

// A server thread on the daemon socket. Serve handles one accepted
// connection and closes it. Stop wakes the blocked accept with a
// connection of its own.
class Server {
 public:
  virtual ~Server() = default;

  void Stop() {
    if (!thread_.joinable()) return;
    stop_ = true;
    int fd = ConnectTo(path_);
    if (fd >= 0) close(fd);
    thread_.join();
  }

 protected:
  template <typename Accept>
  void Run(Accept accept) {
    path_ = Plovo::Path::DaemonSocket();
    thread_ = std::thread([this, accept] {
      for (;;) {
        int fd = accept();
        if (stop_) {
          if (fd >= 0) close(fd);
          return;
        }
        if (fd >= 0) Serve(fd);
      }
    });
  }
  virtual void Serve(int fd) = 0;

  std::string path_;
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

// The daemon's side as the library's own endpoints make it.
class PlovoServer : public Server {
 public:
  ~PlovoServer() override { Stop(); }
  bool Start() {
    if (listener_.prepare(Plovo::Path::DaemonSocket()) != 0) return false;
    Run([this] { return listener_.accept(); });
    return true;
  }

 private:
  void Serve(int fd) override {
    IPCSender peer;
    if (peer.assign(fd) != 0) {
      close(fd);
      return;
    }
    PObject request;
    if (peer.recv(request) != 0) return;
    PObject reply;
    if (request["action"].asString() == "run_task" && request["task_id"].asUInt64() == 7) {
      reply["ack"] = "ok";
    } else {
      reply["error"] = "unexpected request";
    }
    peer.send(reply);
  }

  IPCListener listener_;
};

// The same exchange with nothing but system calls.
class RawServer : public Server {
 public:
  ~RawServer() override {
    Stop();
    if (fd_ >= 0) close(fd_);
  }
  bool Start() {
    std::string path = Plovo::Path::DaemonSocket();
    unlink(path.c_str());
    fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un addr = SocketAddress(path);
    if (fd_ < 0 || bind(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0 || listen(fd_, 8) != 0) {
      return false;
    }
    Run([this] { return accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC); });
    return true;
  }

 private:
  void Serve(int fd) override {
    char request[kRequestSize];
    // A wrong request gets no answer, which fails the client.
    if (RecvAll(fd, request, kRequestSize) && std::memcmp(request, kRequestBytes, kRequestSize) == 0) {
      plovo_bench::SendAll(fd, kReplyBytes, kReplySize);
    }
    close(fd);
  }

  int fd_ = -1;
};

void BM_DaemonIPC(benchmark::State& state) {
  PlovoServer server;
  if (!server.Start()) {
    state.SkipWithError("cannot listen on the daemon socket");
    return;
  }
  const PObject request = Request();
  for (auto _ : state) {
    DaemonIPC ipc;
    PObject response;
    if (ipc.SendCommand(request, response) != 0) {
      state.SkipWithError("SendCommand failed");
      break;
    }
  }
}

void BM_RawRoundTrip(benchmark::State& state) {
  RawServer server;
  if (!server.Start()) {
    state.SkipWithError("cannot listen on the daemon socket");
    return;
  }
  const std::string path = Plovo::Path::DaemonSocket();
  for (auto _ : state) {
    int fd = ConnectTo(path);
    char reply[kReplySize];
    bool ok = fd >= 0 && plovo_bench::SendAll(fd, kRequestBytes, kRequestSize) && RecvAll(fd, reply, kReplySize) &&
              std::memcmp(reply, kReplyBytes, kReplySize) == 0;
    if (fd >= 0) close(fd);
    if (!ok) {
      state.SkipWithError("raw round trip failed");
      break;
    }
  }
}

void Register(const char* name, void (*fn)(benchmark::State&)) {
  benchmark::RegisterBenchmark(name, fn)
      ->Repetitions(9)
      ->ReportAggregatesOnly(true)
      ->UseRealTime()
      ->Unit(benchmark::kMicrosecond);
}

}  // namespace

int main(int argc, char** argv) {
  plovo_bench::UseServerLogMask();
  plovo_bench::Sandbox sandbox;
  Register("raw_round_trip", BM_RawRoundTrip);
  Register("daemon_ipc_send_command", BM_DaemonIPC);
  plovo_bench::SummaryReporter reporter;
  plovo_bench::RunBenchmarks(argc, argv, reporter);

  auto raw = reporter.MedianSeconds("raw_round_trip");
  auto subject = reporter.MedianSeconds("daemon_ipc_send_command");
  if (!raw || !subject) {
    std::printf("summary daemon-ipc: incomplete, no ratio\n");
    return 1;
  }
  double ratio = *subject / *raw;
  std::printf("summary daemon-ipc: SendCommand median %.1f us, raw round trip median %.1f us, ratio %.2f "
              "(target <= 1.5: %s)\n",
              *subject * 1e6, *raw * 1e6, ratio, plovo_bench::Verdict(ratio <= 1.5));
  return 0;
}
