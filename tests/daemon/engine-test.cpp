// The copy engine end to end: tasks run through the socket of a daemon in this process, on a clock
// the test sets, over real folders; what they did is read from the trees, the memory and the log.
#include <gmock/gmock.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <atomic>
#include <cstring>
#include <map>
#include <memory>
#include <set>
#include <sstream>

#include "daemon-sandbox.h"
#include "exif-jpeg.h"
#include "raw-db.h"
#include "daemon/daemon.h"
#include "daemon/engine/rotation.h"
#include "ipc/command-server.h"
#include "ipc/error-code.h"

namespace {

namespace fs = std::filesystem;
using Tree = std::map<std::string, std::string>;  // path below a folder -> bytes
using testing::Contains;

constexpr time_t kStart = 1700000000;  // the clock of a test's first run

// 2022-07-08 09:10:11 here: the capture time of a photo without EXIF.
time_t Taken() {
  std::tm t{};
  t.tm_year = 122, t.tm_mon = 6, t.tm_mday = 8, t.tm_hour = 9, t.tm_min = 10, t.tm_sec = 11, t.tm_isdst = -1;
  return mktime(&t);
}

// Large contents stand in a tree by their size and hash: a failure prints a line, not megabytes.
std::string Bytes(const std::string& content) {
  const std::string hash = std::to_string(std::hash<std::string>{}(content));
  return content.size() <= 4096 ? content : std::to_string(content.size()) + " bytes #" + hash;
}

Tree Merged(Tree tree, const Tree& more, const std::string& prefix = "") {
  for (const auto& [path, content] : more) tree[prefix + path] = content;
  return tree;
}

class EngineTest : public plovo_test::DaemonSandboxTest {
 protected:
  void SetUp() override {
    DaemonSandboxTest::SetUp();
    daemon_ = std::make_unique<plovod::Daemon>(RepoPath(), false, [] {}, plovod::RunCopy,
                                               [this] { return now_.load(); });
    ASSERT_EQ(daemon_->Open(), 0);
    server_ = std::make_unique<CommandServer>(daemon_->Commands(),
                                              [this](const PObject& request) { return daemon_->Handle(request); });
    ASSERT_EQ(server_->Start(Plovo::Path::DaemonSocket()), 0);
  }
  void TearDown() override {
    server_.reset();
    daemon_.reset();  // its runs end before their folders go
    if (!mounted_.empty()) umount2(mounted_.c_str(), MNT_DETACH);
    DaemonSandboxTest::TearDown();
  }

  // Every file below the folder (temporaries included), folders left out.
  Tree Files(const std::string& systemDir) const {
    Tree tree;
    const std::string root = Path(systemDir) + "/";
    std::error_code ec;
    for (fs::recursive_directory_iterator it(root, ec), end; !ec && it != end; it.increment(ec)) {
      const std::string path = it->path().string().substr(root.size());
      if (!it->is_directory()) tree[path] = Bytes(ReadFile(systemDir + "/" + path));
    }
    return tree;
  }
  void Touch(const std::string& systemPath, time_t mtime) const {
    const struct timespec times[2] = {{mtime, 0}, {mtime, 0}};
    ASSERT_EQ(utimensat(AT_FDCWD, Path(systemPath).c_str(), times, 0), 0) << systemPath;
  }
  struct stat Stat(const std::string& systemPath) const {
    struct stat st {};
    EXPECT_EQ(lstat(Path(systemPath).c_str(), &st), 0) << systemPath;
    return st;
  }
  // Runs the task to its end; the run's outcome.
  int64_t RunTask(unsigned long id) {
    EXPECT_TRUE(Ok(OnTask("run_task", id)));
    return WaitIdle(id)["error_code"].asInt64();
  }
  // The task's log rows (every task's for 0), oldest first, as "<event>/<type> <parameters>".
  std::vector<std::string> Rows(unsigned long id) const {
    const std::string sql = "SELECT description_id || '/' || log_type || ' ' || description_param FROM log_info_table" +
                            (id == 0 ? std::string() : " WHERE task_id = " + std::to_string(id)) + " ORDER BY id";
    std::istringstream text(plovo_test::RawDB(RepoPath() + "/db/log-db.sqlite").Rows(sql));
    std::vector<std::string> rows;
    for (std::string row; std::getline(text, row);) rows.push_back(row);
    return rows;
  }

  std::atomic<time_t> now_{kStart};
  std::string mounted_;
  std::unique_ptr<plovod::Daemon> daemon_;
  std::unique_ptr<CommandServer> server_;  // last: it serves daemon_
};

// One card, one task of each strategy, three runs: the first, one with
// nothing changed, and one after a file was added, one changed (same size,
// new bytes and time) and one deleted on the card, and one copy moved by
// the user in the incremental task's folder.
TEST_F(EngineTest, StrategiesFollowTheCard) {
  Tree card = {{"100CAM/IMG_0001.JPG", plovo_test::ExifJpeg("2021:03:04 05:06:07")},
               {"100CAM/IMG_0002.jpg", "plain photo"}, {"100CAM/CLIP.MP4", "video"}, {".hidden", "hidden"},
               {"Été 'été' \"x\".jpg", "quoted"}, {"with space/a b.txt", "spaced"}};
  for (const auto& [path, content] : card) WriteFile("/usbshare1/DCIM/" + path, content);
  WriteFile("/usbshare1/DCIM/.VeltraPlovo.config", "uuid=\"x\"\n");
  WriteFile("/usbshare1/DCIM/Thumbs.db", "black-listed");
  const Tree user = {{"Thumbs.db", "the user's"}};  // black-listed: no run copies or removes it
  const std::string names[] = {"", "ver", "mir", "inc"}, v1 = plovod::VersionName(kStart),
                    v2 = plovod::VersionName(kStart + 60), v3 = plovod::VersionName(kStart + 120);
  const std::string ver = "/volume1/photo/ver/";
  unsigned long ids[4] = {};
  Tree expected[4];
  for (int strategy = 1; strategy <= 3; ++strategy) {
    const std::string& name = names[strategy];
    WriteFile("/volume1/photo/" + name + "/Thumbs.db", "the user's");
    const PObject add = With(AddTaskRequest(name, "/DCIM", "/" + name), "copy_strategy", Num(strategy));
    ids[strategy] = Add(With(add, "black_name", Strings({"Thumbs.db"})));
  }
  // Runs the three tasks; each finishes with its tree and, when given, its counts (copied, bytes, removed).
  auto runAll = [&](time_t at, const std::vector<std::string>& counts) {
    now_ = at;
    for (int strategy = 1; strategy <= 3; ++strategy) {
      SCOPED_TRACE(names[strategy]);
      EXPECT_EQ(RunTask(ids[strategy]), 0);
      EXPECT_EQ(Files("/volume1/photo/" + names[strategy]), expected[strategy]);
      if (!counts.empty()) {
        EXPECT_EQ(Rows(ids[strategy]).back(), "2/1 [\"" + names[strategy] + "\"," + counts[strategy - 1] + "]");
      }
    }
  };

  expected[1] = Merged(user, card, v1 + "/");
  expected[2] = expected[3] = Merged(user, card);
  runAll(kStart, {});
  expected[1] = Merged(expected[1], card, v2 + "/");
  runAll(kStart + 60, {R"("0","0","0")", R"("0","0","0")", R"("0","0","0")"});
  for (const auto& [path, content] : card) {  // the second version shares every file with the first
    const struct stat first = Stat(ver + v1 + "/" + path);
    EXPECT_TRUE(first.st_nlink == 2 && first.st_ino == Stat(ver + v2 + "/" + path).st_ino) << path;
  }

  const std::string changed = "100CAM/IMG_0002.jpg", added = "100CAM/IMG_0003.jpg", moved = "Été 'été' \"x\".jpg";
  card[changed] = "PLAIN PHOTO";
  card[added] = "new";
  for (const std::string& path : {changed, added}) WriteFile("/usbshare1/DCIM/" + path, card[path]);
  Touch("/usbshare1/DCIM/" + changed, Taken());
  card.erase("with space/a b.txt");
  ASSERT_TRUE(fs::remove(Path("/usbshare1/DCIM/with space/a b.txt")));
  ASSERT_EQ(rename(Path("/volume1/photo/inc/" + moved).c_str(), Path("/volume1/photo/inc/renamed.jpg").c_str()), 0);
  ASSERT_TRUE(fs::remove(Path(ver + v1 + "/.hidden")));  // only the latest version counts
  expected[1].erase(v1 + "/.hidden");
  expected[1] = Merged(expected[1], card, v3 + "/");
  expected[2] = Merged(user, card);
  // The incremental copy of the changed file goes beside its earlier copy,
  // which may hold the user's edits: nothing at the NAS is lost.
  expected[3] = Merged(expected[3], {{"renamed.jpg", "quoted"}, {"100CAM/IMG_0002 (1).jpg", card[changed]},
                                     {added, "new"}});
  expected[3].erase(moved);
  runAll(kStart + 120, {R"("2","14","0")", R"("2","14","1")", R"("2","14","0")"});
  EXPECT_EQ(Stat(ver + v3 + "/.hidden").st_ino, Stat(ver + v2 + "/.hidden").st_ino);
  EXPECT_EQ(Stat(ver + v3 + "/" + changed).st_nlink, 1u);
}

// Where each file of one card lands by the incremental task's options and
// lists, with a file of the user's in the way of A/notes.txt.
TEST_F(EngineTest, IncrementalOptionsAndListsPlaceEachFile) {
  const std::string exif = plovo_test::ExifJpeg("2021:03:04 05:06:07");
  const Tree card = {{"A/IMG_0001.JPG", exif}, {"B/IMG_0001.JPG", "b"}, {"A/CLIP.MP4", "clip"},
                     {"A/notes.txt", "notes"}, {"A/Thumbs.db", "black-listed"}, {".VeltraPlovo.config", "id"}};
  const Tree plain = {{"A/IMG_0001.JPG", exif}, {"B/IMG_0001.JPG", "b"}, {"A/CLIP.MP4", "clip"},
                      {"A/notes.txt", "user"}, {"A/notes (1).txt", "notes"}};
  const Tree kept = {{"A/Thumbs.db", "black-listed"}, {".VeltraPlovo.config", "id"}};
  using Lists = std::vector<std::pair<const char*, std::vector<std::string>>>;
  // left: what a run that removes its sources leaves on the card ({}: it keeps them).
  struct Case { const char* what; int keep, dated, renamed, policy; Tree left; Lists lists; Tree nas; };
  const Case cases[] = {
      {"rename on conflict", 1, 0, 0, 1, {}, {}, plain},
      {"overwrite on conflict", 1, 0, 0, 2, {}, {},
       {{"A/IMG_0001.JPG", exif}, {"B/IMG_0001.JPG", "b"}, {"A/CLIP.MP4", "clip"}, {"A/notes.txt", "notes"}}},
      {"flat", 0, 0, 0, 1, {}, {},
       {{"IMG_0001.JPG", exif}, {"IMG_0001 (1).JPG", "b"}, {"CLIP.MP4", "clip"}, {"notes.txt", "notes"},
        {"A/notes.txt", "user"}}},
      {"date folders", 1, 1, 0, 1, {}, {},
       {{"2021-03-04/IMG_0001.JPG", exif}, {"2022-07-08/IMG_0001.JPG", "b"}, {"2022-07-08/CLIP.MP4", "clip"},
        {"A/notes.txt", "user"}, {"A/notes (1).txt", "notes"}}},
      {"dated names", 1, 1, 1, 1, {}, {},
       {{"2021-03-04/20210304_050607.JPG", exif}, {"2022-07-08/20220708_091011.JPG", "b"},
        {"2022-07-08/20220708_091011.MP4", "clip"}, {"A/notes.txt", "user"}, {"A/notes (1).txt", "notes"}}},
      {"sources removed", 1, 0, 0, 1, kept, {}, plain},
      // A's photo was copied, then overwritten by B's: its source stays.
      {"flat, overwritten, sources removed", 0, 0, 0, 2, Merged(kept, {{"A/IMG_0001.JPG", exif}}), {},
       {{"IMG_0001.JPG", "b"}, {"CLIP.MP4", "clip"}, {"notes.txt", "notes"}, {"A/notes.txt", "user"}}},
      {"white list and a custom name", 1, 0, 0, 1, {}, {{"white_ext", {"jpg"}}, {"custom_name", {"NOTES.txt"}}},
       {{"A/IMG_0001.JPG", exif}, {"B/IMG_0001.JPG", "b"}, {"A/notes.txt", "user"}, {"A/notes (1).txt", "notes"}}},
      {"white list and a custom extension", 1, 0, 0, 1, {}, {{"white_ext", {"jpg"}}, {"custom_ext", {"mp4"}}},
       {{"A/IMG_0001.JPG", exif}, {"B/IMG_0001.JPG", "b"}, {"A/CLIP.MP4", "clip"}, {"A/notes.txt", "user"}}},
  };
  int n = 0;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    fs::remove_all(Path("/usbshare1/DCIM"));
    for (const auto& [path, content] : card) WriteFile("/usbshare1/DCIM/" + path, content);
    for (const std::string path : {"B/IMG_0001.JPG", "A/CLIP.MP4"}) Touch("/usbshare1/DCIM/" + path, Taken());
    const std::string name = "/case" + std::to_string(++n), folder = "/volume1/photo" + name;
    WriteFile(folder + "/A/notes.txt", "user");
    PObject add = With(AddTaskRequest(c.what, "/DCIM", name), "black_name", Strings({"Thumbs.db"}));
    const std::pair<const char*, int> options[] = {
        {"copy_strategy", 3},           {"keep_dir_structure", c.keep},       {"smart_create_date_dir", c.dated},
        {"rename_photo_video", c.renamed}, {"remove_src_file", !c.left.empty()}, {"conflict_policy", c.policy}};
    for (const auto& [key, value] : options) add[key] = Num(value);
    for (const auto& [key, list] : c.lists) add[key] = Strings(list);
    EXPECT_EQ(RunTask(Add(add)), 0);
    EXPECT_EQ(Files(folder), c.nas);
    EXPECT_EQ(Files("/usbshare1/DCIM"), c.left.empty() ? card : c.left);
  }
}

// Five runs, four within 3 hours and one a day later, with at most 3
// versions kept; a folder of the user's beside them stays.
TEST_F(EngineTest, RotationKeepsTheVersionsItsPolicySays) {
  WriteFile("/usbshare1/DCIM/a.jpg", "a");
  constexpr time_t kHour = 3600;
  const time_t runs[] = {0, kHour, 2 * kHour, 3 * kHour, 30 * kHour};
  // smart_recycle: the run at 3 h already drops the one at 0 h (the count);
  // at 30 h the runs 27 to 29 h old share a day, and only its newest stays.
  const struct { int policy; std::vector<time_t> kept; } cases[] = {{1, {2 * kHour, 3 * kHour, 30 * kHour}},
                                                                    {2, {3 * kHour, 30 * kHour}}};
  for (const auto& c : cases) {
    const std::string name = "rot" + std::to_string(c.policy), folder = "/volume1/photo/" + name;
    WriteFile(folder + "/mine/x", "not a version");
    const PObject add = With(AddTaskRequest(name, "/DCIM", "/" + name), "enable_rotation", Num(1));
    const unsigned long id = Add(With(With(add, "max_version_count", Num(3)), "rotation_policy", Num(c.policy)));
    for (time_t at : runs) {
      now_ = kStart + at;
      EXPECT_EQ(RunTask(id), 0);
    }
    std::set<std::string> expected = {"mine"}, names;
    for (time_t at : c.kept) expected.insert(plovod::VersionName(kStart + at));
    for (const auto& entry : fs::directory_iterator(Path(folder))) names.insert(entry.path().filename());
    EXPECT_EQ(names, expected) << "policy " << c.policy;
  }
}

// A run cancelled while it copies a large file, then one cut short by pulling the card out: the files
// already whole stay, nothing partial is left or remembered, and the run on plugging back in copies
// only what is still missing.
TEST_F(EngineTest, CancelAndPullOutKeepWhatIsWhole) {
  for (const std::string name : {"a.jpg", "b.jpg", "big.bin", "c.jpg"}) WriteFile("/usbshare1/DCIM/" + name, name);
  fs::resize_file(Path("/usbshare1/DCIM/big.bin"), 8ul << 30);  // copied after a.jpg and b.jpg, before c.jpg
  const unsigned long id = Add(With(AddTaskRequest("Card"), "copy_strategy", Num(3)));
  ASSERT_TRUE(Ok(Trigger(id, "{}", true)));
  const std::string big = "/usbshare1/DCIM/big.bin";
  auto copyingBig = [&] {
    return plovo_test::Eventually([&] { return Listed(id)["copy_file_path"].asStringRef() == big; });
  };
  EXPECT_EQ(Listed(id)["latest_finish_time"].asUInt64(), 0u);
  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  EXPECT_EQ(Listed(id)["task_status"].asStringRef(), "running");
  EXPECT_EQ(Code(OnTask("run_task", id)), plovod::kConflict);
  ASSERT_TRUE(copyingBig());
  ASSERT_TRUE(Ok(OnTask("cancel_task", id)));
  const PObject cancelled = WaitIdle(id);
  EXPECT_EQ(cancelled["error_code"].asInt64(), P_ERR_STOPPED);
  EXPECT_NE(cancelled["latest_finish_time"].asUInt64(), 0u);
  const Tree whole = {{"a.jpg", "a.jpg"}, {"b.jpg", "b.jpg"}};
  EXPECT_EQ(Files("/volume1/photo/card"), whole);
  EXPECT_EQ(Rows(id).back(), "3/2 [\"Card\"]");
  plovo_test::RawDB memory(Path(TaskDir(id) + "/file-db.sqlite"));
  ASSERT_EQ(memory.Rows("SELECT source_path FROM file_info_table ORDER BY source_path"), "/a.jpg\n/b.jpg");

  const ino_t a = Stat("/volume1/photo/card/a.jpg").st_ino;
  ASSERT_TRUE(Ok(OnTask("run_task", id)));
  ASSERT_TRUE(copyingBig());
  PlugIn(false);
  ASSERT_TRUE(Ok(With(Action("device_removed"), "share_name", "usbshare1")));
  EXPECT_EQ(WaitIdle(id)["error_code"].asInt64(), P_ERR_SHARE_NOT_MOUNTED);
  EXPECT_EQ(Files("/volume1/photo/card"), whole);
  EXPECT_EQ(Rows(id).back(), "10/4 [\"Card\",\"usbshare1\"]");

  ASSERT_TRUE(fs::remove(Path("/usbshare1/DCIM/big.bin")));
  PlugIn(true);
  ASSERT_TRUE(Ok(With(Action("device_added"), "share_name", "usbshare1")));  // runs the task
  EXPECT_EQ(WaitIdle(id)["error_code"].asInt64(), 0);
  EXPECT_EQ(Files("/volume1/photo/card"), Merged(whole, {{"c.jpg", "c.jpg"}}));
  EXPECT_EQ(Stat("/volume1/photo/card/a.jpg").st_ino, a);
  EXPECT_EQ(Rows(id).back(), "2/1 [\"Card\",\"1\",\"5\",\"0\"]");
  EXPECT_THAT(Rows(0), Contains("5/1 [\"usbshare1\",\"Acme\",\"Card\"]"));
}

// A destination that fills: the files that fit are in place, the one that
// did not fit left no trace.
TEST_F(EngineTest, FullDestinationKeepsWhatFits) {
  MakeDir("/volume1/photo/full");
  if (mount("tmpfs", Path("/volume1/photo/full").c_str(), "tmpfs", 0, "size=2m") != 0)
    GTEST_SKIP() << "no tmpfs can be mounted here: " << strerror(errno);
  mounted_ = Path("/volume1/photo/full");
  const std::string fits(600 << 10, 'x');
  const Tree card = {{"a.jpg", fits}, {"b.jpg", fits}, {"c.mov", std::string(4 << 20, 'y')}, {"d.jpg", "after"}};
  for (const auto& [name, content] : card) WriteFile("/usbshare1/DCIM/" + name, content);
  const unsigned long id = Add(With(AddTaskRequest("Card", "/DCIM", "/full"), "copy_strategy", Num(3)));
  EXPECT_EQ(RunTask(id), P_ERR_DEST_QUOTA_FULL);
  EXPECT_EQ(Files("/volume1/photo/full"), (Tree{{"a.jpg", Bytes(fits)}, {"b.jpg", Bytes(fits)}}));
  EXPECT_EQ(Rows(id).back(), "8/4 [\"Card\",\"/photo/full\"]");
}

// What cannot or must not be copied is skipped with its row and the run
// goes on: a FIFO and a device node on the card; on export to a FAT card,
// a file of 4 GiB and names FAT cannot hold.
TEST_F(EngineTest, SkippedFilesGetTheirRowAndTheRunGoesOn) {
  WriteFile("/usbshare1/DCIM/a.jpg", "a");
  ASSERT_EQ(mkfifo(Path("/usbshare1/DCIM/fifo.jpg").c_str(), 0644), 0);
  ASSERT_EQ(mknod(Path("/usbshare1/DCIM/node.jpg").c_str(), S_IFCHR | 0644, makedev(1, 3)), 0) << strerror(errno);
  WriteFile("/usbshare1/DCIM/z.jpg", "z");
  const unsigned long in = Add(With(AddTaskRequest("In"), "copy_strategy", Num(2)));
  EXPECT_EQ(RunTask(in), 0);
  EXPECT_EQ(Files("/volume1/photo/card"), (Tree{{"a.jpg", "a"}, {"z.jpg", "z"}}));
  for (const std::string special : {"fifo.jpg", "node.jpg"})
    EXPECT_THAT(Rows(in), Contains(testing::HasSubstr("7/2 [\"/usbshare1/DCIM/" + special + "\","))) << special;

  std::string storage = ReadFile("/velt-dev/storage.json");  // the card's partition is FAT now
  WriteFile("/velt-dev/storage.json", storage.insert(storage.rfind("usbshare1") + 10, R"(, "file_system": "vfat")"));
  for (const std::string name : {"ok.jpg", "sub/a:b.jpg", "what?.jpg", "big.mov"})
    WriteFile("/volume1/photo/out/" + name, "ok");
  fs::resize_file(Path("/volume1/photo/out/big.mov"), 4ul << 30);
  const PObject add = With(AddTaskRequest("Out", "/back", "/out"), "task_type", Num(2));
  const unsigned long out = Add(With(add, "copy_strategy", Num(2)));
  EXPECT_EQ(RunTask(out), 0);
  EXPECT_EQ(Files("/usbshare1/back"), (Tree{{"ok.jpg", "ok"}}));
  for (const char* row : {"11/2 [\"/photo/out/big.mov\",\"4294967296\"]", "12/2 [\"/photo/out/sub/a:b.jpg\"]",
                          "12/2 [\"/photo/out/what?.jpg\"]"})
    EXPECT_THAT(Rows(out), Contains(row));
  // FAT keeps times to two seconds: a copy a second off is the same file.
  Touch("/usbshare1/back/ok.jpg", Stat("/volume1/photo/out/ok.jpg").st_mtime + 1);
  EXPECT_EQ(RunTask(out), 0);
  EXPECT_EQ(Rows(out).back(), "2/1 [\"Out\",\"0\",\"0\",\"0\"]");
}

// What a hostile tree may not cost: a folder too deep is skipped and stops
// the mirror's removals (what the walk could not see may still be on the
// card); a thousand special files flood no log; a user's file named like
// a version is no version for rotation.
TEST_F(EngineTest, HostileTreesCostNothingElse) {
  std::string deep = "/usbshare1/DCIM/deep";
  for (int i = 0; i < 130; ++i) deep += "/d";
  WriteFile(deep + "/x.jpg", "deep");
  WriteFile("/usbshare1/DCIM/a.jpg", "a");
  for (int i = 0; i < 1005; ++i) ASSERT_EQ(mkfifo(Path("/usbshare1/DCIM/f" + std::to_string(i)).c_str(), 0644), 0);
  WriteFile("/volume1/photo/mir/gone.jpg", "no longer on the card");
  const unsigned long mir = Add(With(AddTaskRequest("Mir", "/DCIM", "/mir"), "copy_strategy", Num(2)));
  EXPECT_EQ(RunTask(mir), 0);
  EXPECT_EQ(Files("/volume1/photo/mir"), (Tree{{"a.jpg", "a"}, {"gone.jpg", "no longer on the card"}}));
  const std::vector<std::string> rows = Rows(mir);
  EXPECT_EQ(std::count_if(rows.begin(), rows.end(), [](const std::string& row) { return row.rfind("7/", 0) == 0; }),
            1001);
  EXPECT_THAT(rows, Contains("7/2 [\"/usbshare1/DCIM\",\"6 more files could not be copied\"]"));

  WriteFile("/usbshare1/V/a.jpg", "a");
  WriteFile("/volume1/photo/ver/" + plovod::VersionName(kStart - 86400), "the user's file");
  const PObject add = With(AddTaskRequest("Ver", "/V", "/ver"), "enable_rotation", Num(1));
  const unsigned long ver = Add(With(add, "max_version_count", Num(1)));
  EXPECT_EQ(RunTask(ver), 0);
  EXPECT_EQ(Files("/volume1/photo/ver"), (Tree{{plovod::VersionName(kStart - 86400), "the user's file"},
                                               {plovod::VersionName(kStart) + "/a.jpg", "a"}}));
  // A version cut short is marked as such: no later run takes it for one.
  WriteFile("/usbshare1/V/big.bin", "");
  fs::resize_file(Path("/usbshare1/V/big.bin"), 8ul << 30);
  ASSERT_TRUE(Ok(OnTask("run_task", ver)));
  ASSERT_TRUE(plovo_test::Eventually([&] { return !Listed(ver)["copy_file_path"].asStringRef().empty(); }));
  ASSERT_TRUE(Ok(OnTask("cancel_task", ver)));
  EXPECT_EQ(WaitIdle(ver)["error_code"].asInt64(), P_ERR_STOPPED);
  EXPECT_EQ(ReadFile("/volume1/photo/ver/" + plovod::VersionName(kStart, 2) + ".incomplete/a.jpg"), "a");
}

// Overwrite never replaces the copy of another source: with the sources
// moved off the card it may be the only one left. A task turned to
// another source forgets what it copied from the first.
TEST_F(EngineTest, IncrementalMemoryFollowsItsSource) {
  WriteFile("/usbshare1/DCIM/100/IMG_0001.JPG", "first");
  PObject flat = With(With(AddTaskRequest("Flat"), "copy_strategy", Num(3)), "keep_dir_structure", Num(0));
  flat = With(With(flat, "conflict_policy", Num(2)), "remove_src_file", Num(1));
  const unsigned long id = Add(flat);
  EXPECT_EQ(RunTask(id), 0);
  WriteFile("/usbshare1/DCIM/101/IMG_0001.JPG", "second");  // the camera's numbers started again
  EXPECT_EQ(RunTask(id), 0);
  EXPECT_EQ(Files("/volume1/photo/card"), (Tree{{"IMG_0001.JPG", "first"}, {"IMG_0001 (1).JPG", "second"}}));
  EXPECT_EQ(Files("/usbshare1/DCIM"), Tree{});

  for (const char* folder : {"/usbshare1/DCIM/a.jpg", "/usbshare1/DCIM2/a.jpg"}) {
    WriteFile(folder, "same");
    Touch(folder, kStart);
  }
  EXPECT_EQ(RunTask(id), 0);
  const PObject moved = With(With(flat, "action", "set_task_setting"), "usb_folder_path", "/DCIM2");
  ASSERT_TRUE(Ok(With(moved, "task_id", Num(id))));
  EXPECT_EQ(RunTask(id), 0);
  EXPECT_EQ(ReadFile("/volume1/photo/card/a.jpg"), "same");
  EXPECT_EQ(Files("/usbshare1/DCIM2"), Tree{});  // copied (over a.jpg, its own earlier name) and moved
}

}  // namespace
