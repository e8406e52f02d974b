#include "common/file-op.h"

#include <fcntl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>
#include <velt/dev.h>
#include <velt/ea.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "log-capture.h"
#include "sandbox.h"

namespace {

namespace fs = std::filesystem;
using plovo_test::LogCapture;

class FileOpTest : public plovo_test::SandboxTest {
 protected:
  // Pseudo-random bytes, so that a block copied to the wrong offset shows.
  static std::string Bytes(size_t n, unsigned seed) {
    std::mt19937 gen(seed);
    std::string s(n, '\0');
    for (char& c : s) c = static_cast<char>(gen());
    return s;
  }
  static std::string Slurp(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
  }
};

TEST_F(FileOpTest, GetFileInfoDescribesKindsWithoutFollowingLinks) {
  WriteFile("/f", "12345");
  MakeDir("/d");
  ASSERT_EQ(symlink(Path("/d").c_str(), Path("/link").c_str()), 0);
  ASSERT_EQ(mkfifo(Path("/fifo").c_str(), 0600), 0);
  const std::pair<const char*, int> kinds[] = {{"/f", 1}, {"/d", 2}, {"/link", 3}, {"/fifo", 6}};
  for (const auto& [name, type] : kinds) {
    LocalFileInfo info;
    ASSERT_EQ(GetFileInfo(Path(name), info), 0) << name;
    EXPECT_TRUE(info.exists) << name;
    EXPECT_EQ(info.type, type) << name;
    EXPECT_EQ(info.name, std::string(name + 1));
    if (type == 1) {
      EXPECT_EQ(info.size, 5);
    }
  }

  LocalFileInfo missing;
  missing.size = 99;
  EXPECT_EQ(GetFileInfo(Path("/no/such"), missing), 0);
  EXPECT_FALSE(missing.exists);
  EXPECT_EQ(missing.type, 1);
  EXPECT_EQ(missing.size, 0);
  EXPECT_EQ(missing.name, "such");
  EXPECT_EQ(GetFileInfo(Path("/f/below"), missing), 0) << "ENOTDIR counts as missing";
}

TEST_F(FileOpTest, MKDirCreatesOrAcceptsFoldersAndRefusesFiles) {
  EXPECT_EQ(FSMKDir(Path("/a/b/c"), true, -1, -1), 0);
  EXPECT_TRUE(fs::is_directory(Path("/a/b/c")));
  EXPECT_EQ(FSMKDir(Path("/a/b/c"), false, -1, -1), 0);
  EXPECT_EQ(FSMKDir(Path("/x/y"), false, -1, -1), -2) << "parent missing, not recursive";

  WriteFile("/file", "");
  LogCapture log;
  EXPECT_EQ(FSMKDir(Path("/file"), true, -1, -1), -1);
  ASSERT_EQ(log.Lines().size(), 1u) << log.Dump();
  EXPECT_EQ(log.Lines()[0].text.rfind("[ERR] file-op(", 0), 0u) << log.Dump();
  EXPECT_TRUE(log.Contains(LOG_ERR, "): FSMKDir: Create a folder but local file system is not directory '1'"));
  EXPECT_EQ(FSMKDirP(Path("/file/sub"), -1, -1), -1);
}

TEST_F(FileOpTest, KernelCopyIsExactIncludingTailAndEmptyFiles) {
  const std::string data = Bytes((3 << 20) + 7, 1);
  WriteFile("/src", data);
  EXPECT_EQ(FSCopy(Path("/src"), Path("/dst"), false), 0);
  EXPECT_TRUE(ReadFile("/dst") == data);

  // Overwrite a longer file: it must be truncated.
  WriteFile("/short", "abc");
  EXPECT_EQ(FSCopy(Path("/short"), Path("/dst"), true), 0);
  EXPECT_EQ(ReadFile("/dst"), "abc");
  EXPECT_FALSE(Exists("/short"));

  WriteFile("/empty", "");
  EXPECT_EQ(FSCopy(Path("/empty"), Path("/dst"), false), 0);
  EXPECT_EQ(ReadFile("/dst"), "");

  LogCapture log;
  EXPECT_EQ(FSCopy(Path("/src"), Path("/src"), false), -1);
  EXPECT_TRUE(ReadFile("/src") == data) << "a copy onto itself must not truncate the source";
  EXPECT_EQ(FSCopy(Path("/none"), Path("/dst"), false), -1);
  EXPECT_TRUE(log.Contains("CopyFile: open(" + Path("/none") + "): No such file or directory (2)"))
      << log.Dump();
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

TEST_F(FileOpTest, CopyOntoAFullDeviceGivesMinusTwoAndKeepsTheSource) {
  WriteFile("/src", Bytes(4096, 3));
  LogCapture log;
  EXPECT_EQ(FSCopy(Path("/src"), "/dev/full", true), -2);
  EXPECT_TRUE(log.Contains(LOG_ERR, "CopyFile: write: No space left on device (28)")) << log.Dump();
  EXPECT_TRUE(Exists("/src"));
}

// A real full disk: a 1 MiB tmpfs mounted in the sandbox. The kernel copy
// runs out of room part-way; what it wrote stays.
TEST_F(FileOpTest, CopyOntoAFullFileSystemLeavesThePartialFile) {
  MakeDir("/small");
  if (mount("tmpfs", Path("/small").c_str(), "tmpfs", 0, "size=1m") != 0) {
    GTEST_SKIP() << "cannot mount a tmpfs here: " << std::strerror(errno);
  }
  struct Unmount {
    std::string path;
    ~Unmount() { umount2(path.c_str(), MNT_DETACH); }
  } unmount{Path("/small")};
  WriteFile("/src", Bytes(3 << 20, 4));
  LogCapture log;
  EXPECT_EQ(FSCopy(Path("/src"), Path("/small/copy"), true), -2);
  EXPECT_TRUE(log.Contains(LOG_ERR, "No space left on device (28)")) << log.Dump();
  struct stat st;
  ASSERT_EQ(stat(Path("/small/copy").c_str(), &st), 0);
  EXPECT_GT(st.st_size, 0);
  EXPECT_LT(st.st_size, 3 << 20);
  EXPECT_TRUE(Exists("/src"));
}

// Files and folders on the sandbox's disk, moved to a tmpfs.
TEST_F(FileOpTest, RenameAcrossFileSystemsMovesTheTreeAndRemovesTheSource) {
  struct stat here, shm;
  if (stat("/dev/shm", &shm) != 0) GTEST_SKIP() << "no /dev/shm";
  ASSERT_EQ(stat(Root().c_str(), &here), 0);
  if (here.st_dev == shm.st_dev) GTEST_SKIP() << "/dev/shm is on the sandbox's file system";
  char tmpl[] = "/dev/shm/plovo-fo-XXXXXX";
  ASSERT_NE(mkdtemp(tmpl), nullptr);
  const std::string other = tmpl;

  const std::string big = Bytes((1 << 20) + 3, 4);
  WriteFile("/tree/top", "top");
  WriteFile("/tree/sub/big", big);
  WriteFile("/tree/sub/deeper/leaf", "leaf");
  MakeDir("/tree/empty");
  const std::string dst = other + "/moved";
  EXPECT_EQ(FSRename(Path("/tree"), dst), 0);
  EXPECT_FALSE(Exists("/tree"));
  std::vector<std::string> found;
  for (const auto& e : fs::recursive_directory_iterator(dst)) {
    found.push_back(e.path().string().substr(dst.size()));
  }
  std::sort(found.begin(), found.end());
  EXPECT_EQ(found, (std::vector<std::string>{"/empty", "/sub", "/sub/big", "/sub/deeper",
                                             "/sub/deeper/leaf", "/top"}));
  EXPECT_TRUE(Slurp(dst + "/sub/big") == big);
  EXPECT_EQ(Slurp(dst + "/sub/deeper/leaf"), "leaf");

  // A single file the other way.
  EXPECT_EQ(FSRename(dst + "/top", Path("/back")), 0);
  EXPECT_EQ(ReadFile("/back"), "top");
  EXPECT_FALSE(fs::exists(dst + "/top"));
  std::error_code ec;
  fs::remove_all(other, ec);
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
  ASSERT_EQ(rel.size(), 8u) << "a link is reported, not followed";
  EXPECT_EQ(rel[0], "");
  auto at = [&](const std::string& p) { return std::find(rel.begin(), rel.end(), p) - rel.begin(); };
  std::vector<std::string> sorted(rel);
  std::sort(sorted.begin(), sorted.end());
  EXPECT_EQ(sorted, (std::vector<std::string>{"", "/a", "/e", "/link", "/s", "/s/b", "/s/u", "/s/u/c"}));
  EXPECT_LT(at("/s"), at("/s/b"));
  EXPECT_LT(at("/s"), at("/s/u"));
  EXPECT_LT(at("/s/u"), at("/s/u/c"));

  Walk first;
  first.failAt = 0;
  EXPECT_EQ(TraverseDir(Path("/t"), Record, &first), -2);
  EXPECT_EQ(first.seen.size(), 1u);
  Walk later;
  later.failAt = 3;
  EXPECT_EQ(TraverseDir(Path("/t"), Record, &later), -2);
  EXPECT_EQ(later.seen.size(), 4u);
  EXPECT_EQ(TraverseDir(Path("/t/a"), Record, &walk), -1) << "not a folder";
}

TEST_F(FileOpTest, RemoveTakesTheTreeAndItsAttributeStores) {
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
}

TEST_F(FileOpTest, AttributeStoreFailureGivesMinusThree) {
  WriteFile("/f", "");
  VeltDevFailCall("VELTEARemove", 1, 1, VLIBC_ERR_IO);
  LogCapture log;
  EXPECT_EQ(FSRemove(Path("/f"), false), -3);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Failed to remove ea '" + Path("/f") + "', [5, Input/output error]"))
      << log.Dump();
  EXPECT_FALSE(Exists("/f"));

  EXPECT_EQ(VELTEARemove(nullptr, -1, 0), -1);
  EXPECT_EQ(VLIBCErrGet(), VLIBC_ERR_BAD_PARAMETER);
  WriteFile("/w/@eaDir", "a file, not a store");
  EXPECT_EQ(VELTEARemove(Path("/w/x").c_str(), -1, 0), 0);
}

TEST_F(FileOpTest, ConfigIsWrittenOnAFreshDeviceAndReadBack) {
  MakeDir("/usb1");
  const std::string dev = Path("/usb1");
  std::string value = "stale";
  EXPECT_EQ(ReadPlovoConfig(dev, "uuid", value), 0) << "no file yet";
  EXPECT_EQ(value, "");

  EXPECT_EQ(WritePlovoConfig(dev, "uuid", "5b7c8e2a-0d1f-4c3b-9a6e-7f1d2c3b4a50"), 0);
  EXPECT_EQ(ReadFile("/usb1/@eaDir/.VeltraPlovo.config"),
            "uuid=\"5b7c8e2a-0d1f-4c3b-9a6e-7f1d2c3b4a50\"\n");
  EXPECT_EQ(ReadPlovoConfig(dev, "uuid", value), 1);
  EXPECT_EQ(value, "5b7c8e2a-0d1f-4c3b-9a6e-7f1d2c3b4a50");
  EXPECT_EQ(ReadPlovoConfig(dev, "other", value), 0);

  // Longer than the first buffer, and exactly filling it: read in full.
  for (size_t n : {1023u, 5000u}) {
    const std::string longValue(n, 'v');
    ASSERT_EQ(WritePlovoConfig(dev, "note", longValue), 0);
    EXPECT_EQ(ReadPlovoConfig(dev, "note", value), 1);
    EXPECT_EQ(value.size(), n);
  }

  EXPECT_EQ(WritePlovoConfig(dev, "uuid", ""), -1);
  LogCapture log;
  VeltDevFailCall("VLIBCFileSetKeyValue", 1, 1, VLIBC_ERR_IO);
  EXPECT_EQ(WritePlovoConfig(dev, "uuid", "x"), -1);
  EXPECT_TRUE(log.Contains("VLIBCFileSetKeyValue() failed, path=[" + PlovoConfigPath(dev) +
                           "], key = uuid, value = x"))
      << log.Dump();
  EXPECT_EQ(WritePlovoConfig(Path("/no-device"), "uuid", "x"), -1);
}

}  // namespace
