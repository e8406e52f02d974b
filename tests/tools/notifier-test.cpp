// plovo-notifier as its own process, against the stand-in daemon.
#include <sys/wait.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "emulation.h"
#include "sandbox.h"
#include "test-daemon.h"

namespace {

using plovo_test::DaemonAnswer;
const size_t npos = std::string::npos;

class NotifierTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    PLOVO_SKIP_UNLESS_TARGET_PROGRAMS_RUN();
  }
  // Runs the notifier: its exit status, its stderr in err_; stdout stays empty.
  int Run(const std::vector<std::string>& args) {
    std::string command = "'" PLOVO_NOTIFIER_PATH "'";
    for (const std::string& arg : args) command += " '" + arg + "'";
    const int status = std::system((command + " >" + Path("/out") + " 2>" + Path("/err")).c_str());
    EXPECT_EQ("", ReadFile("/out"));
    err_ = ReadFile("/err");
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  std::string err_;
};

// Usage errors exit 2 without calling the daemon; otherwise the status
// follows the daemon's answer, 1 when there is none.
TEST_F(NotifierTest, EachUseSendsItsRequestAndExitsByTheAnswer) {
  MakeDir("/tmp");
  EXPECT_EQ(1, Run({"--execute-task", "3"}));  // no daemon yet: the IPC layer says why
  EXPECT_NE(npos, err_.find("run_task: no answer from the daemon at " + Path("/tmp/plovo-socket")));
  EXPECT_NE(npos, err_.find("No such file or directory")) << err_;
  const std::string run = R"({"action": "run_task", "need_ack": 1, "task_id": )";
  const std::string added = R"({"action": "device_added", "need_ack": 1, "share_name": )";
  const std::string removed = R"({"action": "device_removed", "need_ack": 1, "share_name": )";
  const DaemonAnswer ok = DaemonAnswer::Ok();
  auto reply = [](const char* key, const PObject& value, uint64_t code = 0) {
    PObject answer;
    answer[key] = value;
    if (code != 0) answer["error_code"] = code;
    return DaemonAnswer::Reply(answer);
  };
  // message: on stderr, with status 1; empty: status 0 and nothing on stderr.
  const struct { std::vector<std::string> args; std::string request; DaemonAnswer answer;
                 std::string message; } cases[] = {
      {{"--execute-task", "18446744073709551615"}, run + "18446744073709551615}", ok, ""},
      {{"--device-added", "usbshare1"}, added + "\"usbshare1\"}", ok, ""},
      {{"--execute-task", "7"}, run + "7}", reply("error", "x", 4), "run_task: error 4\n"},
      {{"--device-removed", "SD card"}, removed + "\"SD card\"}", reply("error", "x", -13),
       "device_removed: error -13\n"},
      {{"--device-added", "sd"}, added + "\"sd\"}", reply("ack", "later"), "device_added: "},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.request);
    plovo_test::TestDaemon daemon;
    daemon.Answer(c.answer);
    EXPECT_EQ(c.message.empty() ? 0 : 1, Run(c.args)) << err_;
    EXPECT_EQ(c.request, daemon.LastRequest().toString());
    EXPECT_TRUE(c.message.empty() ? err_.empty() : err_.find(c.message) != npos) << err_;
  }
  plovo_test::TestDaemon daemon;
  std::vector<std::vector<std::string>> usage = {
      {}, {"--execute-task"}, {"--run-task", "1"}, {"--execute-task", "1", "extra"}};
  for (const char* id : {"0", "-1", "+1", " 1", "1x", "0x10", "", "18446744073709551616"}) {
    usage.push_back({"--execute-task", id});
  }
  for (const char* share : {"", "a/b", "/", ".", ".."}) usage.push_back({"--device-added", share});
  for (const auto& args : usage) {
    SCOPED_TRACE(testing::PrintToString(args));
    EXPECT_EQ(2, Run(args));
    EXPECT_NE(npos, err_.find("usage: plovo-notifier")) << err_;
  }
  EXPECT_EQ(0, daemon.Connections());
}

}  // namespace
