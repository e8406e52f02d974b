// StartService and StopService with plovod-dev (or a small script) as the
// package's daemon program, and plovo-service as their host.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>
#include <velt/vlibc.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <thread>

#include "common/paths.h"
#include "log-capture.h"
#include "sandbox.h"
#include "service/schedule.h"
#include "service/service-ctrl.h"

namespace {

using namespace std::chrono_literals;

class ServiceStartTest : public plovo_test::SandboxTest {
 protected:
  // The package enabled, its folders, two volumes and plovod-dev as daemon.
  void SetUp() override {
    SandboxTest::SetUp();
    for (const char* dir : {"/var/packages/Plovo/target/sbin", "/var/packages/Plovo/etc",
                            "/var/run", "/tmp", "/volume1", "/volume2"}) {
      MakeDir(dir);
    }
    WriteFile("/var/packages/Plovo/enabled", "");
    WriteFile("/etc.defaults/veltinfo.conf", "plovo=\"yes\"\n");
    symlink(PLOVOD_DEV_PATH, Path(kDaemon).c_str());
    DeclareVolumes({{"volume1"}, {"volume2"}});
  }
  void TearDown() override {
    if (StatusService() == 0) kill(VLIBCReadPidFile(Plovo::Path::DaemonPidFile().c_str()), SIGKILL);
    SetStopServiceWait(0ms);
    SandboxTest::TearDown();
  }
  std::string State() const { return ReadFile("/var/packages/Plovo/etc/status"); }
  static std::string StateIs(int state, const std::string& error) {
    return "state=\"" + std::to_string(state) + "\"\nerror=\"" + error + "\"\n";
  }
  static constexpr const char* kDaemon = "/var/packages/Plovo/target/sbin/plovod";
  static constexpr const char* kRegVolume = "/var/packages/Plovo/etc/veltpkg_conf/reg_volume";
};

TEST_F(ServiceStartTest, DisabledPackageOrNoUsableVolumeStartsNoDaemon) {
  unlink(Path("/var/packages/Plovo/enabled").c_str());
  WriteStatus(6, "");
  EXPECT_EQ(StartService(), 0);
  EXPECT_EQ(State(), StateIs(6, ""));
  EXPECT_FALSE(Exists("/volume1/@Plovo") || Exists("/var/packages/Plovo/etc/setting.conf"));

  WriteFile("/var/packages/Plovo/enabled", "");
  DeclareVolumes({{"volume1", true, true, "external"}, {"volume2", true, false}});
  EXPECT_EQ(StartService(), 0);
  EXPECT_EQ(State(), StateIs(1, ""));
  EXPECT_FALSE(Exists("/var/run/plovod.pid") || Exists("/volume1/@Plovo") ||
               Exists("/volume2/@Plovo"));
  EXPECT_EQ(ReadFile("/var/packages/Plovo/etc/setting.conf"), "repo_vol_path=\"\"\n");
  EXPECT_EQ(ReadFile(kRegVolume), "[\"\"]\n");
}

// Start, stop and start again: the repository, its records, the daemon, the
// platform log and the scheduler entries at each step.
TEST_F(ServiceStartTest, StartStopStartWithTheDevelopmentDaemon) {
  plovo_test::LogCapture log;
  ASSERT_EQ(StartService(), 0) << log.Dump();
  EXPECT_EQ(State(), StateIs(4, ""));
  EXPECT_TRUE(Exists("/volume1/@Plovo/task") && Exists("/volume1/@Plovo/db/task-db.sqlite"));
  EXPECT_EQ(ReadFile(kRegVolume), "[\"" + Root() + "/volume1\"]\n");
  ASSERT_EQ(StatusService(), 0);

  int64_t id = 0;
  ASSERT_TRUE(Plovo::CreateSchedule(1, 0, "Camera", true,
                                    R"({"week_day":"1","hour":7,"minute":0,"repeat_date":0})", id));
  const std::string entry = "/velt-dev/scheduler/" + std::to_string(id) + ".json";
  ASSERT_EQ(StopService(), 0) << log.Dump();
  EXPECT_EQ(State(), StateIs(6, ""));
  EXPECT_FALSE(Exists("/var/run/plovod.pid"));
  EXPECT_TRUE(log.Contains("daemon is dead")) << log.Dump();
  EXPECT_NE(ReadFile(entry).find("\"listable\" : false"), std::string::npos);

  ASSERT_EQ(StartService(), 0) << log.Dump();
  EXPECT_NE(ReadFile(entry).find("\"listable\" : true"), std::string::npos);
  const std::string events = ReadFile("/velt-dev/system.log");
  for (const char* event :
       {"\t1\t1\t0x11B01050\tPlovo\t\t\t\n", "\t1\t1\t0x11B01051\tPlovo\t\t\t\n"})
    EXPECT_NE(events.find(event), std::string::npos) << events;
}

TEST_F(ServiceStartTest, ExistingRepositoryOnTheSecondVolumeIsReused) {
  MakeDir("/volume2/@Plovo");
  plovo_test::LogCapture log;
  ASSERT_EQ(StartService(), 0) << log.Dump();
  EXPECT_TRUE(log.Contains("Success to reuse repo path [" + Root() + "/volume2]")) << log.Dump();
  EXPECT_TRUE(Exists("/volume2/@Plovo/db/task-db.sqlite"));
  EXPECT_FALSE(Exists("/volume1/@Plovo"));
  EXPECT_EQ(ReadFile(kRegVolume), "[\"" + Root() + "/volume2\"]\n");
}

TEST_F(ServiceStartTest, FailuresEndInTheErrorStateWithTheirTag) {
  const struct {
    const char* daemon;  // the daemon program, a script; none when null
    const char* path;    // a file put in the repository's way, a folder when it ends in '/'
    const char* content;
    const char* error;
    const char* logged;
  } cases[] = {
      {nullptr, nullptr, nullptr, "err_sys", "Failed to start daemon"},
      {"#!/bin/sh\nexit 1\n", nullptr, nullptr, "err_sys", "Failed to start daemon"},
      {nullptr, "/volume1/@Plovo", "", "err_sys", "Failed to MakeRepo"},
      {nullptr, "/volume1/@Plovo/db/task-db.sqlite/", "", "err_upgrade_failed",
       "fail to run updater"},
      {nullptr, "/volume1/@Plovo/db/task-db.sqlite", "garbage", "err_upgrade_failed",
       "fail to run updater"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.logged + std::string(c.path ? c.path : ""));
    std::filesystem::remove_all(Path("/volume1/@Plovo"));
    std::filesystem::remove(Path(kDaemon));
    if (c.daemon) WriteFile(kDaemon, c.daemon);
    chmod(Path(kDaemon).c_str(), 0755);
    if (c.path)
      c.path[std::strlen(c.path) - 1] == '/' ? MakeDir(c.path) : WriteFile(c.path, c.content);
    plovo_test::LogCapture log;
    EXPECT_EQ(StartService(), -1);
    EXPECT_EQ(State(), StateIs(7, c.error));
    EXPECT_TRUE(log.Contains(c.logged)) << log.Dump();
    EXPECT_NE(StatusService(), 0);
  }
}

// Stops of processes put in the pid file by hand. A daemon holds its pid
// file's lock for its life; the scripts do so through fd 9, which the
// command they exec keeps.
TEST_F(ServiceStartTest, StopOfStubbornZombieStaleAndMissingDaemons) {
  SetStopServiceWait(300ms);
  const std::string take = "exec 9>>$PLOVO_ROOT/var/run/plovod.pid; flock -n 9 || exit 1; ";
  const std::string write = "echo $$ > $PLOVO_ROOT/var/run/plovod.pid; ";
  const struct {
    std::string script;  // the daemon's; it writes its own pid file
    bool reapFirst;      // collected before the stop: its pid is stale
    int result;
    const char* logged;
    int signal;  // what ended it; for a process left alone, the test's SIGKILL
  } cases[] = {
      {take + "trap '' TERM; " + write + "exec sleep 10", false, 0, "forcelly kill daemon", SIGKILL},
      // Ended by SIGTERM but not yet collected (a zombie): gone all the same.
      {take + write + "exec sleep 10", false, 0, "daemon is dead", SIGTERM},
      {take + write, true, 0, "pid does not exist", 0},
      // Nobody holds the pid file: the number is another program's by now.
      {write + "exec sleep 10", false, 0, "pid does not exist", SIGKILL},
      {"", false, -1, "Failed to kill daemon", 0},
  };
  const std::string pidFile = Path("/var/run/plovod.pid");
  for (const auto& c : cases) {
    SCOPED_TRACE(c.logged);
    WriteStatus(4, "");
    const bool locked = c.script.rfind(take, 0) == 0;
    const pid_t pid = c.script.empty() ? -1 : fork();
    if (pid == 0) execl("/bin/sh", "sh", "-c", c.script.c_str(), static_cast<char*>(nullptr)), _exit(127);
    for (int i = 0; pid > 0 && i < 500 && VLIBCReadPidFile(pidFile.c_str()) != pid; ++i)
      std::this_thread::sleep_for(10ms);
    siginfo_t info{};
    if (c.reapFirst) waitid(P_PID, pid, &info, WEXITED);
    plovo_test::LogCapture log;
    EXPECT_EQ(StopService(), c.result);
    EXPECT_TRUE(log.Contains(c.logged)) << log.Dump();
    EXPECT_EQ(State(), StateIs(c.result == 0 ? 6 : 4, ""));
    EXPECT_EQ(Exists("/var/run/plovod.pid"), locked && !c.reapFirst);
    int status = 0;
    if (pid > 0 && !c.reapFirst) {
      if (!locked) {
        EXPECT_EQ(kill(pid, 0), 0) << "a process that is not the daemon was signalled";
        kill(pid, SIGKILL);
      }
      waitpid(pid, &status, 0);
    }
    EXPECT_EQ(WIFSIGNALED(status) ? WTERMSIG(status) : 0, c.signal) << status;
    unlink(pidFile.c_str());
  }
}

// plovo-service as the package's service control and the usage collector run it.
TEST_F(ServiceStartTest, ServiceHostExitCodesAndStatusLine) {
  std::string out;
  auto run = [&out](const std::string& args) {
    FILE* pipe = popen((PLOVO_SERVICE_PATH " " + args + " 2>/dev/null").c_str(), "r");
    char buffer[4096];
    out.clear();
    for (size_t n; pipe && (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) out.append(buffer, n);
    const int status = pipe ? pclose(pipe) : -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  };
  for (const char* bad : {"", "restart", "start stop", "--module", "--module /nonexistent status"})
    EXPECT_EQ(run(bad), 2) << bad;
  const std::string module = "--module " PLOVO_MODULE_PATH " ";
  EXPECT_EQ(run(module + "status"), 1);  // no status file yet
  EXPECT_EQ(run(module + "start"), 0);
  const int pid = VLIBCReadPidFile(Path("/var/run/plovod.pid").c_str());
  EXPECT_EQ(run(module + "start"), 0);  // the daemon runs: nothing to do
  EXPECT_EQ(VLIBCReadPidFile(Path("/var/run/plovod.pid").c_str()), pid);
  EXPECT_EQ(run(module + "status"), 0);
  EXPECT_EQ(out, "{\"state\":4,\"error\":\"\"}\n");
  EXPECT_EQ(run(module + "stats"), 0);
  EXPECT_EQ(out.substr(0, 1), "{");
  EXPECT_EQ(run(module + "stop"), 0);
  EXPECT_EQ(run(module + "stop"), 1);  // nothing left to stop
  unlink(Path(kDaemon).c_str());
  EXPECT_EQ(run(module + "start"), 1);
  EXPECT_EQ(run(module + "status"), 0);
  EXPECT_EQ(out, "{\"state\":7,\"error\":\"err_sys\"}\n");
}

}  // namespace
