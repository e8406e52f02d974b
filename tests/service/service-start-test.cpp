// StartService and StopService with plovod (or a small script) as the
// package's daemon program, and plovo-service as their host.
#include <sys/wait.h>

#include <cstdlib>
#include <filesystem>
#include <thread>

#include "emulation.h"
#include "log-capture.h"
#include "service-sandbox.h"
#include "service/schedule.h"

namespace {

using namespace std::chrono_literals;

class ServiceStartTest : public plovo_test::ServiceSandboxTest {
 protected:
  // Runs plovo-service as the package's service control does; its output goes to /out.
  int Host(const std::string& args) const {
    const int status = std::system((PLOVO_SERVICE_PATH " " + args + " >" + Path("/out") + " 2>/dev/null").c_str());
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
};

TEST_F(ServiceStartTest, DisabledPackageOrNoUsableVolumeStartsNoDaemon) {
  unlink(Path("/var/packages/Plovo/enabled").c_str());
  WriteStatus(6, "");
  EXPECT_EQ(StartService(), 0);
  EXPECT_EQ(Status(), StateIs(6));
  WriteFile("/var/packages/Plovo/enabled", "");
  DeclareVolumes({{"volume1", true, true, "external"}, {"volume2", true, false}});
  EXPECT_EQ(StartService(), 0);
  EXPECT_EQ(Status(), StateIs(1));
  EXPECT_TRUE(Recorded(""));
  // The recorded volume is gone: nothing is made elsewhere, the user chooses.
  DeclareVolumes({{"volume1"}});
  WriteFile("/var/packages/Plovo/etc/setting.conf", "repo_vol_path=\"" + Path("/volume9") + "\"\n");
  EXPECT_EQ(StartService(), 0);
  EXPECT_EQ(Status(), StateIs(1));
  EXPECT_FALSE(Exists("/volume1/@Plovo"));
}

// Through plovo-service: a repository found on the second volume is reused,
// a second start does nothing, and a stop and a new start hide and show the
// scheduler entries and leave their events in the platform log.
TEST_F(ServiceStartTest, ReuseStopAndStartAgainThroughTheHost) {
  PLOVO_SKIP_UNLESS_TARGET_PROGRAMS_RUN();
  for (const char* bad : {"", "restart", "start stop", "--module", "--module /nonexistent status"}) EXPECT_EQ(Host(bad), 2) << bad;
  const std::string module = "--module " PLOVO_MODULE_PATH " ";
  MakeDir("/volume2/@Plovo");
  // Left by a daemon that crashed, the pid file names another program now.
  const pid_t other = fork();
  if (other == 0) execl("/bin/sleep", "sleep", "10", static_cast<char*>(nullptr)), _exit(127);
  WriteFile("/var/run/plovod.pid", std::to_string(other) + "\n");
  ASSERT_EQ(Host(module + "start"), 0);
  EXPECT_TRUE(Pid() != other && kill(other, 0) == 0);
  kill(other, SIGKILL);
  waitpid(other, nullptr, 0);
  EXPECT_TRUE(Recorded(Path("/volume2")));
  EXPECT_EQ(Host(module + "start"), 0);
  EXPECT_EQ(Host(module + "status"), 0);
  EXPECT_EQ(ReadFile("/out"), "{\"state\":4,\"error\":\"\"}\n");
  int64_t id = 0;
  ASSERT_TRUE(Plovo::CreateSchedule(1, 0, "Camera", true, R"({"week_day":"1","hour":7,"minute":0,"repeat_date":0})", id));
  const std::string entry = "/velt-dev/scheduler/" + std::to_string(id) + ".json";
  EXPECT_EQ(Host(module + "stop"), 0);
  EXPECT_EQ(Status(), StateIs(6));
  EXPECT_NE(ReadFile(entry).find("\"listable\" : false"), std::string::npos);
  EXPECT_EQ(Host(module + "stop"), 1);  // nothing left to stop
  EXPECT_EQ(Host(module + "start"), 0);
  EXPECT_NE(ReadFile(entry).find("\"listable\" : true"), std::string::npos);
  const std::string events = ReadFile("/velt-dev/system.log");
  for (const char* event : {"\t1\t1\t0x11B01050\tPlovo\t\t\t\n", "\t1\t1\t0x11B01051\tPlovo\t\t\t\n"})
    EXPECT_NE(events.find(event), std::string::npos) << events;
}

// Without a daemon program, every start that gets as far as running it fails.
TEST_F(ServiceStartTest, FailuresEndInTheErrorStateWithTheirTag) {
  const struct { const char* path; const char* content; const char* error; const char* logged; } cases[] = {
      {nullptr, nullptr, "err_sys", "Failed to start daemon"},
      {"/volume1/@Plovo", "", "err_sys", "Failed to MakeRepo"},  // a file in the repository's place
      {"/volume1/@Plovo/db/task-db.sqlite", "garbage", "err_upgrade_failed", "fail to run updater"},
  };
  unlink(Path(kDaemon).c_str());
  for (const auto& c : cases) {
    std::filesystem::remove_all(Path("/volume1/@Plovo"));
    if (c.path) WriteFile(c.path, c.content);
    plovo_test::LogCapture log;
    EXPECT_EQ(StartService(), -1);
    EXPECT_EQ(Status(), StateIs(7, c.error));
    EXPECT_TRUE(log.Contains(c.logged)) << log.Dump();
  }
}

// Stops of processes put in the pid file by hand. A daemon holds its pid file's lock for
// its life; a script through fd 9, which the command it execs keeps. One that exits is
// collected before the stop. signal: what ended it, the test's SIGKILL if the stop left it.
TEST_F(ServiceStartTest, StopOfStubbornZombieAndStaleDaemons) {
  SetStopServiceWait(300ms);
  const std::string take = "exec 9>>$PLOVO_ROOT/var/run/plovod.pid; flock -n 9 || exit 1; ";
  const std::string write = "echo $$ > $PLOVO_ROOT/var/run/plovod.pid; ", sleep = "exec sleep 10";
  const struct { std::string script; const char* logged; int signal; } cases[] = {
      {take + "trap '' TERM; " + write + sleep, "forcelly kill daemon", SIGKILL},
      {take + write + sleep, "daemon is dead", SIGTERM},  // a zombie until collected: gone all the same
      {take + write, "pid does not exist", 0},
      {write + sleep, "pid does not exist", SIGKILL},  // nobody holds the pid file: the number may be reused
  };
  const std::string pidFile = Path("/var/run/plovod.pid");
  for (const auto& c : cases) {
    SCOPED_TRACE(c.script);
    const bool locked = c.script.rfind(take, 0) == 0, exits = c.script.find(sleep) == std::string::npos;
    const pid_t pid = fork();
    if (pid == 0) execl("/bin/sh", "sh", "-c", c.script.c_str(), static_cast<char*>(nullptr)), _exit(127);
    for (int i = 0; i < 500 && VLIBCReadPidFile(pidFile.c_str()) != pid; ++i) std::this_thread::sleep_for(10ms);
    int status = 0;
    if (exits) waitpid(pid, &status, 0);
    plovo_test::LogCapture log;
    EXPECT_EQ(StopService(), 0);
    EXPECT_TRUE(log.Contains(c.logged)) << log.Dump();
    EXPECT_EQ(Exists("/var/run/plovod.pid"), locked && !exits);
    if (!locked) kill(pid, SIGKILL);
    if (!exits) waitpid(pid, &status, 0);
    EXPECT_EQ(WIFSIGNALED(status) ? WTERMSIG(status) : 0, c.signal) << status;
    unlink(pidFile.c_str());
  }
}

}  // namespace
