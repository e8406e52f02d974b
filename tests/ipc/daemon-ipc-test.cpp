#include "ipc/daemon-ipc.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <syslog.h>
#include <unistd.h>

#include <memory>
#include <thread>

#include "common/paths.h"
#include "ipc/simple-ipc.h"
#include "log-capture.h"
#include "sandbox.h"
#include "test-daemon.h"

namespace {

using plovo_test::DaemonAnswer;

PObject Command(const char* action) {
  PObject c;
  c["action"] = action;
  return c;
}

class DaemonIPCTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    MakeDir("/tmp");
    daemon_ = std::make_unique<plovo_test::TestDaemon>();
  }
  void TearDown() override {
    daemon_.reset();
    SandboxTest::TearDown();
  }
  std::unique_ptr<plovo_test::TestDaemon> daemon_;
};

TEST_F(DaemonIPCTest, UsesTheSandboxSocketAndOneConnectionPerCommand) {
  EXPECT_EQ(DaemonIPC().socketPath(), Root() + "/tmp/plovo-socket");
  PObject first, second;
  EXPECT_EQ(DaemonIPC().SendCommand(Command("list_task"), first), 0);
  EXPECT_EQ(DaemonIPC().SendCommand(Command("get_task"), second), 0);
  auto requests = daemon_->Requests();
  ASSERT_EQ(requests.size(), 2u);
  EXPECT_EQ(requests[0].toString(), "{\"action\": \"list_task\"}");
  EXPECT_EQ(requests[1]["action"].asString(), "get_task");
  EXPECT_EQ(daemon_->Connections(), 2);
  EXPECT_EQ(first["ack"].asString(), "ok");
}

TEST_F(DaemonIPCTest, NoAckNeededReturnsRightAfterTheSend) {
  daemon_->Answer(DaemonAnswer::Nothing());
  PObject request = Command("stop");
  request["need_ack"] = 0;
  PObject response;
  EXPECT_EQ(DaemonIPC().SendCommand(request, response), 0);
  EXPECT_TRUE(response.isNull());
}

TEST_F(DaemonIPCTest, TheAnswerDecides) {
  PObject ackNo, errorAndOk, errorOnly, bare;
  ackNo["ack"] = "no";
  errorAndOk["ack"] = "ok";
  errorAndOk["error"] = "busy";
  errorAndOk["error_code"] = 3;
  bare["task_id"] = 1;
  daemon_->Script({DaemonAnswer::Reply(ackNo), DaemonAnswer::Reply(errorAndOk), DaemonAnswer::Reply(bare)});

  plovo_test::LogCapture log;
  PObject r1, r2, r3;
  EXPECT_EQ(DaemonIPC().SendCommand(Command("a"), r1), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Can not recieve ack.")) << log.Dump();
  // The error is looked at before the ack, and the answer is kept.
  EXPECT_EQ(DaemonIPC().SendCommand(Command("b"), r2), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "SendCommand error: \"busy\"")) << log.Dump();
  EXPECT_EQ(r2["error_code"].asInt32(), 3);
  EXPECT_EQ(DaemonIPC().SendCommand(Command("c"), r3), -1);
  EXPECT_EQ(r3.toString(), "{\"task_id\": 1}");  // the answer is left as it came
}

TEST_F(DaemonIPCTest, BrokenAnswersFailTheCommand) {
  daemon_->Script({DaemonAnswer::Close(), DaemonAnswer::Bytes(std::string("\x42\x10\x00\x03" "ac", 6))});
  plovo_test::LogCapture log;
  PObject r1, r2;
  EXPECT_EQ(DaemonIPC().SendCommand(Command("a"), r1), -1);
  EXPECT_EQ(DaemonIPC().SendCommand(Command("b"), r2), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to receive response.")) << log.Dump();
}

TEST_F(DaemonIPCTest, NoDaemonIsAConnectFailure) {
  daemon_.reset();
  plovo_test::LogCapture log;
  PObject response;
  EXPECT_EQ(DaemonIPC().SendCommand(Command("list_task"), response), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to connect at '" + Root() + "/tmp/plovo-socket'")) << log.Dump();
}

// ---- the endpoints ---------------------------------------------------------

TEST(IPCListener, TcpRoundTripOnTheFirstFreePort) {
  IPCListener listener;
  int port = listener.prepare(20000);
  ASSERT_GE(port, 20000);
  IPCListener second;  // the port is taken now, so the search moves on
  int next = second.prepare(port);
  EXPECT_GT(next, port);

  std::thread server([&] {
    ASSERT_TRUE(listener.isReady());
    IPCSender peer;
    ASSERT_EQ(peer.assign(listener.accept()), 0);
    PObject request;
    ASSERT_EQ(peer.recv(request), 0);
    request["seen"] = 1;
    EXPECT_EQ(peer.send(request), 0);
  });
  IPCSender client;
  ASSERT_EQ(client.connect(port), 0);
  PObject reply;
  EXPECT_EQ(client.send(Command("ping"), true, reply), 0);
  server.join();
  EXPECT_EQ(reply.toString(), "{\"action\": \"ping\", \"seen\": 1}");
}

TEST(IPCListener, PortSearchEndsAt65535) {
  plovo_test::LogCapture log;
  IPCListener holder;
  int port = holder.prepare(65535);
  if (port != 65535) GTEST_SKIP() << "port 65535 is in use on this machine";
  IPCListener listener;
  EXPECT_EQ(listener.prepare(65535), -1);
  EXPECT_TRUE(log.Contains("Port number exceeds 65536")) << log.Dump();
  EXPECT_EQ(IPCListener::OpenSocket(0), -1);
}

TEST_F(DaemonIPCTest, ListenerWaitsAndRemovesItsSocketFile) {
  daemon_.reset();
  std::string path = Path("/l.sock");
  IPCListener listener;
  EXPECT_FALSE(listener.isReady());  // no socket yet
  ASSERT_EQ(listener.prepare(path), 0);
  listener.setTimeout({0, 100000});
  EXPECT_FALSE(listener.isReady());  // nobody connects
  IPCSender client;
  ASSERT_EQ(client.connect(path), 0);
  EXPECT_TRUE(listener.isReady());
  int fd = listener.accept();
  EXPECT_GE(fd, 0);
  close(fd);
  listener.close();
  EXPECT_FALSE(Exists("/l.sock"));
  EXPECT_LT(listener.accept(), 0);
}

}  // namespace
