#include "common/run-as.h"

#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <thread>
#include <vector>

#include "log-capture.h"
#include "sandbox.h"

namespace {

using plovo_test::LogCapture;

// Runs body in a child process, which may change its ids freely, and
// returns the child's exit status (body returns it). The suite runs as
// root; the children give that up in different ways.
int InChild(const std::function<int()>& body) {
  pid_t child = fork();
  if (child == 0) _exit(body());
  int status = 0;
  if (waitpid(child, &status, 0) != child || !WIFEXITED(status)) return -1;
  return WEXITSTATUS(status);
}

constexpr uid_t kNobody = 65534;
constexpr gid_t kNogroup = 65534;

TEST(RunAsTest, RaisesToRootAndRestoresEffectiveIds) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to set up the ids";
  int result = InChild([] {
    // Real and saved ids stay root, the effective ones are nobody's, as in
    // a server that dropped its privileges temporarily.
    if (setresgid(0, kNogroup, 0) != 0 || setresuid(0, kNobody, 0) != 0) return 10;
    {
      LogCapture log;
      PLOVO_RUN_AS_ROOT(guard);
      if (!guard.ok() || geteuid() != 0 || getegid() != 0) return 11;
      if (!log.Lines().empty()) return 12;
    }
    if (geteuid() != kNobody || getegid() != kNogroup) return 13;
    uid_t r, e, s;
    if (getresuid(&r, &e, &s) != 0 || r != 0 || s != 0) return 14;
    return 0;
  });
  EXPECT_EQ(result, 0);
}

TEST(RunAsTest, GuardsOnSeveralThreadsRestoreOnlyAtTheLast) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to set up the ids";
  int result = InChild([] {
    if (setresgid(0, kNogroup, 0) != 0 || setresuid(0, kNobody, 0) != 0) return 10;
    // Each guard must see root for its whole scope, though other threads'
    // guards start and end meanwhile; a guard that restored what another
    // raised would leave the process as root, or drop it mid-scope.
    std::atomic<int> notRoot{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 8; ++t) {
      threads.emplace_back([&notRoot] {
        for (int i = 0; i < 300; ++i) {
          PLOVO_RUN_AS_ROOT(guard);
          if (!guard.ok() || geteuid() != 0 || getegid() != 0) ++notRoot;
        }
      });
    }
    for (std::thread& t : threads) t.join();
    if (notRoot != 0) return 11;
    if (geteuid() != kNobody || getegid() != kNogroup) return 12;
    return 0;
  });
  EXPECT_EQ(result, 0);
}

}  // namespace
