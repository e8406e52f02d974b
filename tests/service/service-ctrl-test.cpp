#include "service/service-ctrl.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <syslog.h>
#include <velt/dev.h>

#include <chrono>
#include <functional>
#include <future>
#include <string>
#include <thread>

#include "bounded.h"
#include "log-capture.h"
#include "sandbox.h"

namespace {

using plovo_test::LogCapture;

class ServiceStatusTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    MakeDir("/var/packages/Plovo/etc");
  }
  void TearDown() override {
    SetServiceStatusLockWait(std::chrono::milliseconds(0));
    SandboxTest::TearDown();
  }
  static constexpr const char* kStatus = "/var/packages/Plovo/etc/status";
};

TEST_F(ServiceStatusTest, WrittenPairReadsBackAndKeepsOtherLines) {
  WriteFile(kStatus, "owner=\"daemon\"\n");
  ServiceStatus out;
  out.state = PLOVO_SERVICE_STATUS_ERROR;
  out.error = "err_upgrade_failed";
  ASSERT_EQ(SetServiceStatus(out), 0);
  EXPECT_EQ(ReadFile(kStatus), "owner=\"daemon\"\nstate=\"7\"\nerror=\"err_upgrade_failed\"\n");

  out.state = PLOVO_SERVICE_STATUS_RUNNING;
  out.error = "";
  ASSERT_EQ(SetServiceStatus(out), 0);
  EXPECT_EQ(ReadFile(kStatus), "owner=\"daemon\"\nstate=\"4\"\nerror=\"\"\n");

  ServiceStatus in;
  in.error = "stale";
  ASSERT_EQ(GetServiceStatus(in), 0);
  EXPECT_EQ(in.state, 4);
  EXPECT_EQ(in.error, "");

  // A number outside the enumeration is taken as it stands.
  WriteFile(kStatus, "state=\"-3\"\nerror=\"x\"\n");
  ASSERT_EQ(GetServiceStatus(in), 0);
  EXPECT_EQ(in.state, -3);
}

TEST_F(ServiceStatusTest, ReadFailsWithoutEitherKey) {
  LogCapture log;
  ServiceStatus in;
  EXPECT_EQ(GetServiceStatus(in), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to get plovo service state.")) << log.Dump();

  // Without "error" the read fails, though the state it read stays.
  WriteFile(kStatus, "state=\"4\"\n");
  EXPECT_EQ(GetServiceStatus(in), -1);
  EXPECT_EQ(in.state, 4);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to get plovo service error state.")) << log.Dump();
}

TEST_F(ServiceStatusTest, LockFileThatCannotBeCreatedFailsReadAndWrite) {
  // A folder where the lock file belongs cannot be opened for writing, even
  // by root.
  MakeDir("/var/packages/Plovo/etc/status.lock");
  WriteStatus(4, "");
  LogCapture log;
  ServiceStatus st;
  EXPECT_EQ(GetServiceStatus(st), -1);
  st.state = 6;
  EXPECT_EQ(SetServiceStatus(st), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to open plovo status lock file.")) << log.Dump();
  EXPECT_EQ(ReadFile(kStatus), "state=\"4\"\nerror=\"\"\n");
}

using plovo_test::Bounded;

TEST_F(ServiceStatusTest, StatusFileThatIsNotARegularFileFailsReadAndWrite) {
  const std::string status = Path(kStatus);
  const struct {
    const char* name;
    std::function<int()> make;
  } cases[] = {
      // A reader would wait for a writer.
      {"fifo", [&] { return mkfifo(status.c_str(), 0600); }},
      // A reader would never reach the end.
      {"link to /dev/zero", [&] { return symlink("/dev/zero", status.c_str()); }},
  };
  // Lets a reader blocked on opening the FIFO go on.
  auto release = [&] { close(open(status.c_str(), O_WRONLY | O_NONBLOCK)); };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    unlink(status.c_str());
    ASSERT_EQ(c.make(), 0);
    LogCapture log;
    EXPECT_EQ(Bounded([] { ServiceStatus st; return GetServiceStatus(st); }, release), -1);
    EXPECT_EQ(Bounded([] { ServiceStatus st; st.state = 4; return SetServiceStatus(st); }, release),
              -1);
    EXPECT_TRUE(log.Contains(LOG_ERR, "Plovo status file is not a regular file")) << log.Dump();
    struct stat info {};
    EXPECT_TRUE(lstat(status.c_str(), &info) == 0 && !S_ISREG(info.st_mode));
  }
}

TEST_F(ServiceStatusTest, LockHeldElsewhereFailsAfterTheWait) {
  WriteStatus(4, "");
  // flock conflicts between open file descriptions, even in one process.
  const int holder = open(Path("/var/packages/Plovo/etc/status.lock").c_str(),
                          O_RDWR | O_CREAT | O_CLOEXEC, 0440);
  ASSERT_GE(holder, 0);
  ASSERT_EQ(flock(holder, LOCK_EX), 0);
  SetServiceStatusLockWait(std::chrono::seconds(1));
  LogCapture log;
  auto release = [&] { flock(holder, LOCK_UN); };
  EXPECT_EQ(Bounded([] { ServiceStatus st; return GetServiceStatus(st); }, release), -1);
  EXPECT_EQ(Bounded([] { ServiceStatus st; st.state = 6; return SetServiceStatus(st); }, release),
            -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to lock file.")) << log.Dump();
  EXPECT_EQ(ReadFile(kStatus), "state=\"4\"\nerror=\"\"\n");

  // Once the holder lets go, the same read succeeds.
  flock(holder, LOCK_UN);
  close(holder);
  ServiceStatus st;
  EXPECT_EQ(GetServiceStatus(st), 0);
  EXPECT_EQ(st.state, 4);
}

TEST_F(ServiceStatusTest, LockFileIsCreatedReadOnly) {
  ServiceStatus st;
  st.state = 2;
  ASSERT_EQ(SetServiceStatus(st), 0);
  struct stat info {};
  ASSERT_EQ(stat(Path("/var/packages/Plovo/etc/status.lock").c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 0777, 0440u);
}

TEST_F(ServiceStatusTest, FailedStateWriteLeavesErrorUnwritten) {
  WriteStatus(4, "");
  VeltDevFailCall("VLIBCFileSetKeyValue", 1, 1, VLIBC_ERR_IO);
  LogCapture log;
  ServiceStatus st;
  st.state = 7;
  st.error = "err_sys";
  EXPECT_EQ(SetServiceStatus(st), -1);
  EXPECT_TRUE(log.Contains("Failed to set plovo service state to [7].")) << log.Dump();
  EXPECT_EQ(ReadFile(kStatus), "state=\"4\"\nerror=\"\"\n");

  VeltDevFailCall("VLIBCFileSetKeyValue", 2, 1, VLIBC_ERR_IO);
  EXPECT_EQ(SetServiceStatus(st), -1);
  EXPECT_TRUE(log.Contains("Failed to set plovo service error to [err_sys].")) << log.Dump();
}

TEST_F(ServiceStatusTest, ConcurrentWritersNeverMixTheirPairs) {
  WriteStatus(2, "writer_2");
  constexpr int kRounds = 500;
  // Each writer process writes its own consistent pair while this process
  // reads: without the lock a reader sees one writer's state with the
  // other's error, and the file can be left holding a mixed pair.
  auto writer = [](int state) {
    ServiceStatus st;
    st.state = state;
    st.error = "writer_" + std::to_string(state);
    for (int i = 0; i < kRounds; ++i) {
      if (SetServiceStatus(st) != 0) _exit(2);
    }
    _exit(0);
  };
  pid_t children[2];
  children[0] = fork();
  if (children[0] == 0) writer(2);
  children[1] = fork();
  if (children[1] == 0) writer(3);

  int mixed = 0;
  int running = 2;
  while (running > 0) {
    ServiceStatus seen;
    ASSERT_EQ(GetServiceStatus(seen), 0);
    if (seen.error != "writer_" + std::to_string(seen.state)) ++mixed;
    for (pid_t& child : children) {
      int status = 0;
      if (child > 0 && waitpid(child, &status, WNOHANG) == child) {
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
        child = -1;
        --running;
      }
    }
  }
  EXPECT_EQ(mixed, 0);
  ServiceStatus last;
  ASSERT_EQ(GetServiceStatus(last), 0);
  EXPECT_EQ(last.error, "writer_" + std::to_string(last.state));
}

using PackageStateTest = plovo_test::SandboxTest;

TEST_F(PackageStateTest, PackageEnabledByItsFlagFile) {
  EXPECT_FALSE(IsPkgEnable());
  WriteFile("/var/packages/Plovo/enabled", "");
  EXPECT_TRUE(IsPkgEnable());
}

TEST_F(PackageStateTest, RepositoryChecksTellUsbVolumesFromInternalOnes) {
  MakeDir("/volume1");
  MakeDir("/usb1");
  MakeDir("/volume3");
  DeclareVolumes({{"volume1"},
                  {"usb1", true, true, "external"},
                  {"volume2", false},
                  {"volume3", true, false}});
  LogCapture log;
  EXPECT_TRUE(IsRepoMounted(Path("/volume1")));
  EXPECT_TRUE(IsRepoValid(Path("/volume1")));

  EXPECT_TRUE(IsRepoMounted(Path("/usb1")));
  EXPECT_FALSE(IsRepoValid(Path("/usb1")));
  EXPECT_TRUE(log.Contains("volume not internal (2)")) << log.Dump();

  EXPECT_FALSE(IsRepoValid(Path("/volume3")));
  EXPECT_TRUE(log.Contains("volume not mounted or writable")) << log.Dump();

  EXPECT_FALSE(IsRepoMounted(Path("/volume2")));
  EXPECT_TRUE(log.Contains("Repo volumn path not exist '" + Path("/volume2") + "'"));
  MakeDir("/volume2");
  EXPECT_FALSE(IsRepoMounted(Path("/volume2")));
  EXPECT_TRUE(log.Contains("Plovo repo NOT mounted '" + Path("/volume2") + "'"));
  EXPECT_FALSE(IsRepoValid(Path("/volume2")));

  EXPECT_FALSE(IsRepoMounted(""));
  EXPECT_FALSE(IsRepoValid(""));
}

TEST_F(PackageStateTest, DaemonLivenessFromPidFile) {
  EXPECT_EQ(StatusService(), 3);
  WriteFile("/var/run/plovod.pid", "garbage\n");
  EXPECT_EQ(StatusService(), 3);

  WriteFile("/var/run/plovod.pid", std::to_string(getpid()) + "\n");
  EXPECT_EQ(StatusService(), 0);

  pid_t child = fork();
  if (child == 0) _exit(0);
  ASSERT_EQ(waitpid(child, nullptr, 0), child);
  WriteFile("/var/run/plovod.pid", std::to_string(child) + "\n");
  EXPECT_EQ(StatusService(), 1);
}

}  // namespace
