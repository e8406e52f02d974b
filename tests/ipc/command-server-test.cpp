// CommandServer on the sandbox's daemon socket, driven by plain clients.
#include "ipc/command-server.h"

#include <gtest/gtest.h>
#include <sys/socket.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <future>
#include <mutex>
#include <stdexcept>
#include <string>
#include <vector>

#include "common/paths.h"
#include "sandbox.h"

namespace {

PObject Map(const char* key, const PObject& value) {
  PObject map;
  map[key] = value;
  return map;
}

class CommandServerTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    MakeDir("/tmp");
  }
  // The answer's text on a connection of its own, or "none" when the
  // server closes it without one.
  static std::string Ask(const PObject& request) {
    IPCSender client;
    client.channel().SetTimeout(2);
    PObject answer;
    if (client.connect(Plovo::Path::DaemonSocket()) != 0 || client.send(request) != 0) return "unsent";
    return client.recv(answer) == 0 ? answer.toString() : "none";
  }
};

TEST_F(CommandServerTest, AnswersByTheTableOrTheFallback) {
  std::atomic<int> calls{0};
  // A handler answering {key: action}, or nothing for no key.
  auto answer = [&](const char* key) {
    return [&calls, key](const PObject& request) {
      ++calls;
      return key ? Map(key, request["action"]) : PObject();
    };
  };
  std::vector<std::string> problems;
  auto broken = [](const PObject&) -> PObject { throw std::runtime_error("broken handler"); };
  CommandServer server({{"echo", answer("echo")}, {"quiet", answer(nullptr)}, {"broken", broken}}, answer("unknown"),
                       [&](const std::string& problem) { problems.push_back(problem); });
  ASSERT_EQ(server.Start(Plovo::Path::DaemonSocket()), 0);
  // A client that hangs up without a request; accepted before the ones below.
  IPCSender().connect(Plovo::Path::DaemonSocket());

  const struct {
    const char* action;
    int needAck;  // -1: not in the request
    const char* answer;
  } rows[] = {
      {"echo", -1, R"({"echo": "echo"})"}, {"echo", 1, R"({"echo": "echo"})"}, {"echo", 0, "none"},
      {"format", -1, R"({"unknown": "format"})"}, {"format", 0, "none"}, {"quiet", -1, "none"},
      {"broken", -1, "none"}, {"echo", -1, R"({"echo": "echo"})"},
  };
  for (const auto& row : rows) {
    PObject request = Map("action", row.action);
    if (row.needAck >= 0) request["need_ack"] = row.needAck;
    EXPECT_EQ(Ask(request), row.answer) << row.action << " " << row.needAck;
  }
  server.Stop();  // joins the connections, so what they left is read safely here
  // Answered or not, every request reached its handler; the hang-up is
  // reported.
  EXPECT_EQ(calls, 7);
  EXPECT_EQ(problems, std::vector<std::string>{"unreadable request"});
}

// One more client than the bound: each handler holds its connection until
// every client is in or a second has passed, so the bound shows as the
// most handlers ever running together.
TEST_F(CommandServerTest, ServesConnectionsTogetherUpToTheBound) {
  constexpr int kClients = CommandServer::kWorkers + 1;
  std::mutex mutex;
  std::condition_variable arrival;
  int arrived = 0, inside = 0, most = 0;
  CommandServer server({}, [&](const PObject& request) {
    std::unique_lock<std::mutex> lock(mutex);
    ++arrived;
    most = std::max(most, ++inside);
    arrival.notify_all();
    arrival.wait_for(lock, std::chrono::seconds(1), [&] { return arrived == kClients; });
    --inside;
    return Map("n", request["n"]);
  });
  ASSERT_EQ(server.Start(Plovo::Path::DaemonSocket()), 0);

  std::vector<std::future<std::string>> answers;
  for (int n = 0; n < kClients; ++n) {
    answers.push_back(std::async(std::launch::async, [n] { return Ask(Map("n", PObject(uint64_t(n)))); }));
  }
  for (int n = 0; n < kClients; ++n) EXPECT_EQ(answers[n].get(), "{\"n\": " + std::to_string(n) + "}");
  EXPECT_EQ(most, CommandServer::kWorkers);
}

TEST_F(CommandServerTest, StopEndsOpenConnectionsAndRemovesTheSocket) {
  std::promise<void> entered;
  CommandServer server([&](CommandServer::Connection& connection) {
    entered.set_value();
    char byte;
    recv(connection.fd(), &byte, 1, 0);  // until the client, or Stop, ends it
  });
  ASSERT_EQ(server.Start(Plovo::Path::DaemonSocket()), 0);
  IPCSender client;
  ASSERT_EQ(client.connect(Plovo::Path::DaemonSocket()), 0);
  ASSERT_EQ(entered.get_future().wait_for(std::chrono::seconds(10)), std::future_status::ready);

  auto stopped = std::async(std::launch::async, [&] { server.Stop(); });
  // A guard against a hang, not a measure: a Stop that waits for the client
  // waits for ever.
  EXPECT_EQ(stopped.wait_for(std::chrono::seconds(10)), std::future_status::ready);
  client.close();  // ends a hung Stop, so that the test ends either way
  stopped.get();
  EXPECT_FALSE(Exists("/tmp/plovo-socket"));
}

}  // namespace
