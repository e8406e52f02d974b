// plovo-notifier, run as its own process against the stand-in daemon: the
// request each option sends, and the exit status for each answer.
#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "sandbox.h"
#include "test-daemon.h"

namespace {

using plovo_test::DaemonAnswer;

class NotifierTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    MakeDir("/tmp");
  }
  // Runs the notifier; returns its exit status (-1: it did not exit), with
  // its stdout and stderr in out_ and err_.
  int Run(std::vector<std::string> args) {
    args.insert(args.begin(), PLOVO_NOTIFIER_PATH);
    std::vector<char*> argv;
    for (std::string& arg : args) argv.push_back(&arg[0]);
    argv.push_back(nullptr);
    const std::string outFile = Path("/stdout"), errFile = Path("/stderr");
    pid_t pid = fork();
    if (pid == 0) {
      dup2(open(outFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 1);
      dup2(open(errFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 2);
      execv(PLOVO_NOTIFIER_PATH, argv.data());
      _exit(127);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    out_ = ReadFile("/stdout");
    err_ = ReadFile("/stderr");
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

  std::string out_, err_;
};

DaemonAnswer Reply(const char* key, const PObject& value, uint64_t code = 0) {
  PObject answer;
  answer[key] = value;
  if (code != 0) answer["error_code"] = code;
  return DaemonAnswer::Reply(answer);
}

TEST_F(NotifierTest, EachOptionSendsItsRequestAndExitsByTheAnswer) {
  const std::string run = R"({"action": "run_task", "need_ack": 1, "task_id": )";
  const std::string added = R"({"action": "device_added", "need_ack": 1, "share_name": )";
  const std::string removed = R"({"action": "device_removed", "need_ack": 1, "share_name": )";
  const DaemonAnswer ok = DaemonAnswer::Ok();
  const struct {
    std::vector<std::string> args;
    std::string request;
    DaemonAnswer answer;
    int status;
    std::string message;  // stderr holds it; a success prints nothing
  } cases[] = {
      {{"--execute-task", "42"}, run + "42}", ok, 0, ""},
      {{"--execute-task", "18446744073709551615"}, run + "18446744073709551615}", ok, 0, ""},
      {{"--device-added", "usbshare1"}, added + "\"usbshare1\"}", ok, 0, ""},
      {{"--device-removed", "SD card"}, removed + "\"SD card\"}", ok, 0, ""},
      {{"--execute-task", "7"}, run + "7}", Reply("error", "no task", 4), 1,
       "plovo-notifier: run_task: error 4\n"},
      {{"--device-removed", "sd"}, removed + "\"sd\"}", Reply("error", "x", uint64_t(-13)), 1,
       "plovo-notifier: device_removed: error -13\n"},
      // Neither an error nor an acknowledgement.
      {{"--device-added", "sd"}, added + "\"sd\"}", Reply("ack", "later"), 1, "device_added: "},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.request);
    plovo_test::TestDaemon daemon;
    daemon.Answer(c.answer);
    EXPECT_EQ(c.status, Run(c.args)) << err_;
    const std::vector<PObject> requests = daemon.Requests();
    ASSERT_EQ(1u, requests.size());
    EXPECT_EQ(c.request, requests[0].toString());
    EXPECT_EQ("", out_);
    EXPECT_TRUE(c.status == 0 ? err_.empty() : err_.find(c.message) != std::string::npos) << err_;
  }
}

TEST_F(NotifierTest, UsageErrorsExitTwoWithoutCallingTheDaemon) {
  const std::vector<std::vector<std::string>> cases = {
      {}, {"--execute-task"}, {"--execute-task", "1", "extra"}, {"--run-task", "1"},
      {"--execute-task", "1", "--execute-task", "2"}, {"1", "--execute-task"},
      {"--execute-task", "0"}, {"--execute-task", "-1"}, {"--execute-task", "+1"},
      {"--execute-task", " 1"},
      {"--execute-task", "1x"}, {"--execute-task", "0x10"}, {"--execute-task", ""},
      {"--execute-task", "18446744073709551616"},
      {"--device-added", ""}, {"--device-added", "a/b"}, {"--device-removed", "/"},
      {"--device-removed", "."}, {"--device-removed", ".."},
  };
  plovo_test::TestDaemon daemon;
  for (const auto& args : cases) {
    std::string shown;
    for (const std::string& arg : args) shown += "[" + arg + "]";
    SCOPED_TRACE(shown);
    EXPECT_EQ(2, Run(args));
    EXPECT_EQ("", out_);
    EXPECT_NE(std::string::npos, err_.find("usage: plovo-notifier")) << err_;
  }
  EXPECT_EQ(0, daemon.Connections());
}

TEST_F(NotifierTest, NoDaemonExitsOneSayingWhy) {
  EXPECT_EQ(1, Run({"--execute-task", "3"}));
  EXPECT_EQ("", out_);
  const std::string socket = Path("/tmp/plovo-socket");
  EXPECT_NE(std::string::npos, err_.find("run_task: no answer from the daemon at " + socket))
      << err_;
  // The failing step and the system's reason, from the IPC layer.
  EXPECT_NE(std::string::npos, err_.find("No such file or directory")) << err_;
}

}  // namespace
