#include "test-daemon.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>

#include "common/paths.h"
#include "ipc/simple-ipc.h"

namespace plovo_test {

DaemonAnswer DaemonAnswer::Reply(const PObject& map) {
  DaemonAnswer a;
  a.map = map;
  return a;
}

DaemonAnswer DaemonAnswer::Ok() {
  PObject ok;
  ok["ack"] = "ok";
  return Reply(ok);
}

DaemonAnswer DaemonAnswer::Bytes(const std::string& raw) {
  DaemonAnswer a;
  a.kind = Kind::Raw;
  a.raw = raw;
  return a;
}

DaemonAnswer DaemonAnswer::Nothing() {
  DaemonAnswer a;
  a.kind = Kind::None;
  return a;
}

DaemonAnswer DaemonAnswer::Close() {
  DaemonAnswer a;
  a.kind = Kind::CloseEarly;
  return a;
}

TestDaemon::TestDaemon(const std::string& socketPath)
    : path_(socketPath.empty() ? Plovo::Path::DaemonSocket() : socketPath) {
  int fd = IPCListener::OpenDomainSocket(path_);
  if (fd < 0) {
    ADD_FAILURE() << "test daemon cannot listen at " << path_;
    return;
  }
  thread_ = std::thread(&TestDaemon::Serve, this, fd);
}

TestDaemon::~TestDaemon() {
  stop_ = true;
  if (thread_.joinable()) thread_.join();
}

void TestDaemon::Script(std::vector<DaemonAnswer> answers) {
  std::lock_guard<std::mutex> lock(mutex_);
  script_ = std::move(answers);
  next_ = 0;
}

std::vector<PObject> TestDaemon::Requests() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return requests_;
}

PObject TestDaemon::LastRequest() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return requests_.empty() ? PObject() : requests_.back();
}

DaemonAnswer TestDaemon::NextAnswer() {
  std::lock_guard<std::mutex> lock(mutex_);
  if (script_.empty()) return DaemonAnswer::Ok();
  DaemonAnswer answer = script_[next_];
  if (next_ + 1 < script_.size()) ++next_;
  return answer;
}

// Polls in short rounds so that the destructor stops the thread promptly.
void TestDaemon::Serve(int listenFd) {
  while (!stop_) {
    pollfd p{listenFd, POLLIN, 0};
    if (poll(&p, 1, 50) <= 0) continue;
    int fd = accept4(listenFd, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) continue;
    ++connections_;
    Handle(fd);
  }
  IPCListener::CloseDomainSocket(listenFd);
}

void TestDaemon::Handle(int fd) {
  DaemonAnswer answer = NextAnswer();
  if (answer.kind == DaemonAnswer::Kind::CloseEarly) {
    close(fd);
    return;
  }
  IPCSender peer;  // owns fd from here on
  if (peer.assign(fd) != 0) {
    close(fd);
    return;
  }
  peer.channel().SetTimeout(5);
  PObject request;
  if (peer.recv(request) != 0) return;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    requests_.push_back(request);
  }
  if (answer.delayMs > 0) std::this_thread::sleep_for(std::chrono::milliseconds(answer.delayMs));
  switch (answer.kind) {
    case DaemonAnswer::Kind::Map:
      peer.send(answer.map);
      break;
    case DaemonAnswer::Kind::Raw:
      // Written past the channel so that no framing is added.
      if (write(fd, answer.raw.data(), answer.raw.size()) != static_cast<ssize_t>(answer.raw.size())) {
        ADD_FAILURE() << "test daemon could not write its raw answer";
      }
      break;
    case DaemonAnswer::Kind::None: {
      // Wait for the client to hang up (or the daemon to stop).
      char byte;
      while (!stop_) {
        pollfd p{fd, POLLIN, 0};
        if (poll(&p, 1, 50) > 0 && recv(fd, &byte, 1, MSG_DONTWAIT) <= 0) break;
      }
      break;
    }
    case DaemonAnswer::Kind::CloseEarly:
      break;
  }
}

}  // namespace plovo_test
