// Key/value files, processes, last error, fault switches and the system log.
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <velt/dev.h>
#include <velt/log.h>
#include <velt/mount.h>
#include <velt/vlibc.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <functional>
#include <sstream>
#include <thread>
#include <vector>

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
  EXPECT_EQ(1, VLIBCFileCheckKeyValue(F(), "state", "running", 0));
  EXPECT_EQ(0, VLIBCFileCheckKeyValue(F(), "state", "runnin", 0));
  EXPECT_EQ(0, VLIBCFileCheckKeyValue(F(), "absent", "", 0));
  ASSERT_EQ(0, VLIBCFileRemoveKey(F(), "state"));
  EXPECT_EQ("state2=\"9\"\nxstate=\"8\"\nerror=\"\"\nraw=a b\n", ReadFile(kFile));
}

TEST_F(KeyValueTest, MissingFileIsAnErrorButMissingKeyIsNot) {
  EXPECT_EQ("<-1>", Get("state"));
  EXPECT_EQ(VLIBC_ERR_NOT_FOUND, VLIBCErrGet());
  EXPECT_LT(VLIBCFileCheckKeyValue(F(), "state", "1", 0), 0);
  EXPECT_LT(VLIBCFileRemoveKey(F(), "state"), 0);
  MakeDir(kFile);  // a folder cannot be read as a file
  EXPECT_EQ("<-1>", Get("state"));
  EXPECT_EQ(VLIBC_ERR_IO, VLIBCErrGet());
}

TEST_F(KeyValueTest, NewFileIs0644AndRewriteKeepsModeWithoutLeftovers) {
  MakeDir("/etc");
  mode_t oldMask = umask(077);
  ASSERT_EQ(0, Set("a", "1"));
  umask(oldMask);
  struct stat st;
  ASSERT_EQ(0, stat(F(), &st));
  EXPECT_EQ(0644u, st.st_mode & 07777);
  ASSERT_EQ(0, chmod(F(), 0600));
  ASSERT_EQ(0, Set("a", "2"));
  ASSERT_EQ(0, VLIBCFileRemoveKey(F(), "a"));
  ASSERT_EQ(0, stat(F(), &st));
  EXPECT_EQ(0600u, st.st_mode & 07777);
  namespace fs = std::filesystem;
  EXPECT_EQ(1, std::distance(fs::directory_iterator(Path("/etc")), fs::directory_iterator()));
  EXPECT_EQ(1, VLIBCFileExist(Path("/etc").c_str()));
  EXPECT_EQ(0, VLIBCFileExist(Path("/etc/none").c_str()));
}

TEST_F(KeyValueTest, LastErrorNamesThePlatformSourceAndIsPerThread) {
  EXPECT_LT(VLIBCFileSetKeyValue(Path("/no/dir/f").c_str(), "k", "v", kFormat), 0);
  EXPECT_EQ(VLIBC_ERR_NOT_FOUND, VLIBCErrGet());
  EXPECT_STREQ("vlibc.cpp", VLIBCErrorGetFile());
  EXPECT_GT(VLIBCErrorGetLine(), 0);
  std::thread([] {
    EXPECT_EQ(VLIBC_ERR_NONE, VLIBCErrGet());
    EXPECT_LT(VLIBCExec("/bin/false", nullptr, nullptr, nullptr, nullptr), 0);
    EXPECT_EQ(VLIBC_ERR_EXEC, VLIBCErrGet());
  }).join();
  EXPECT_EQ(VLIBC_ERR_NOT_FOUND, VLIBCErrGet());
}

using ProcessTest = plovo_test::SandboxTest;

TEST_F(ProcessTest, ExecSucceedsOnlyOnExitStatusZeroAndPassesArguments) {
  EXPECT_EQ(0, VLIBCExec("/bin/true", nullptr, nullptr, nullptr, nullptr));
  EXPECT_LT(VLIBCExec("/bin/false", nullptr, nullptr, nullptr, nullptr), 0);
  EXPECT_LT(VLIBCExec("/bin/sh", "-c", "kill -9 $$", nullptr, nullptr), 0);
  EXPECT_LT(VLIBCExec(Path("/missing").c_str(), nullptr, nullptr, nullptr, nullptr), 0);
  EXPECT_EQ(VLIBC_ERR_EXEC, VLIBCErrGet());
  ASSERT_EQ(0, VLIBCExec("/bin/sh", "-c", "printf '%s|%s' \"$0\" \"$1\" > \"$PLOVO_ROOT/out\"",
                         "first", "second word"));
  EXPECT_EQ("first|second word", ReadFile("/out"));
  // The list ends at the first null.
  ASSERT_EQ(0, VLIBCExec("/bin/sh", "-c", "echo $# > \"$PLOVO_ROOT/n\"", nullptr, "ignored"));
  EXPECT_EQ("0\n", ReadFile("/n"));
}

TEST_F(ProcessTest, BackgroundExecReturnsWhileProgramRuns) {
  // The program waits (2 s at most) for a file written only after the call.
  const char* script =
      "i=0; while [ ! -e \"$PLOVO_ROOT/go\" ] && [ $i -lt 40 ]; do sleep 0.05; i=$((i+1)); done;"
      "[ -e \"$PLOVO_ROOT/go\" ] && echo done > \"$PLOVO_ROOT/bg\"";
  ASSERT_EQ(0, VLIBCBackgroundExec("/bin/sh", "-c", script, nullptr, nullptr));
  EXPECT_EQ(-1, waitpid(-1, nullptr, WNOHANG));  // the intermediate process was reaped
  EXPECT_EQ(ECHILD, errno);
  WriteFile("/go", "");
  for (int i = 0; i < 100 && ReadFile("/bg").empty(); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  EXPECT_EQ("done\n", ReadFile("/bg"));
  EXPECT_LT(VLIBCBackgroundExec(Path("/missing").c_str(), nullptr, nullptr, nullptr, nullptr), 0);
  EXPECT_EQ(VLIBC_ERR_EXEC, VLIBCErrGet());
}

TEST_F(ProcessTest, PidFilesAndLiveness) {
  pid_t child = fork();
  if (child == 0) _exit(0);
  ASSERT_EQ(child, waitpid(child, nullptr, 0));
  WriteFile("/run/dead.pid", std::to_string(child) + "\n");
  EXPECT_EQ(child, VLIBCReadPidFile(Path("/run/dead.pid").c_str()));
  EXPECT_EQ(0, VLIBCProcAlive(child));
  EXPECT_EQ(1, VLIBCProcAlive(getpid()));
  for (const char* bad : {"", "abc", "12ab", "-5", "0", "99999999999"}) {
    WriteFile("/run/bad.pid", bad);
    EXPECT_LT(VLIBCReadPidFile(Path("/run/bad.pid").c_str()), 1) << bad;
  }
  EXPECT_LT(VLIBCReadPidFile(Path("/run/missing.pid").c_str()), 1);
  // 0 and negative ids would address process groups, never one process.
  EXPECT_EQ(0, VLIBCProcAlive(0));
  EXPECT_EQ(0, VLIBCProcAlive(-1));
  // A process we may not signal is still alive.
  pid_t prober = fork();
  if (prober == 0) {
    bool dropped = geteuid() != 0 || setuid(65534) == 0;
    _exit(dropped && VLIBCProcAlive(geteuid() == 0 ? getppid() : 1) == 1 ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(prober, waitpid(prober, &status, 0));
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
}

using FaultTest = plovo_test::SandboxTest;

TEST_F(FaultTest, NthAndTimes) {
  WriteFile("/f", "a=\"1\"\n");
  const std::string f = Path("/f");
  char buf[8];
  auto get = [&] { return VLIBCFileGetKeyValue(f.c_str(), "a", buf, sizeof buf, 0); };
  VeltDevFailCall("VLIBCFileGetKeyValue", 2, 2, 0x1234);
  EXPECT_EQ(2, get());
  EXPECT_EQ(1, VLIBCFileCheckKeyValue(f.c_str(), "a", "1", 0));  // other calls unaffected
  EXPECT_EQ(-1, get());
  EXPECT_EQ(0x1234, VLIBCErrGet());
  EXPECT_EQ(-1, get());
  EXPECT_EQ(2, get());
  VeltDevFailCall("VLIBCFileGetKeyValue", 1, 1, 1);
  VeltDevFailCall("VLIBCFileGetKeyValue", 2, 0, VLIBC_ERR_IO);  // replaces the first
  EXPECT_EQ(2, get());
  for (int i = 0; i < 3; ++i) EXPECT_EQ(-1, get());
  VeltDevClearFaults();
  EXPECT_EQ(2, get());
}

TEST_F(FaultTest, EveryCallHonoursItsSwitch) {
  WriteFile("/f", "a=\"1\"\n");
  WriteFile("/p", "1\n");
  DeclareVolumes({{Root()}});
  const std::string f = Path("/f"), p = Path("/p"), root = Root();
  char buf[8];
  PVELTMOUNTVOLINFO info = nullptr;
  auto freed = [&](int rc) {
    EXPECT_EQ(rc >= 0, info != nullptr);
    VELTMountVolInfoFree(info);
    return rc;
  };
  const std::vector<std::pair<const char*, std::function<int()>>> calls = {
      {"VLIBCFileGetKeyValue", [&] { return VLIBCFileGetKeyValue(f.c_str(), "a", buf, 8, 0); }},
      {"VLIBCFileSetKeyValue", [&] { return VLIBCFileSetKeyValue(f.c_str(), "a", "2", kFormat); }},
      {"VLIBCFileCheckKeyValue", [&] { return VLIBCFileCheckKeyValue(f.c_str(), "a", "", 0); }},
      {"VLIBCFileRemoveKey", [&] { return VLIBCFileRemoveKey(f.c_str(), "b"); }},
      {"VLIBCFileExist", [&] { return VLIBCFileExist(f.c_str()) - 1; }},
      {"VLIBCExec", [] { return VLIBCExec("/bin/true", nullptr, nullptr, nullptr, nullptr); }},
      {"VLIBCBackgroundExec",
       [] { return VLIBCBackgroundExec("/bin/true", nullptr, nullptr, nullptr, nullptr); }},
      {"VLIBCReadPidFile", [&] { return VLIBCReadPidFile(p.c_str()) - 1; }},
      {"VLIBCProcAlive", [] { return VLIBCProcAlive(getpid()) - 1; }},
      {"VELTLogSet1", [] { return VELTLogSet1(1, 1, 1, "s", "", "", ""); }},
      {"VELTMountVolInfoGet", [&] { return freed(VELTMountVolInfoGet(root.c_str(), &info)); }},
      {"VELTMountVolAllEnum", [&] { return freed(VELTMountVolAllEnum(&info)); }},
  };
  // Each call is shaped to give >= 0 on success and < 0 on its failure value.
  for (const auto& [name, call] : calls) {
    EXPECT_GE(call(), 0) << name << " without a switch";
    VeltDevFailCall(name, 1, 1, 0x7777);
    EXPECT_LT(call(), 0) << name;
    EXPECT_EQ(0x7777, VLIBCErrGet()) << name;
    EXPECT_GE(call(), 0) << name << " after its one failure";
  }
}

TEST_F(FaultTest, StateDirFollowsRoot) {
  setenv("PLOVO_ROOT", (Root() + "//").c_str(), 1);
  EXPECT_EQ(Root() + "/velt-dev", VeltDevStateDir());
  setenv("PLOVO_ROOT", "", 1);
  EXPECT_STREQ("/velt-dev", VeltDevStateDir());
  unsetenv("PLOVO_ROOT");
  EXPECT_STREQ("/velt-dev", VeltDevStateDir());
}

// A log line without its timestamp (like 2024-05-01T12:34:56+02:00), or
// "<bad stamp>".
std::string AfterStamp(const std::string& line) {
  int n = 0, v[8];
  char sign = 0;
  std::sscanf(line.c_str(), "%4d-%2d-%2dT%2d:%2d:%2d%c%2d:%2d%n", &v[0], &v[1], &v[2], &v[3], &v[4],
              &v[5], &sign, &v[6], &v[7], &n);
  return n == 25 && (sign == '+' || sign == '-') ? line.substr(25) : "<bad stamp>";
}

using SystemLogTest = plovo_test::SandboxTest;

TEST_F(SystemLogTest, OneTabSeparatedLinePerEvent) {
  ASSERT_EQ(0, VELTLogSet1(1, 3, 0x11B01050, "Plovo", "", nullptr, "a\tb\nc"));
  ASSERT_EQ(0, VELTLogSet1(2, 1, 0x5, nullptr, "x", "y", "z"));
  std::istringstream log(ReadFile("/velt-dev/system.log"));
  std::string first, second, extra;
  ASSERT_TRUE(std::getline(log, first) && std::getline(log, second));
  EXPECT_FALSE(std::getline(log, extra));
  EXPECT_EQ("\t1\t3\t0x11B01050\tPlovo\t\t\ta b c", AfterStamp(first));
  EXPECT_EQ("\t2\t1\t0x00000005\t\tx\ty\tz", AfterStamp(second));
  setenv("PLOVO_ROOT", Path("/missing/root").c_str(), 1);
  EXPECT_LT(VELTLogSet1(1, 1, 1, "s", "", "", ""), 0);
  EXPECT_EQ(VLIBC_ERR_IO, VLIBCErrGet());
}

TEST_F(SystemLogTest, ProcessesDoNotInterleave) {
  const std::string arg(300, 'a');
  std::vector<pid_t> children;
  for (int c = 0; c < 4; ++c) {
    pid_t pid = fork();
    if (pid == 0) {
      int rc = 0;
      for (int i = 0; i < 200; ++i) rc |= VELTLogSet1(1, 1, c, "p", arg.c_str(), "", "");
      _exit(rc ? 1 : 0);
    }
    children.push_back(pid);
  }
  for (pid_t pid : children) {
    int status = 0;
    ASSERT_EQ(pid, waitpid(pid, &status, 0));
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  }
  std::istringstream log(ReadFile("/velt-dev/system.log"));
  int lines = 0;
  for (std::string l; std::getline(log, l); ++lines) {
    std::string rest = AfterStamp(l);
    ASSERT_TRUE(rest.rfind("\t1\t1\t0x0000000", 0) == 0 &&
                rest.substr(15) == "\tp\t" + arg + "\t\t")
        << l;
  }
  EXPECT_EQ(800, lines);
}

}  // namespace
