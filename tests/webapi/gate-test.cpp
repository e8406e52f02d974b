// The readiness gate: which service states let which methods through.
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include "log-capture.h"
#include "webapi-test-util.h"
#include "webapi/methods.h"

namespace {

using plovo_test::LogCapture;

// The module's own list: which methods exist is the module test's concern.
#define PLOVO_METHOD_NAME(method, action) method,
const char* const kMethods[] = {PLOVO_METHODS(PLOVO_METHOD_NAME)};
#undef PLOVO_METHOD_NAME

class GateTest : public plovo_test::WebApiTest {};

// Every method, every state: the code the gate answers, or 0 when it lets
// the request through.
TEST_F(GateTest, StatesDecideWhichMethodsPass) {
  struct Case {
    int state;
    const char* error;
    int code;  // 0: passes the gate
  } cases[] = {{4, "", 0}, {2, "", 405}, {3, "", 406}, {5, "", 407},
               {6, "", 401}, {0, "", 401}, {9, "", 401}, {7, "err_sys", 401},
               {7, "err_upgrade_failed", 415}};
  for (const Case& c : cases) {
    WriteStatus(c.state, c.error);
    for (const char* method : kMethods) {
      LogCapture log;
      VELT::APIResponse r = Call(method);
      ASSERT_EQ(r.AnswerCount(), 1) << method;
      const bool passed = ReachedAction(r, log);
      if (c.code == 0) {
        EXPECT_TRUE(passed) << "state " << c.state << " " << method << "\n" << log.Dump();
      } else {
        EXPECT_FALSE(passed) << "state " << c.state << " " << method;
        EXPECT_EQ(r.GetErrorCode(), c.code) << "state " << c.state << " " << method;
        EXPECT_TRUE(r.GetData().isNull());
      }
    }
  }
}

TEST_F(GateTest, WithoutRepositoryOnlyGlobalSettingsPass) {
  WriteStatus(1, "");
  for (const char* method : kMethods) {
    LogCapture log;
    VELT::APIResponse r = Call(method);
    const std::string m = method;
    if (m == "get_global_setting" || m == "set_global_setting") {
      EXPECT_TRUE(ReachedAction(r, log)) << m << "\n" << log.Dump();
    } else {
      EXPECT_EQ(r.GetErrorCode(), 404) << method;
    }
  }
  // The exception compares exactly, as dispatch does.
  EXPECT_EQ(Call("Get_Global_Setting").GetErrorCode(), 404);
}

TEST_F(GateTest, ErrorStateIsLoggedByName) {
  WriteStatus(7, "err_sys");
  LogCapture log;
  EXPECT_EQ(Call("list").GetErrorCode(), 401);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Plovo service errors 'err_sys'")) << log.Dump();

  WriteStatus(7, "");
  LogCapture quiet;
  EXPECT_EQ(Call("list").GetErrorCode(), 401);
  EXPECT_FALSE(quiet.Contains("Plovo service errors")) << quiet.Dump();
}

TEST_F(GateTest, UnreadableStateStopsEveryRequest) {
  LogCapture log;
  // No status file at all.
  EXPECT_EQ(Call("get_global_setting").GetErrorCode(), 401);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to get service status")) << log.Dump();
  // A status file without "error".
  WriteFile("/var/packages/Plovo/etc/status", "state=\"4\"\n");
  EXPECT_EQ(Call("list").GetErrorCode(), 401);
  EXPECT_FALSE(log.Contains("Failed to send List command"));
}

TEST_F(GateTest, ServerThatCannotBecomeRootIsRefused) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to set up the ids";
  WriteStatus(4, "");
  pid_t child = fork();
  if (child == 0) {
    // Give up root for good, as a server without privileges would run.
    if (setresgid(65534, 65534, 65534) != 0 || setresuid(65534, 65534, 65534) != 0) _exit(10);
    LogCapture log;
    VELT::APIResponse r = Call("list");
    if (r.AnswerCount() != 1 || r.GetErrorCode() != 401) _exit(11);
    if (!log.Contains(LOG_ERR, "Failed to run as root")) _exit(13);
    if (log.Contains("Failed to send List command")) _exit(14);
    _exit(0);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

}  // namespace
