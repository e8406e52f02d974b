// The repository's move between volumes, with plovod running as the
// package's daemon.
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <map>
#include <thread>

#include "emulation.h"
#include "log-capture.h"
#include "service-sandbox.h"
#include "service/repo-volume.h"

namespace {

// A move from volume1 to volume2 while the service runs. Whether or not it
// moves, the service ends up running on the volume that holds the repository.
struct MoveCase {
  const char* name;
  const char* targetFile;  // written on volume2 before the move, if any
  bool tmpfs;              // volume2 is a 256 KiB tmpfs, too small for the repository
  // Two requests at once (a double click): the second waits for the first, rather
  // than clearing the staging place under its copy, and finds the repository moved.
  bool twice;
  bool moved;
};
const MoveCase kMoveCases[] = {
    {"WithoutTmpFolder", nullptr, false, false, true},
    {"WithLeftoverStagingCopy", "/volume2/@tmp/@Plovo/db/task-db.sqlite", false, false, true},
    {"HoldingARepository", "/volume2/@Plovo/db/task-db.sqlite", false, false, false},
    {"TooSmall", nullptr, true, false, false},
    {"TwiceAtOnce", nullptr, false, true, true},
};

class RepoMoveTest : public plovo_test::ServiceSandboxTest, public testing::WithParamInterface<MoveCase> {
 protected:
  // Every entry under dir: a hash of a file's bytes, "/" for a folder.
  // SQLite's "-wal" and "-shm" files come and go with its connections.
  std::map<std::string, std::string> Files(const std::string& dir) const {
    std::map<std::string, std::string> files;
    std::error_code ec;
    for (std::filesystem::recursive_directory_iterator it(Path(dir), ec), end; !ec && it != end; it.increment(ec)) {
      const std::string name = it->path().string().substr(Path(dir).size());
      const std::string ext = it->path().extension().string();
      if (ext != ".sqlite-wal" && ext != ".sqlite-shm")
        files[name] = it->is_directory() ? "/" : std::to_string(std::hash<std::string>()(ReadFile(dir + name)));
    }
    return files;
  }
};

TEST_F(RepoMoveTest, SameOrEmptyTargetIsNoMove) {
  plovo_test::LogCapture log;
  EXPECT_TRUE(ChangeRepoVolume(Path("/volume2"), Path("/volume2")));  // nothing to do, whatever the record says
  EXPECT_FALSE(ChangeRepoVolume(Path("/volume2"), ""));
  EXPECT_TRUE(log.Contains("to_volume is empty")) << log.Dump();
}

TEST_P(RepoMoveTest, RepositoryArrivesWholeOrStaysWhole) {
  PLOVO_SKIP_UNLESS_TARGET_PROGRAMS_RUN();
  const MoveCase& c = GetParam();
  if (c.tmpfs && mount("tmpfs", Path("/volume2").c_str(), "tmpfs", 0, "size=256k") != 0)
    GTEST_SKIP() << "cannot mount a tmpfs here: " << std::strerror(errno);
  ASSERT_EQ(StartService(), 0);
  for (int i = 0; i < 40; ++i)  // 480 KiB in nested folders
    WriteFile("/volume1/@Plovo/task/" + std::to_string(i % 5) + "/d" + std::to_string(i % 3) + "/f" + std::to_string(i),
              std::string(12 * 1024 + i, static_cast<char>(i)));
  if (c.targetFile) WriteFile(c.targetFile, "not the repository");
  const auto repo = Files("/volume1/@Plovo"), target = Files("/volume2/@Plovo");
  plovo_test::LogCapture log;
  std::thread second([&] { EXPECT_TRUE(!c.twice || ChangeRepoVolume(Path("/volume1"), Path("/volume2"))); });
  EXPECT_EQ(ChangeRepoVolume(Path("/volume1"), Path("/volume2")), c.moved) << log.Dump();
  second.join();
  const std::string at = c.moved ? "/volume2" : "/volume1", other = c.moved ? "/volume1" : "/volume2";
  EXPECT_EQ(Files(at + "/@Plovo"), repo);
  EXPECT_TRUE(Recorded(Path(at)));
  // The other volume: nothing left of the old repository, or the target untouched.
  EXPECT_EQ(Files(other + "/@Plovo"), c.moved ? decltype(target){} : target);
  // Old copies, retired or partial, are deleted in the background.
  for (int i = 0; i < 500 && (Exists("/volume1/@tmp/@Plovo") || Exists("/volume2/@tmp/@Plovo")); ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  EXPECT_FALSE(Exists("/volume1/@tmp/@Plovo") || Exists("/volume2/@tmp/@Plovo"));
  EXPECT_EQ(Status(), StateIs(4));
}

INSTANTIATE_TEST_SUITE_P(Targets, RepoMoveTest, testing::ValuesIn(kMoveCases),
                         [](const auto& info) { return std::string(info.param.name); });

}  // namespace
