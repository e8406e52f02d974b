// The repository folders and their move between volumes, with plovod-dev
// running as the package's daemon.
#include <signal.h>
#include <sys/mount.h>
#include <unistd.h>
#include <velt/vlibc.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <map>
#include <thread>

#include "common/paths.h"
#include "log-capture.h"
#include "sandbox.h"
#include "service/repo-volume.h"
#include "service/service-ctrl.h"

namespace {

namespace fs = std::filesystem;

class RepoMoveTest : public plovo_test::SandboxTest {
 protected:
  // The package enabled with plovod-dev as daemon; two volumes, neither
  // with its temporary folder yet.
  void SetUp() override {
    SandboxTest::SetUp();
    for (const char* dir : {"/var/packages/Plovo/target/sbin", "/var/packages/Plovo/etc",
                            "/var/run", "/tmp", "/volume1", "/volume2"}) {
      MakeDir(dir);
    }
    WriteFile("/var/packages/Plovo/enabled", "");
    WriteFile("/etc.defaults/veltinfo.conf", "plovo=\"yes\"\n");
    symlink(PLOVOD_DEV_PATH, Path("/var/packages/Plovo/target/sbin/plovod").c_str());
    DeclareVolumes({{"volume1"}, {"volume2"}});
  }
  void TearDown() override {
    if (Pid() > 0) kill(Pid(), SIGKILL);
    if (mounted_) umount2(Path("/volume2").c_str(), MNT_DETACH);
    SandboxTest::TearDown();
  }
  static int Pid() { return VLIBCReadPidFile(Plovo::Path::DaemonPidFile().c_str()); }
  std::string Volume(int n) const { return Root() + "/volume" + std::to_string(n); }
  // Every file and folder under dir by relative path: a hash of its bytes,
  // "/" for a folder. SQLite's "-wal" and "-shm" files come and go with the
  // database's connections and are left out.
  std::map<std::string, std::string> Files(const std::string& dir) const {
    std::map<std::string, std::string> files;
    std::error_code ec;
    for (fs::recursive_directory_iterator it(Path(dir), ec), end; !ec && it != end;
         it.increment(ec)) {
      const std::string name = it->path().string().substr(Path(dir).size());
      const std::string tail = name.substr(name.size() > 4 ? name.size() - 4 : 0);
      if (tail == "-wal" || tail == "-shm") continue;
      files[name] =
          it->is_directory() ? "/" : std::to_string(std::hash<std::string>()(ReadFile(dir + name)));
    }
    return files;
  }
  // Whether both records name the volume.
  bool Recorded(const std::string& volume) const {
    return ReadFile("/var/packages/Plovo/etc/veltpkg_conf/reg_volume") ==
               "[\"" + volume + "\"]\n" &&
           ReadFile("/var/packages/Plovo/etc/setting.conf")
                   .find("repo_vol_path=\"" + volume + "\"\n") == 0;
  }
  bool mounted_ = false;
};

TEST_F(RepoMoveTest, MakeRepoCreatesWhatIsMissingAndKeepsTheRest) {
  WriteFile("/volume1/@Plovo/task/1/user.config", "kept");
  WriteFile("/volume3", "a file, not a volume");
  plovo_test::LogCapture log;
  EXPECT_EQ(MakeRepo(Volume(1)), 0);
  EXPECT_TRUE(log.Lines().empty()) << log.Dump();
  EXPECT_TRUE(Exists("/volume1/@Plovo/db"));
  EXPECT_EQ(ReadFile("/volume1/@Plovo/task/1/user.config"), "kept");
  EXPECT_EQ(MakeRepo(""), -1);
  EXPECT_EQ(MakeRepo(Volume(3)), -1);
  EXPECT_TRUE(log.Contains("invalid volume path") &&
              log.Contains("fail to create plovo repo [" + Volume(3) + "/@Plovo]"))
      << log.Dump();
}

TEST_F(RepoMoveTest, SameOrEmptyTargetLeavesTheDaemonRunning) {
  ASSERT_EQ(StartService(), 0);
  const int pid = Pid();
  plovo_test::LogCapture log;
  EXPECT_TRUE(ChangeRepoVolume(Volume(1), Volume(1)));
  EXPECT_FALSE(ChangeRepoVolume(Volume(1), ""));
  EXPECT_TRUE(log.Contains("to_volume is empty")) << log.Dump();
  EXPECT_EQ(Pid(), pid);
  EXPECT_EQ(ReadFile("/var/packages/Plovo/etc/status"), "state=\"4\"\nerror=\"\"\n");
}

TEST_F(RepoMoveTest, WithoutRepositoryOneIsMadeOnTheTargetAndNothingCopied) {
  WriteFile("/volume3", "a file, not a volume");
  EXPECT_FALSE(ChangeRepoVolume("", Volume(3)));
  EXPECT_FALSE(Exists("/var/packages/Plovo/etc/setting.conf") || Exists("/var/run/plovod.pid"));

  WriteFile("/volume1/@Plovo/db/task-db.sqlite", "not recorded, not ours");
  EXPECT_TRUE(ChangeRepoVolume("", Volume(2)));
  EXPECT_TRUE(Exists("/volume2/@Plovo/task") && Exists("/volume2/@Plovo/db/task-db.sqlite"));
  EXPECT_NE(ReadFile("/volume2/@Plovo/db/task-db.sqlite"), "not recorded, not ours");
  EXPECT_TRUE(Recorded(Volume(2)));
  EXPECT_EQ(ReadFile("/var/packages/Plovo/etc/status"), "state=\"4\"\nerror=\"\"\n");
}

// Two requests for the same move at once (a double click): the second
// waits for the first and then finds the repository already there, rather
// than clearing the staging place under the first one's copy.
TEST_F(RepoMoveTest, TwoMovesAtOnceRunOneAfterTheOther) {
  ASSERT_EQ(StartService(), 0);
  for (int i = 0; i < 2000; ++i) {
    WriteFile("/volume1/@Plovo/task/" + std::to_string(i % 20) + "/f" + std::to_string(i),
              std::string(100 + i, 'x'));
  }
  const auto repo = Files("/volume1/@Plovo");
  bool results[2] = {};
  std::thread other([&] { results[0] = ChangeRepoVolume(Volume(1), Volume(2)); });
  results[1] = ChangeRepoVolume(Volume(1), Volume(2));
  other.join();
  EXPECT_TRUE(results[0] && results[1]);
  EXPECT_EQ(Files("/volume2/@Plovo"), repo);
  EXPECT_TRUE(Recorded(Volume(2)));
  EXPECT_EQ(ReadFile("/var/packages/Plovo/etc/status"), "state=\"4\"\nerror=\"\"\n");
  for (int i = 0; i < 500 && Exists("/volume1/@tmp/@Plovo"); ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
}

// A move from volume1 to volume2 while the service runs. Whether or not it
// moves, the service ends up running on the volume that holds the repository.
struct MoveCase {
  const char* name;
  const char* targetFile;  // written on volume2 before the move, if any
  bool tmpfs;              // volume2 is a 256 KiB tmpfs, too small for the repository
  bool moved;
};

void PrintTo(const MoveCase& c, std::ostream* out) { *out << c.name; }

class RepoMoveCaseTest : public RepoMoveTest, public testing::WithParamInterface<MoveCase> {};

TEST_P(RepoMoveCaseTest, RepositoryArrivesWholeOrStaysWhole) {
  const MoveCase& c = GetParam();
  if (c.tmpfs && mount("tmpfs", Path("/volume2").c_str(), "tmpfs", 0, "size=256k") != 0) {
    GTEST_SKIP() << "cannot mount a tmpfs here: " << std::strerror(errno);
  }
  mounted_ = c.tmpfs;
  ASSERT_EQ(StartService(), 0);
  for (int i = 0; i < 40; ++i) {  // 480 KiB in nested folders
    WriteFile("/volume1/@Plovo/task/" + std::to_string(i % 5) + "/d" + std::to_string(i % 3) +
                  "/f" + std::to_string(i),
              std::string(12 * 1024 + i, static_cast<char>(i)));
  }
  if (c.targetFile) WriteFile(c.targetFile, "not the repository");
  const auto repo = Files("/volume1/@Plovo"), target = Files("/volume2/@Plovo");
  const int pid = Pid();

  plovo_test::LogCapture log;
  EXPECT_EQ(ChangeRepoVolume(Volume(1), Volume(2)), c.moved) << log.Dump();
  const int repoVolume = c.moved ? 2 : 1;
  EXPECT_EQ(Files("/volume" + std::to_string(repoVolume) + "/@Plovo"), repo);
  EXPECT_TRUE(Recorded(Volume(repoVolume)));
  // The other volume: nothing left of the old repository, or the target untouched.
  EXPECT_EQ(Files("/volume" + std::to_string(3 - repoVolume) + "/@Plovo"),
            c.moved ? decltype(target){} : target);
  // Old copies, retired or partial, are deleted in the background.
  for (int i = 0; i < 500 && (Exists("/volume1/@tmp/@Plovo") || Exists("/volume2/@tmp/@Plovo"));
       ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  EXPECT_FALSE(Exists("/volume1/@tmp/@Plovo") || Exists("/volume2/@tmp/@Plovo"));
  EXPECT_EQ(ReadFile("/var/packages/Plovo/etc/status"), "state=\"4\"\nerror=\"\"\n");
  EXPECT_TRUE(Pid() > 0 && Pid() != pid && kill(Pid(), 0) == 0);
}

INSTANTIATE_TEST_SUITE_P(
    Targets, RepoMoveCaseTest,
    testing::Values(
        MoveCase{"WithoutTmpFolder", nullptr, false, true},
        MoveCase{"WithLeftoverStagingCopy", "/volume2/@tmp/@Plovo/db/task-db.sqlite", false, true},
        MoveCase{"HoldingARepository", "/volume2/@Plovo/db/task-db.sqlite", false, false},
        MoveCase{"TooSmall", nullptr, true, false}),
    [](const testing::TestParamInfo<MoveCase>& info) { return std::string(info.param.name); });

}  // namespace
