// FileFilter's loading and combined test, the list files the web interface
// edits, and the plovo-filter tool run as its own process.
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>

#include <cstdlib>
#include <filesystem>
#include <iterator>
#include <string>
#include <vector>

#include "emulation.h"
#include "filter/file-filter.h"
#include "log-capture.h"
#include "sandbox.h"

namespace {

using Strings = std::vector<std::string>;

class FileFilterTest : public plovo_test::SandboxTest {};

TEST_F(FileFilterTest, ListsWriteTheDefaultTextsWithMode0644AndReadBack) {
  const mode_t old = umask(077);
  const int black = WriteBlackList(Path("/black.filter"), {".VeltraPlovo.config"}, {});
  const int white = WriteWhiteList(Path("/white.filter"), {"*"}, {"*"});
  umask(old);
  ASSERT_EQ(0, black);
  ASSERT_EQ(0, white);
  EXPECT_EQ("[Version]\nmajor = 0\nminor = 0\n[Common]\nblack_name = \".VeltraPlovo.config\"\nmax_length = 0\n"
            "max_path = 0\nmax_dst_path = 0\n[File]\nmax_size = 0\n[Directory]\n",
            ReadFile("/black.filter"));
  EXPECT_EQ("[Version]\nmajor = 0\nminor = 0\n[Common]\nwhite_name = \"*\"\n[File]\nwhite_ext = \"*\"\n",
            ReadFile("/white.filter"));
  for (const char* file : {"/black.filter", "/white.filter"}) {
    struct stat st;
    ASSERT_EQ(0, stat(Path(file).c_str(), &st));
    EXPECT_EQ(0644u, st.st_mode & 07777) << file;
  }
  const Strings names = {"a", "B b", "c$", "d", "e", "f"}, extensions = {"jpg", "PNG"};
  ASSERT_EQ(0, WriteBlackList(Path("/black.filter"), names, extensions));
  ASSERT_EQ(0, WriteWhiteList(Path("/white.filter"), names, extensions));
  Strings readNames = {"kept"}, readExtensions;
  ASSERT_EQ(0, ReadBlackList(Path("/black.filter"), readNames, readExtensions));
  ASSERT_EQ(0, ReadWhiteList(Path("/white.filter"), readNames, readExtensions));
  EXPECT_EQ(Strings({"kept", "a", "B b", "c$", "d", "e", "f", "a", "B b", "c$", "d", "e", "f"}), readNames);
  EXPECT_EQ(Strings({"jpg", "PNG", "jpg", "PNG"}), readExtensions);
}

TEST_F(FileFilterTest, ListsFailOnlyWhenTheyCannotBeWrittenOrParsed) {
  WriteFile("/black.filter", "old");
  WriteFile("/target/kept", "old");  // a folder in the target's place: the rename fails
  EXPECT_EQ(-1, WriteBlackList(Path("/black.filter"), {""}, {}));
  EXPECT_EQ(-1, WriteBlackList(Path("/black.filter"), {std::string(256, '$')}, {}));  // cannot print whole
  EXPECT_EQ(-1, WriteBlackList(Path("/black.filter"), Strings(1100, std::string(1000, 'n')), {}));  // never read
  EXPECT_EQ(-1, WriteWhiteList(Path("/no/such/folder/white.filter"), {"a"}, {}));
  EXPECT_EQ(-1, WriteBlackList(Path("/target"), {"a"}, {}));
  EXPECT_EQ(-1, WriteWhiteList(Path("/target"), {"a"}, {}));
  std::filesystem::directory_iterator entries(Root());
  EXPECT_EQ(2, std::distance(begin(entries), end(entries)));  // black.filter and target
  EXPECT_EQ("old", ReadFile("/black.filter"));
  EXPECT_EQ("old", ReadFile("/target/kept"));
  Strings names = {"kept"}, extensions;
  EXPECT_EQ(-1, ReadBlackList(Path("/black.filter"), names, extensions));
  EXPECT_EQ(-1, ReadWhiteList(Path("/missing.filter"), names, extensions));
  // Unknown keys are warned of, and the members read.
  WriteFile("/black.filter", "[Common]\nfuture = 1\nblack_name = \"a\"\n[File]\nblack_ext = \"jpg\"\n");
  WriteFile("/white.filter", "[Common]\nwhite_name = \"b\"\n[File]\nlater = \"x\"\nwhite_ext = \"png\"\n");
  testing::internal::CaptureStdout();
  EXPECT_EQ(0, ReadBlackList(Path("/black.filter"), names, extensions));
  EXPECT_EQ(0, ReadWhiteList(Path("/white.filter"), names, extensions));
  EXPECT_EQ("warning: unknown key (future)\nwarning: unknown key (later)\n", testing::internal::GetCapturedStdout());
  EXPECT_EQ(Strings({"kept", "a", "b"}), names);
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
    testing::internal::CaptureStdout();
    testing::internal::CaptureStderr();
    const int result = c.black ? filter.LoadBlackList(Path(c.file)) : filter.LoadWhiteList(Path(c.file));
    testing::internal::GetCapturedStdout();
    testing::internal::GetCapturedStderr();
    EXPECT_EQ(-1, result);
    EXPECT_TRUE(log.Contains(LOG_ERR, "[ERR] file-filter(")) << log.Dump();
    EXPECT_TRUE(log.Contains("): failed to read filter at '" + Path(c.file) + "'")) << log.Dump();
    EXPECT_EQ(0, filter.Test("/a/secret", false));
  }
  // A failed load leaves the list loaded before in place.
  ASSERT_EQ(0, filter.LoadBlackList(Path("/black.filter")));
  testing::internal::CaptureStdout();
  EXPECT_EQ(-1, filter.LoadBlackList(Path("/unknown-key.filter")));
  testing::internal::GetCapturedStdout();
  EXPECT_EQ(-261, filter.Test("/a/secret", false));
}

class PlovoFilterTool : public plovo_test::SandboxTest {};

TEST_F(PlovoFilterTool, PrintsTestsAndExitsWithTheParseResultOrAnError) {
  PLOVO_SKIP_UNLESS_TARGET_PROGRAMS_RUN();
  WriteFile("/black.filter", "[Common]\nblack_name = \"Secret\"\nmax_path = 3\n");
  WriteFile("/unknown.filter", "[Common]\nwhite_name = \"*\"\nfuture = 1\n");
  WriteFile("/broken.filter", "[Common]\nwhite_name = \"*\n");
  WriteFile("/directory.filter", "[Common]\n[Directory]\n");
  const std::string quote = "parser: VALUE_STRING_MISSING_RIGHT_QUOTE at line 2\n";
  const std::string full = "plovo-filter: cannot write to standard output: No space left on device\n";
  const std::string usage =
      "usage: plovo-filter print black|white FILE | plovo-filter test black|white FILE PATH [--dir]\n";
  const struct {
    const char* args;
    int status;
    std::string out, err;
  } cases[] = {
      {"print black black.filter", 0,
       "[Version]\nmajor = 0\nminor = 0\n[Common]\nblack_name = \"Secret\"\nmax_length = 0\nmax_path = 3\n"
       "max_dst_path = 0\n[File]\nmax_size = 0\n[Directory]\n",
       ""},
      {"print white unknown.filter", 1,
       "warning: unknown key (future)\n[Version]\nmajor = 0\nminor = 0\n[Common]\nwhite_name = \"*\"\n[File]\n", ""},
      {"print white broken.filter", 2, "", quote},
      {"print white directory.filter", 2, "", "parser: SECTION_UNDEFINED_SECTION at line 2\n"},
      {"test black black.filter /a/SECRET/b.txt", 0, "-261\n", ""},
      {"test black black.filter /a/secret --dir", 0, "-261\n", ""},
      {"test black black.filter /a/b.txt", 0, "0\n", ""},
      {"test white unknown.filter / --dir", 0, "warning: unknown key (future)\n-1\n", ""},
      {"test white broken.filter /a", 2, "", quote},
      {"test black missing.filter /a", 2, "", ""},
      // Standard output cannot be written: 74, whatever the parse result.
      {"print black unknown.filter >/dev/full", 74, "", full},
      {"test black black.filter /a/secret >/dev/full", 74, "", full},
      {"", 64, "", usage}, {"print black", 64, "", usage}, {"print grey f", 64, "", usage},
      {"show black f", 64, "", usage}, {"print black f extra", 64, "", usage}, {"test black f", 64, "", usage},
      {"test white f /p --directory", 64, "", usage}, {"test white f /p --dir more", 64, "", usage},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.args);
    // The later redirection of stdout in args wins; a run of over 10 s is killed.
    const std::string command = "cd '" + Root() + "' && timeout 10 " PLOVO_FILTER_PATH " >out 2>err " + c.args;
    const int status = system(command.c_str());
    EXPECT_EQ(c.status, WIFEXITED(status) ? WEXITSTATUS(status) : -1);
    EXPECT_EQ(c.out, ReadFile("/out"));
    EXPECT_EQ(c.err, ReadFile("/err"));
  }
}

}  // namespace
