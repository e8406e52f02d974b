#include "common/run-as.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <string>
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

// A thread that cannot become root is told so, and a guard that cannot put
// the ids back says which ids it meant to restore.
TEST(RunAsTest, FailuresToRaiseAndToRestoreAreLogged) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to set up the ids";
  int result = InChild([] {
    if (setresgid(0, kNogroup, 0) != 0 || setresuid(0, kNobody, 0) != 0) return 10;
    LogCapture log;
    {
      PLOVO_RUN_AS_ROOT(guard);
      if (!guard.ok()) return 11;
      // Giving up root for good inside the scope leaves the guard unable to
      // set the group back.
      if (setresuid(kNobody, kNobody, kNobody) != 0) return 12;
    }
    if (!log.Contains(LOG_AUTH | LOG_CRIT, "run-as-test.cpp:") ||
        !log.Contains(LOG_AUTH | LOG_CRIT, " ERROR: ~IF_RUN_AS(65534, 65534)"))
      return 13;
    {
      PLOVO_RUN_AS_ROOT(guard);
      if (guard.ok() || geteuid() != kNobody) return 14;
    }
    if (!log.Contains(LOG_AUTH | LOG_ERR, "ERROR: IF_RUN_AS(0, 0)")) return 15;
    return 0;
  });
  EXPECT_EQ(result, 0);
}

TEST(RunAsTest, GuardsOnSeveralThreadsEachSeeRootForTheirWholeScope) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to set up the ids";
  int result = InChild([] {
    if (setresgid(0, kNogroup, 0) != 0 || setresuid(0, kNobody, 0) != 0) return 10;
    // A guard whose end changed another thread's ids would drop that
    // thread mid-scope, or leave it as root afterwards.
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 8; ++t) {
      threads.emplace_back([&wrong] {
        for (int i = 0; i < 300; ++i) {
          {
            PLOVO_RUN_AS_ROOT(guard);
            if (!guard.ok() || geteuid() != 0 || getegid() != 0) ++wrong;
          }
          if (geteuid() != kNobody || getegid() != kNogroup) ++wrong;
        }
      });
    }
    for (std::thread& t : threads) t.join();
    if (wrong != 0) return 11;
    if (geteuid() != kNobody || getegid() != kNogroup) return 12;
    return 0;
  });
  EXPECT_EQ(result, 0);
}

// While one request's thread holds the guard, another thread of the same
// process keeps its own unprivileged ids: it reads them, and the file it
// creates belongs to the unprivileged user.
TEST(RunAsTest, AGuardLendsRootToNoOtherThread) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to set up the ids";
  char dir[] = "/tmp/plovo-runas-XXXXXX";
  ASSERT_NE(mkdtemp(dir), nullptr);
  ASSERT_EQ(chmod(dir, 0777), 0);
  const std::string file = std::string(dir) + "/written-by-the-other-thread";
  int result = InChild([&file] {
    if (setresgid(0, kNogroup, 0) != 0 || setresuid(0, kNobody, 0) != 0) return 10;
    std::mutex mutex;
    std::condition_variable changed;
    bool raised = false, checked = false;
    int code = 0;
    std::thread holder([&] {
      PLOVO_RUN_AS_ROOT(guard);
      std::unique_lock<std::mutex> lock(mutex);
      raised = guard.ok();
      changed.notify_all();
      changed.wait(lock, [&] { return checked; });
    });
    {
      std::unique_lock<std::mutex> lock(mutex);
      changed.wait(lock, [&] { return raised; });
      if (geteuid() != kNobody || getegid() != kNogroup) code = 11;
      int fd = open(file.c_str(), O_CREAT | O_WRONLY | O_EXCL, 0600);
      struct stat st {};
      if (fd < 0 || fstat(fd, &st) != 0) {
        code = code ? code : 12;
      } else if (st.st_uid != kNobody || st.st_gid != kNogroup) {
        code = code ? code : 13;
      }
      if (fd >= 0) close(fd);
      checked = true;
      changed.notify_all();
    }
    holder.join();
    return code;
  });
  unlink(file.c_str());
  rmdir(dir);
  EXPECT_EQ(result, 0);
}

}  // namespace
