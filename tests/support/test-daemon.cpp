#include "test-daemon.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include "common/paths.h"

namespace plovo_test {

DaemonAnswer DaemonAnswer::Ok() {
  PObject ok;
  ok["ack"] = "ok";
  return Reply(ok);
}

TestDaemon::TestDaemon() : server_([this](CommandServer::Connection& connection) { Serve(connection); }) {
  if (server_.Start(Plovo::Path::DaemonSocket()) != 0) ADD_FAILURE() << "test daemon cannot listen";
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
  PObject request;
  if (connection.Recv(request) != 0) return;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    requests_.push_back(request);
  }
  if (!answer.isRaw) {
    connection.Send(answer.map);
  } else if (write(connection.fd(), answer.raw.data(), answer.raw.size()) != static_cast<ssize_t>(answer.raw.size())) {
    ADD_FAILURE() << "test daemon could not write its raw answer";
  }
}

}  // namespace plovo_test
