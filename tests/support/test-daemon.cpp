#include "test-daemon.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <thread>

#include "common/paths.h"

namespace plovo_test {

DaemonAnswer DaemonAnswer::Reply(const PObject& map) { return {Kind::Map, map, "", 0}; }

DaemonAnswer DaemonAnswer::Ok() {
  PObject ok;
  ok["ack"] = "ok";
  return Reply(ok);
}

DaemonAnswer DaemonAnswer::Bytes(const std::string& raw) { return {Kind::Raw, PObject(), raw, 0}; }

DaemonAnswer DaemonAnswer::Nothing() { return {Kind::None, PObject(), "", 0}; }

DaemonAnswer DaemonAnswer::Close() { return {Kind::CloseEarly, PObject(), "", 0}; }

TestDaemon::TestDaemon(const std::string& socketPath)
    : path_(socketPath.empty() ? Plovo::Path::DaemonSocket() : socketPath),
      server_([this](CommandServer::Connection& connection) { Serve(connection); }) {
  if (server_.Start(path_) != 0) ADD_FAILURE() << "test daemon cannot listen at " << path_;
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

void TestDaemon::Serve(CommandServer::Connection& connection) {
  ++connections_;
  DaemonAnswer answer = NextAnswer();
  if (answer.kind == DaemonAnswer::Kind::CloseEarly) return;
  PObject request;
  if (connection.Recv(request) != 0) return;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    requests_.push_back(request);
  }
  if (answer.delayMs > 0) std::this_thread::sleep_for(std::chrono::milliseconds(answer.delayMs));
  const int fd = connection.fd();
  switch (answer.kind) {
    case DaemonAnswer::Kind::Map:
      connection.Send(answer.map);
      break;
    case DaemonAnswer::Kind::Raw:
      // Written past the channel so that no framing is added.
      if (write(fd, answer.raw.data(), answer.raw.size()) != static_cast<ssize_t>(answer.raw.size())) {
        ADD_FAILURE() << "test daemon could not write its raw answer";
      }
      break;
    case DaemonAnswer::Kind::None: {
      // Until the client hangs up; stopping the server shuts the socket
      // down, which ends the wait too.
      char byte;
      pollfd p{fd, POLLIN, 0};
      while (poll(&p, 1, -1) > 0 && recv(fd, &byte, 1, 0) > 0) {
      }
      break;
    }
    case DaemonAnswer::Kind::CloseEarly:
      break;
  }
}

}  // namespace plovo_test
