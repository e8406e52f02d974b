// Key/value files and the last error.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <velt/vlibc.h>

#include <cstring>
#include <filesystem>
#include <functional>
#include <vector>

#include "bounded.h"
#include "sandbox.h"

namespace {

const char* const kFormat = "%s=\"%s\"\n";

class KeyValueTest : public plovo_test::SandboxTest {
 protected:
  const std::string kFile = "/etc/test.conf";
  const char* F() { return (file_ = Path(kFile)).c_str(); }
  int Set(const char* key, const char* value) {
    return VLIBCFileSetKeyValue(F(), key, value, kFormat);
  }
  // The value of key, or "<rc>" when the call returns below 1.
  std::string Get(const char* key, size_t size = 64) {
    std::vector<char> buf(size, 'X');
    int rc = VLIBCFileGetKeyValue(F(), key, buf.data(), size, 0);
    if (rc < 1) return "<" + std::to_string(rc) + ">";
    EXPECT_EQ(static_cast<size_t>(rc), std::strlen(buf.data()) + 1);
    return buf.data();
  }
  std::string file_;
};

TEST_F(KeyValueTest, SetReplacesItsLineAndKeepsTheRest) {
  WriteFile(kFile, "# note\nstate2=\"9\"\nstate=\"1\"\nnot a pair\nstate=\"dup\"\nlast=\"x\"");
  ASSERT_EQ(0, Set("state", "4"));  // the first line takes the value, duplicates go
  ASSERT_EQ(0, Set("new", "a b"));  // appended after a last line lacking its newline
  EXPECT_EQ("# note\nstate2=\"9\"\nstate=\"4\"\nnot a pair\nlast=\"x\"\nnew=\"a b\"\n",
            ReadFile(kFile));
  EXPECT_LT(Set("bad", "two\nlines"), 0);
  EXPECT_EQ(VLIBC_ERR_BAD_PARAMETER, VLIBCErrGet());
}

TEST_F(KeyValueTest, GetMatchesWholeKeysAndCutsToBuffer) {
  WriteFile(kFile, "state2=\"9\"\nxstate=\"8\"\nerror=\"\"\nstate=\"running\"\nraw=a b\n");
  EXPECT_EQ("running", Get("state"));
  EXPECT_EQ("", Get("error"));  // found, so 1 and not 0
  EXPECT_EQ("a b", Get("raw"));
  EXPECT_EQ("runn", Get("state", 5));
  EXPECT_EQ("<0>", Get("stat"));
}

TEST_F(KeyValueTest, NewFileIs0644AndRewriteKeepsModeWithoutLeftovers) {
  MakeDir("/etc");
  mode_t oldMask = umask(077);
  int rc = Set("a", "1");
  umask(oldMask);
  struct stat st;
  ASSERT_TRUE(rc == 0 && stat(F(), &st) == 0);
  EXPECT_EQ(0644u, st.st_mode & 07777);
  ASSERT_TRUE(chmod(F(), 0600) == 0 && Set("a", "2") == 0 && stat(F(), &st) == 0);
  EXPECT_EQ(0600u, st.st_mode & 07777);
  EXPECT_EQ(1, std::distance(std::filesystem::directory_iterator(Path("/etc")), {}));
}

using plovo_test::Bounded;

TEST_F(KeyValueTest, OnlyRegularFilesUpToOneMebibyteAreRead) {
  const std::string line = "a=\"1\"\n";
  auto padded = [&](size_t size) { return line + std::string(size - line.size() - 1, '#') + "\n"; };
  const char* file = F();
  const struct {
    const char* name;
    std::function<void()> make;
    bool readable;
  } cases[] = {
      {"regular", [&] { WriteFile(kFile, line); }, true},
      {"exactly 1 MiB", [&] { WriteFile(kFile, padded(1 << 20)); }, true},
      {"1 MiB and a byte", [&] { WriteFile(kFile, padded((1 << 20) + 1)); }, false},
      {"fifo", [&] { ASSERT_EQ(0, mkfifo(file, 0600)); }, false},
      {"link to /dev/zero", [&] { ASSERT_EQ(0, symlink("/dev/zero", file)); }, false},
  };
  // Lets a reader blocked on opening the FIFO go on.
  auto release = [&] { close(open(file, O_WRONLY | O_NONBLOCK)); };
  // The platform call's result, and its last error (kept per thread) in err.
  int err = 0;
  auto call = [&](const std::function<int()>& fn) {
    return Bounded([&] { int rc = fn(); err = VLIBCErrGet(); return rc; }, release);
  };
  MakeDir("/etc");
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    unlink(file);
    c.make();
    struct stat before {};
    ASSERT_EQ(0, lstat(file, &before));
    char value[8] = {};
    EXPECT_EQ(c.readable ? 2 : -1,
              call([&] { return VLIBCFileGetKeyValue(file, "a", value, sizeof value, 0); }));
    EXPECT_TRUE(c.readable || err == VLIBC_ERR_IO) << err;
    EXPECT_EQ(c.readable ? 0 : -1,
              call([&] { return VLIBCFileSetKeyValue(file, "b", "2", kFormat); }));
    EXPECT_TRUE(c.readable || err == VLIBC_ERR_IO) << err;
    // A refused file is left as it was.
    struct stat after {};
    ASSERT_EQ(0, lstat(file, &after));
    EXPECT_EQ(!c.readable, before.st_ino == after.st_ino && before.st_mode == after.st_mode);
  }
}

}  // namespace
