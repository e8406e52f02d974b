#include "ipc/daemon-ipc.h"

#include <gtest/gtest.h>
#include <syslog.h>

#include <memory>

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

TEST_F(DaemonIPCTest, EachCommandHasAConnectionOfItsOwn) {
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

TEST_F(DaemonIPCTest, TheAnswerDecides) {
  PObject ackNo, errorAndOk, bare;
  ackNo["ack"] = "no";
  errorAndOk["ack"] = "ok";
  errorAndOk["error"] = "busy";
  errorAndOk["error_code"] = 3;
  bare["task_id"] = 1;
  daemon_->Script({DaemonAnswer::Reply(ackNo), DaemonAnswer::Reply(errorAndOk), DaemonAnswer::Reply(bare)});

  PObject r1, r2, r3;
  EXPECT_EQ(DaemonIPC().SendCommand(Command("a"), r1), -1);
  // The error is looked at before the ack, and the answer is kept.
  EXPECT_EQ(DaemonIPC().SendCommand(Command("b"), r2), -1);
  EXPECT_EQ(r2["error_code"].asInt32(), 3);
  EXPECT_EQ(DaemonIPC().SendCommand(Command("c"), r3), -1);
  EXPECT_EQ(r3.toString(), "{\"task_id\": 1}");  // the answer is left as it came
}

TEST_F(DaemonIPCTest, NoDaemonIsAConnectFailure) {
  daemon_.reset();
  plovo_test::LogCapture log;
  PObject response;
  EXPECT_EQ(DaemonIPC().SendCommand(Command("list_task"), response), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to connect at '" + Root() + "/tmp/plovo-socket'")) << log.Dump();
}

}  // namespace
