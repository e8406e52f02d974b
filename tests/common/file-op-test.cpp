#include "common/file-op.h"

#include <fcntl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>
#include <velt/dev.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "sandbox.h"

namespace {

namespace fs = std::filesystem;

class FileOpTest : public plovo_test::SandboxTest {
 protected:
  // Pseudo-random bytes, so that a block copied to the wrong offset shows.
  static std::string Bytes(size_t n, unsigned seed) {
    std::mt19937 gen(seed);
    std::string s(n, '\0');
    for (char& c : s) c = static_cast<char>(gen());
    return s;
  }
  void TearDown() override {
    for (const std::string& dir : mounted_) umount2(dir.c_str(), MNT_DETACH);
    SandboxTest::TearDown();
  }
  // A file system of its own at dir, so that the disk can fill and a move
  // can cross file systems; false where this host allows no mount.
  bool MountTmpfs(const std::string& dir, const char* options) {
    MakeDir(dir);
    if (mount("tmpfs", Path(dir).c_str(), "tmpfs", 0, options) != 0) return false;
    mounted_.push_back(Path(dir));
    return true;
  }
  std::vector<std::string> mounted_;
};

TEST_F(FileOpTest, GetFileInfoDescribesKindsWithoutFollowingLinks) {
  WriteFile("/f", "12345");
  MakeDir("/d");
  ASSERT_EQ(symlink(Path("/d").c_str(), Path("/link").c_str()), 0);
  ASSERT_EQ(mkfifo(Path("/fifo").c_str(), 0600), 0);
  const struct {
    const char* path;
    bool exists;
    int type;
    const char* name;
  } cases[] = {{"/f", true, 1, "f"},         {"/d", true, 2, "d"},        {"/link", true, 3, "link"},
               {"/fifo", true, 6, "fifo"},   {"/no/such", false, 1, "such"},
               {"/f/below", false, 1, "below"}};  // ENOTDIR counts as missing
  for (const auto& c : cases) {
    LocalFileInfo info;
    info.size = 99;
    ASSERT_EQ(GetFileInfo(Path(c.path), info), 0) << c.path;
    EXPECT_EQ(info.exists, c.exists) << c.path;
    EXPECT_EQ(info.type, c.type) << c.path;
    EXPECT_EQ(info.name, c.name);
    if (c.type == 1) {
      EXPECT_EQ(info.size, c.exists ? 5 : 0) << c.path;
    }
  }
}

TEST_F(FileOpTest, MKDirCreatesOrAcceptsFoldersAndRefusesFiles) {
  EXPECT_EQ(FSMKDir(Path("/a/b/c"), true, -1, -1), 0);
  EXPECT_TRUE(fs::is_directory(Path("/a/b/c")));
  EXPECT_EQ(FSMKDir(Path("/a/b/c"), false, -1, -1), 0);
  EXPECT_EQ(FSMKDir(Path("/x/y"), false, -1, -1), -2) << "parent missing, not recursive";

  WriteFile("/file", "");
  EXPECT_EQ(FSMKDir(Path("/file"), true, -1, -1), -1);
  EXPECT_EQ(FSMKDirP(Path("/file/sub"), -1, -1), -1);
}

TEST_F(FileOpTest, KernelCopyIsExactIncludingTailAndEmptyFiles) {
  const std::string data = Bytes((3 << 20) + 7, 1);
  WriteFile("/src", data);
  EXPECT_EQ(FSCopy(Path("/src"), Path("/dst"), false), 0);
  EXPECT_TRUE(ReadFile("/dst") == data);

  // Onto the longer copy: it must be truncated.
  WriteFile("/empty", "");
  EXPECT_EQ(FSCopy(Path("/empty"), Path("/dst"), true), 0);
  EXPECT_EQ(ReadFile("/dst"), "");
  EXPECT_FALSE(Exists("/empty"));

  EXPECT_EQ(FSCopy(Path("/src"), Path("/src"), false), -1);
  EXPECT_TRUE(ReadFile("/src") == data) << "a copy onto itself must not truncate the source";
  EXPECT_EQ(FSCopy(Path("/none"), Path("/dst"), false), -1);
}

TEST_F(FileOpTest, BufferLoopCopiesIntoAPipeAcrossSeveralBuffers) {
  // A pipe is no regular file, so the kernel copy is skipped; more than
  // 32 MiB makes the loop run twice and end on a partial buffer.
  const std::string data = Bytes((33 << 20) + 5, 2);
  WriteFile("/src", data);
  ASSERT_EQ(mkfifo(Path("/pipe").c_str(), 0600), 0);
  std::string received;
  std::thread reader([&] {
    int fd = open(Path("/pipe").c_str(), O_RDONLY);
    char buf[1 << 16];
    for (ssize_t n; fd >= 0 && (n = read(fd, buf, sizeof buf)) > 0;) received.append(buf, n);
    if (fd >= 0) close(fd);
  });
  EXPECT_EQ(FSCopy(Path("/src"), Path("/pipe"), false), 0);
  // Should FSCopy never have opened the pipe, the reader would wait for a
  // writer for ever; this one lets it see the end.
  int unblock = open(Path("/pipe").c_str(), O_WRONLY | O_NONBLOCK);
  if (unblock >= 0) close(unblock);
  reader.join();
  EXPECT_TRUE(received == data) << "received " << received.size() << " of " << data.size();
}

TEST_F(FileOpTest, CopyOntoAFullDiskGivesMinusTwoAndKeepsTheSource) {
  WriteFile("/src", Bytes(3 << 20, 4));
  EXPECT_EQ(FSCopy(Path("/src"), "/dev/full", true), -2);
  EXPECT_TRUE(Exists("/src"));

  // A real full disk: a 1 MiB tmpfs mounted in the sandbox. The kernel copy
  // runs out of room part-way; what it wrote stays.
  if (!MountTmpfs("/small", "size=1m")) GTEST_SKIP() << "cannot mount a tmpfs here: " << std::strerror(errno);
  EXPECT_EQ(FSCopy(Path("/src"), Path("/small/copy"), true), -2);
  struct stat st;
  ASSERT_EQ(stat(Path("/small/copy").c_str(), &st), 0);
  EXPECT_GT(st.st_size, 0);
  EXPECT_LT(st.st_size, 3 << 20);
  EXPECT_TRUE(Exists("/src"));
}

// Files and folders on the sandbox's disk, moved to a tmpfs.
TEST_F(FileOpTest, RenameAcrossFileSystemsMovesTheTreeAndRemovesTheSource) {
  if (!MountTmpfs("/other", "size=8m")) GTEST_SKIP() << "cannot mount a tmpfs here: " << std::strerror(errno);
  const std::string big = Bytes((1 << 20) + 3, 4);
  WriteFile("/tree/top", "top");
  WriteFile("/tree/sub/big", big);
  WriteFile("/tree/sub/deeper/leaf", "leaf");
  MakeDir("/tree/empty");
  const std::string dst = Path("/other/moved");
  EXPECT_EQ(FSRename(Path("/tree"), dst), 0);
  EXPECT_FALSE(Exists("/tree"));
  std::vector<std::string> found;
  for (const auto& e : fs::recursive_directory_iterator(dst)) {
    found.push_back(e.path().string().substr(dst.size()));
  }
  std::sort(found.begin(), found.end());
  EXPECT_EQ(found, (std::vector<std::string>{"/empty", "/sub", "/sub/big", "/sub/deeper",
                                             "/sub/deeper/leaf", "/top"}));
  EXPECT_TRUE(ReadFile("/other/moved/sub/big") == big);
  EXPECT_EQ(ReadFile("/other/moved/sub/deeper/leaf"), "leaf");

  // A single file the other way.
  EXPECT_EQ(FSRename(dst + "/top", Path("/back")), 0);
  EXPECT_EQ(ReadFile("/back"), "top");
  EXPECT_FALSE(Exists("/other/moved/top"));
}

TEST_F(FileOpTest, RenameResultCodes) {
  WriteFile("/f", "x");
  EXPECT_EQ(FSRename(Path("/f"), Path("/" + std::string(300, 'n'))), -100);
  EXPECT_EQ(FSRename(Path("/f"), Path("/missing/dir/h")), -3);
  EXPECT_EQ(FSRename(Path("/f"), Path("/g")), 0);
  EXPECT_EQ(FSRename(Path("/f"), Path("/h")), -2) << "source gone";
  EXPECT_EQ(ReadFile("/g"), "x");
}

struct Walk {
  std::vector<std::string> seen;
  size_t failAt = SIZE_MAX;  // index of the call that answers non-zero
};

int Record(const std::string& path, void* context) {
  auto* walk = static_cast<Walk*>(context);
  walk->seen.push_back(path);
  return walk->seen.size() - 1 == walk->failAt ? 1 : 0;
}

TEST_F(FileOpTest, TraverseVisitsEachFolderBeforeItsContentsAndStopsOnFailure) {
  WriteFile("/t/a", "");
  WriteFile("/t/s/b", "");
  WriteFile("/t/s/u/c", "");
  MakeDir("/t/e");
  ASSERT_EQ(symlink(Path("/t/s").c_str(), Path("/t/link").c_str()), 0);
  Walk walk;
  ASSERT_EQ(TraverseDir(Path("/t"), Record, &walk), 0);
  std::vector<std::string> rel;
  for (const auto& p : walk.seen) rel.push_back(p.substr(Path("/t").size()));
  for (size_t i = 1; i < rel.size(); ++i) {
    const auto seenBefore = rel.begin() + static_cast<long>(i);
    EXPECT_NE(std::find(rel.begin(), seenBefore, rel[i].substr(0, rel[i].rfind('/'))), seenBefore) << rel[i];
  }
  std::sort(rel.begin(), rel.end());  // a link is reported, not followed
  EXPECT_EQ(rel, (std::vector<std::string>{"", "/a", "/e", "/link", "/s", "/s/b", "/s/u", "/s/u/c"}));

  for (size_t failAt : {0u, 3u}) {
    Walk stopped;
    stopped.failAt = failAt;
    EXPECT_EQ(TraverseDir(Path("/t"), Record, &stopped), -2);
    EXPECT_EQ(stopped.seen.size(), failAt + 1);
  }
  EXPECT_EQ(TraverseDir(Path("/t/a"), Record, &walk), -1) << "not a folder";
}

TEST_F(FileOpTest, RemoveTakesTheTreeAndItsAttributeStoresOrFailsOnAStore) {
  EXPECT_EQ(FSRemove(Path("/none"), false), 0);
  // /v/d is removed; /v/@eaDir/d is its store, /v/@eaDir/keep another's.
  WriteFile("/v/d/f", "f");
  WriteFile("/v/d/@eaDir/f/thumb", "t");
  WriteFile("/v/d/sub/g", "g");
  WriteFile("/v/d/sub/@eaDir/g", "t");
  WriteFile("/v/@eaDir/d/index", "t");
  WriteFile("/v/@eaDir/keep", "k");
  EXPECT_EQ(FSRemove(Path("/v/d"), true), 0);
  EXPECT_FALSE(Exists("/v/d"));
  EXPECT_FALSE(Exists("/v/@eaDir/d"));
  EXPECT_TRUE(Exists("/v/@eaDir/keep"));
  // A store that cannot be removed fails the call, not the file's removal.
  WriteFile("/f", "");
  VeltDevFailCall("VELTEARemove", 1, 1, VLIBC_ERR_IO);
  EXPECT_EQ(FSRemove(Path("/f"), false), -3);
  EXPECT_FALSE(Exists("/f"));
}

TEST_F(FileOpTest, ConfigIsWrittenOnAFreshDeviceAndReadBack) {
  MakeDir("/usb1");
  const std::string dev = Path("/usb1");
  std::string value = "stale";
  EXPECT_EQ(ReadPlovoConfig(dev, "uuid", value), 0) << "no file yet";
  EXPECT_EQ(value, "");
  EXPECT_EQ(WritePlovoConfig(dev, "uuid", "5b7c"), 0);
  EXPECT_EQ(ReadFile("/usb1/@eaDir/.VeltraPlovo.config"), "uuid=\"5b7c\"\n");
  EXPECT_EQ(ReadPlovoConfig(dev, "other", value), 0);

  // Longer than the first buffer, and exactly filling it: read in full.
  for (size_t n : {1023u, 5000u}) {
    const std::string longValue(n, 'v');
    ASSERT_EQ(WritePlovoConfig(dev, "note", longValue), 0);
    EXPECT_EQ(ReadPlovoConfig(dev, "note", value), 1);
    EXPECT_EQ(value.size(), n);
  }

  EXPECT_EQ(WritePlovoConfig(dev, "uuid", ""), -1);
  VeltDevFailCall("VLIBCFileSetKeyValue", 1, 1, VLIBC_ERR_IO);
  EXPECT_EQ(WritePlovoConfig(dev, "uuid", "x"), -1);
}

}  // namespace
