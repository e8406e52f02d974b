#include "service/service-ctrl.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <velt/dev.h>

#include <chrono>
#include <functional>
#include <string>

#include "bounded.h"
#include "sandbox.h"

namespace {

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

TEST_F(ServiceStatusTest, WrittenPairReadsBackAndKeepsOtherLinesUnderAReadOnlyLock) {
  WriteFile(kStatus, "owner=\"daemon\"\nstate=\"7\"\nerror=\"err_sys\"\n");
  ServiceStatus out;
  out.state = PLOVO_SERVICE_STATUS_RUNNING;
  ASSERT_EQ(SetServiceStatus(out), 0);
  EXPECT_EQ(ReadFile(kStatus), "owner=\"daemon\"\nstate=\"4\"\nerror=\"\"\n");

  ServiceStatus in;
  in.error = "stale";
  ASSERT_EQ(GetServiceStatus(in), 0);
  EXPECT_EQ(in.state, 4);
  EXPECT_EQ(in.error, "");
  struct stat info {};
  ASSERT_EQ(stat(Path("/var/packages/Plovo/etc/status.lock").c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 0777, 0440u);
}

TEST_F(ServiceStatusTest, LockFileThatCannotBeCreatedFailsReadAndWrite) {
  // A folder where the lock file belongs cannot be opened for writing, even
  // by root.
  MakeDir("/var/packages/Plovo/etc/status.lock");
  WriteStatus(4, "");
  ServiceStatus st;
  EXPECT_EQ(GetServiceStatus(st), -1);
  st.state = 6;
  EXPECT_EQ(SetServiceStatus(st), -1);
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
    EXPECT_EQ(Bounded([] { ServiceStatus st; return GetServiceStatus(st); }, release), -1);
    EXPECT_EQ(Bounded([] { ServiceStatus st; st.state = 4; return SetServiceStatus(st); }, release),
              -1);
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
  auto release = [&] { flock(holder, LOCK_UN); };
  EXPECT_EQ(Bounded([] { ServiceStatus st; return GetServiceStatus(st); }, release), -1);
  EXPECT_EQ(Bounded([] { ServiceStatus st; st.state = 6; return SetServiceStatus(st); }, release),
            -1);
  EXPECT_EQ(ReadFile(kStatus), "state=\"4\"\nerror=\"\"\n");

  // Once the holder lets go, the same read succeeds.
  flock(holder, LOCK_UN);
  close(holder);
  ServiceStatus st;
  EXPECT_EQ(GetServiceStatus(st), 0);
  EXPECT_EQ(st.state, 4);
}

TEST_F(ServiceStatusTest, FailedStateWriteLeavesErrorUnwritten) {
  WriteStatus(4, "");
  VeltDevFailCall("VLIBCFileSetKeyValue", 1, 1, VLIBC_ERR_IO);
  ServiceStatus st;
  st.state = 7;
  st.error = "err_sys";
  EXPECT_EQ(SetServiceStatus(st), -1);
  EXPECT_EQ(ReadFile(kStatus), "state=\"4\"\nerror=\"\"\n");
  VeltDevFailCall("VLIBCFileSetKeyValue", 2, 1, VLIBC_ERR_IO);
  EXPECT_EQ(SetServiceStatus(st), -1);
}

// A writer in another process and this one, each writing its own
// consistent pair and reading between: without the lock around both keys a
// reader sees one writer's state with the other's error.
TEST_F(ServiceStatusTest, ConcurrentWritersNeverMixTheirPairs) {
  auto pair = [](int state) {
    ServiceStatus st;
    st.state = state;
    st.error = "writer_" + std::to_string(state);
    return st;
  };
  WriteStatus(2, "writer_2");
  const pid_t child = fork();
  if (child == 0) {
    for (int i = 0; i < 500; ++i) {
      if (SetServiceStatus(pair(3)) != 0) _exit(2);
    }
    _exit(0);
  }
  int mixed = 0, failed = 0;
  for (int i = 0; i < 500; ++i) {
    ServiceStatus seen;
    if (SetServiceStatus(pair(2)) != 0 || GetServiceStatus(seen) != 0) ++failed;
    if (seen.error != "writer_" + std::to_string(seen.state)) ++mixed;
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_EQ(failed, 0);
  EXPECT_EQ(mixed, 0);
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
  EXPECT_TRUE(IsRepoMounted(Path("/volume1")) && IsRepoValid(Path("/volume1")));
  EXPECT_TRUE(IsRepoMounted(Path("/usb1")));
  EXPECT_FALSE(IsRepoValid(Path("/usb1")));
  EXPECT_FALSE(IsRepoValid(Path("/volume3")));  // not writable
  EXPECT_FALSE(IsRepoMounted(Path("/volume2")));
  MakeDir("/volume2");
  EXPECT_FALSE(IsRepoMounted(Path("/volume2")));
  EXPECT_FALSE(IsRepoValid(Path("/volume2")));

  EXPECT_FALSE(IsRepoMounted(""));
  EXPECT_FALSE(IsRepoValid(""));
}

TEST_F(PackageStateTest, DaemonLivenessFromPidFile) {
  EXPECT_EQ(StatusService(), 3);
  for (const char* bad : {"garbage\n", "12ab\n", "0\n"}) {  // 0 would probe our own process group
    WriteFile("/var/run/plovod.pid", bad);
    EXPECT_EQ(StatusService(), 3) << bad;
  }

  WriteFile("/var/run/plovod.pid", std::to_string(getpid()) + "\n");
  EXPECT_EQ(StatusService(), 0);

  pid_t child = fork();
  if (child == 0) _exit(0);
  ASSERT_EQ(waitpid(child, nullptr, 0), child);
  WriteFile("/var/run/plovod.pid", std::to_string(child) + "\n");
  EXPECT_EQ(StatusService(), 1);
}

}  // namespace
