// FileFilter's loading and combined test, the list files the web interface
// edits, and the plovo-filter tool run as its own process.
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <syslog.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <string>
#include <vector>

#include "filter/file-filter.h"
#include "log-capture.h"
#include "sandbox.h"

namespace {

using Strings = std::vector<std::string>;

const char kDefaultBlack[] =
    "[Version]\nmajor = 0\nminor = 0\n[Common]\nblack_name = \".VeltraPlovo.config\"\nmax_length = 0\n"
    "max_path = 0\nmax_dst_path = 0\n[File]\nmax_size = 0\n[Directory]\n";
const char kDefaultWhite[] = "[Version]\nmajor = 0\nminor = 0\n[Common]\nwhite_name = \"*\"\n[File]\nwhite_ext = \"*\"\n";

class FileFilterTest : public plovo_test::SandboxTest {};

TEST_F(FileFilterTest, ListsWriteTheDefaultTextsAndReadBack) {
  ASSERT_EQ(0, WriteBlackList(Path("/black.filter"), {".VeltraPlovo.config"}, {}));
  EXPECT_EQ(kDefaultBlack, ReadFile("/black.filter"));
  ASSERT_EQ(0, WriteWhiteList(Path("/white.filter"), {"*"}, {"*"}));
  EXPECT_EQ(kDefaultWhite, ReadFile("/white.filter"));

  const Strings names = {"a", "B b", "c$", "d", "e", "f"};
  const Strings extensions = {"jpg", "PNG"};
  ASSERT_EQ(0, WriteBlackList(Path("/black.filter"), names, extensions));
  Strings readNames = {"kept"}, readExtensions;
  ASSERT_EQ(0, ReadBlackList(Path("/black.filter"), readNames, readExtensions));
  EXPECT_EQ(Strings({"kept", "a", "B b", "c$", "d", "e", "f"}), readNames);
  EXPECT_EQ(extensions, readExtensions);
  ASSERT_EQ(0, WriteWhiteList(Path("/white.filter"), names, extensions));
  readNames.clear();
  readExtensions.clear();
  ASSERT_EQ(0, ReadWhiteList(Path("/white.filter"), readNames, readExtensions));
  EXPECT_EQ(names, readNames);
  EXPECT_EQ(extensions, readExtensions);
}

TEST_F(FileFilterTest, ListsThatCannotBeWrittenOrReadFail) {
  WriteFile("/black.filter", "old");
  EXPECT_EQ(-1, WriteBlackList(Path("/black.filter"), {""}, {}));
  EXPECT_EQ(-1, WriteBlackList(Path("/black.filter"), {std::string(256, '$')}, {}));  // cannot print whole
  EXPECT_EQ(-1, WriteWhiteList(Path("/no/such/folder/white.filter"), {"a"}, {}));
  EXPECT_EQ("old", ReadFile("/black.filter"));
  Strings names = {"kept"}, extensions;
  EXPECT_EQ(-1, ReadBlackList(Path("/black.filter"), names, extensions));
  EXPECT_EQ(-1, ReadWhiteList(Path("/missing.filter"), names, extensions));
  EXPECT_EQ(Strings({"kept"}), names);
}

TEST_F(FileFilterTest, AFailedRenameLeavesNoTemporaryAndTheTargetAsItWas) {
  // A folder in the target's place: the temporary is written, the rename fails.
  WriteFile("/target/kept", "old");
  EXPECT_EQ(-1, WriteBlackList(Path("/target"), {"a"}, {}));
  EXPECT_EQ(-1, WriteWhiteList(Path("/target"), {"a"}, {}));
  std::vector<std::string> entries;
  DIR* root = opendir(Root().c_str());
  ASSERT_NE(nullptr, root);
  while (const dirent* entry = readdir(root)) {
    if (strcmp(entry->d_name, ".") != 0 && strcmp(entry->d_name, "..") != 0) entries.emplace_back(entry->d_name);
  }
  closedir(root);
  EXPECT_EQ(Strings({"target"}), entries);
  EXPECT_EQ("old", ReadFile("/target/kept"));
}

TEST_F(FileFilterTest, ListsAreWrittenWithMode0644WhateverTheUmask) {
  const mode_t old = umask(077);
  const int black = WriteBlackList(Path("/black.filter"), {"a"}, {});
  const int white = WriteWhiteList(Path("/white.filter"), {"a"}, {});
  umask(old);
  ASSERT_EQ(0, black);
  ASSERT_EQ(0, white);
  for (const char* file : {"/black.filter", "/white.filter"}) {
    struct stat st;
    ASSERT_EQ(0, stat(Path(file).c_str(), &st));
    EXPECT_EQ(0644u, st.st_mode & 07777) << file;
  }
}

TEST_F(FileFilterTest, ListsWithUnknownKeysReadTheirMembers) {
  WriteFile("/black.filter", "[Common]\nfuture = 1\nblack_name = \"a\"\n[File]\nblack_ext = \"jpg\"\n");
  WriteFile("/white.filter", "[Common]\nwhite_name = \"b\"\n[File]\nlater = \"x\"\nwhite_ext = \"png\"\n");
  Strings names, extensions;
  ::testing::internal::CaptureStdout();
  EXPECT_EQ(0, ReadBlackList(Path("/black.filter"), names, extensions));
  EXPECT_EQ(0, ReadWhiteList(Path("/white.filter"), names, extensions));
  EXPECT_EQ("warning: unknown key (future)\nwarning: unknown key (later)\n", ::testing::internal::GetCapturedStdout());
  EXPECT_EQ(Strings({"a", "b"}), names);
  EXPECT_EQ(Strings({"jpg", "png"}), extensions);
}

TEST_F(FileFilterTest, ListsNotLoadedLetEverythingPass) {
  FileFilter filter;
  EXPECT_EQ(0, filter.Test("/any/path.jpg", false));
  EXPECT_EQ(0, filter.TestWhiteList("/", true));
  ASSERT_EQ(0, WriteBlackList(Path("/black.filter"), {"secret"}, {"jpg"}));
  ASSERT_EQ(0, WriteWhiteList(Path("/white.filter"), {"Photos"}, {"png"}));
  ASSERT_EQ(0, filter.LoadBlackList(Path("/black.filter")));
  ASSERT_EQ(0, filter.LoadWhiteList(Path("/white.filter")));
  EXPECT_EQ(-261, filter.Test("/Photos/SECRET", false));  // the black list first
  EXPECT_EQ(-518, filter.Test("/a/b.JPG", false));
  EXPECT_EQ(-1, filter.Test("/a/b.gif", false));
  EXPECT_EQ(0, filter.Test("/photos/b.gif", false));
  EXPECT_EQ(0, filter.Test("/a/b.png", false));
  filter.DestroyBlackList();
  EXPECT_EQ(0, filter.TestBlackList("/a/b.JPG", false));
  EXPECT_EQ(-1, filter.Test("/a/b.jpg", false));
  filter.DestroyWhiteList();
  EXPECT_EQ(0, filter.Test("/a/b.jpg", false));
}

TEST_F(FileFilterTest, AFailedLoadKeepsNothingAndLogs) {
  ASSERT_EQ(0, WriteBlackList(Path("/black.filter"), {"secret"}, {}));
  WriteFile("/unknown-key.filter", "[Common]\nfuture = 1\n");
  WriteFile("/broken.filter", "[Common]\nblack_name = \"x\n");
  FileFilter filter;
  const struct {
    const char* file;
    bool black;
  } cases[] = {
      {"/unknown-key.filter", true}, {"/broken.filter", true}, {"/missing.filter", true},
      {"/unknown-key.filter", false}, {"/broken.filter", false}, {"/black.filter", false},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.file);
    plovo_test::LogCapture log;
    ::testing::internal::CaptureStdout();
    ::testing::internal::CaptureStderr();
    const int result = c.black ? filter.LoadBlackList(Path(c.file)) : filter.LoadWhiteList(Path(c.file));
    ::testing::internal::GetCapturedStdout();
    ::testing::internal::GetCapturedStderr();
    EXPECT_EQ(-1, result);
    EXPECT_TRUE(log.Contains(LOG_ERR, "[ERR] file-filter(")) << log.Dump();
    EXPECT_TRUE(log.Contains("): failed to read filter at '" + Path(c.file) + "'")) << log.Dump();
    EXPECT_EQ(0, filter.Test("/a/secret", false));
  }
  // A failed load leaves the list loaded before in place.
  ASSERT_EQ(0, filter.LoadBlackList(Path("/black.filter")));
  ::testing::internal::CaptureStdout();
  EXPECT_EQ(-1, filter.LoadBlackList(Path("/unknown-key.filter")));
  ::testing::internal::GetCapturedStdout();
  EXPECT_EQ(-261, filter.Test("/a/secret", false));
}

class PlovoFilterTool : public plovo_test::SandboxTest {
 protected:
  struct Outcome {
    int status;
    std::string out, err;
  };
  // Runs the tool with stdout into out (a sandbox file unless given) and
  // stderr into a sandbox file; a run of more than 10 s is killed and fails.
  Outcome Run(const std::vector<std::string>& args, std::string out = "") {
    if (out.empty()) out = Path("/out");
    const pid_t pid = fork();
    if (pid == 0) {
      dup2(open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 1);
      dup2(open(Path("/err").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 2);
      std::vector<char*> argv = {const_cast<char*>(PLOVO_FILTER_PATH)};
      for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
      argv.push_back(nullptr);
      execv(PLOVO_FILTER_PATH, argv.data());
      _exit(127);
    }
    int status = 0;
    pid_t done = 0;
    for (int waited = 0; (done = waitpid(pid, &status, WNOHANG)) == 0 && waited < 1000; ++waited) usleep(10000);
    if (done != pid) {
      kill(pid, SIGKILL);
      waitpid(pid, &status, 0);
      ADD_FAILURE() << "plovo-filter ran for more than 10 s";
      return {-1, "", ""};
    }
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, Exists("/out") ? ReadFile("/out") : "", ReadFile("/err")};
  }
};

TEST_F(PlovoFilterTool, PrintsTestsAndExitsWithTheParseResult) {
  WriteFile("/black.filter", "[Common]\nblack_name = \"Secret\"\nmax_path = 3\n");
  WriteFile("/unknown.filter", "[Common]\nwhite_name = \"*\"\nfuture = 1\n");
  WriteFile("/broken.filter", "[Common]\nwhite_name = \"*\n");
  WriteFile("/directory.filter", "[Common]\n[Directory]\n");
  const struct {
    std::vector<std::string> args;
    int status;
    std::string out, err;
  } cases[] = {
      {{"print", "black", "black.filter"}, 0,
       "[Version]\nmajor = 0\nminor = 0\n[Common]\nblack_name = \"Secret\"\nmax_length = 0\nmax_path = 3\n"
       "max_dst_path = 0\n[File]\nmax_size = 0\n[Directory]\n",
       ""},
      {{"print", "white", "unknown.filter"}, 1,
       "warning: unknown key (future)\n[Version]\nmajor = 0\nminor = 0\n[Common]\nwhite_name = \"*\"\n[File]\n", ""},
      {{"print", "white", "broken.filter"}, 2, "", "parser: VALUE_STRING_MISSING_RIGHT_QUOTE at line 2\n"},
      {{"print", "white", "directory.filter"}, 2, "", "parser: SECTION_UNDEFINED_SECTION at line 2\n"},
      {{"test", "black", "black.filter", "/a/SECRET/b.txt"}, 0, "-261\n", ""},
      {{"test", "black", "black.filter", "/a/secret", "--dir"}, 0, "-261\n", ""},
      {{"test", "black", "black.filter", "/a/b.txt"}, 0, "0\n", ""},
      {{"test", "white", "unknown.filter", "/", "--dir"}, 0, "warning: unknown key (future)\n-1\n", ""},
      {{"test", "white", "broken.filter", "/a"}, 2, "", "parser: VALUE_STRING_MISSING_RIGHT_QUOTE at line 2\n"},
      {{"test", "black", "missing.filter", "/a"}, 2, "", ""},
  };
  for (const auto& c : cases) {
    std::vector<std::string> args = c.args;
    args[2] = Path("/" + args[2]);
    SCOPED_TRACE(c.args[0] + " " + c.args[1] + " " + c.args[2]);
    const Outcome outcome = Run(args);
    EXPECT_EQ(c.status, outcome.status);
    EXPECT_EQ(c.out, outcome.out);
    EXPECT_EQ(c.err, outcome.err);
  }
}

TEST_F(PlovoFilterTool, AnOutputThatCannotBeWrittenExits74) {
  WriteFile("/black.filter", "[Common]\nblack_name = \"Secret\"\nfuture = 1\n");
  const std::vector<std::string> cases[] = {
      {"print", "black", Path("/black.filter")},
      {"test", "black", Path("/black.filter"), "/a/secret"},
  };
  for (const auto& args : cases) {
    SCOPED_TRACE(args[0]);
    const Outcome outcome = Run(args, "/dev/full");
    EXPECT_EQ(74, outcome.status);
    EXPECT_EQ("plovo-filter: cannot write to standard output: No space left on device\n", outcome.err);
  }
}

TEST_F(PlovoFilterTool, WrongUsageExits64) {
  const std::vector<std::string> cases[] = {
      {},
      {"print", "black"},
      {"print", "grey", "f"},
      {"show", "black", "f"},
      {"print", "black", "f", "extra"},
      {"test", "black", "f"},
      {"test", "white", "f", "/p", "--directory"},
      {"test", "white", "f", "/p", "--dir", "more"},
  };
  for (const auto& args : cases) {
    SCOPED_TRACE(testing::PrintToString(args));
    const Outcome outcome = Run(args);
    EXPECT_EQ(64, outcome.status);
    EXPECT_EQ("", outcome.out);
    EXPECT_EQ(0u, outcome.err.rfind("usage: plovo-filter ", 0)) << outcome.err;
  }
}

}  // namespace
