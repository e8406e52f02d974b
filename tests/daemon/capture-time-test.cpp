// Photo dates from EXIF, the fall back to the modification time, and the
// folder and file names made of them.
#include "daemon/engine/capture-time.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <future>
#include <tuple>

#include "common/unique-fd.h"
#include "exif-jpeg.h"
#include "sandbox.h"

namespace {

using plovo_test::ExifJpeg;

constexpr time_t kMtime = 1000000000;
const std::string kDate = "2024:02:29 23:59:59", kTaken = "20240229_235959";

using CaptureTimeTest = plovo_test::SandboxTest;

// The capture time of root/name when its mtime is kMtime, or "mtime" when it is that.
std::string Taken(const std::string& root, const std::string& name) {
  Plovo::UniqueFd folder(open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  std::tm t = plovod::CaptureTime(folder.get(), name, kMtime), copy = t;
  return mktime(&copy) == kMtime ? "mtime" : plovod::CaptureName(t, "");
}

TEST_F(CaptureTimeTest, PhotosTakeTheirExifDateAndAnythingElseItsMtime) {
  const std::string good = ExifJpeg(kDate), raw = good.substr(12, 64);  // raw: the bare TIFF block
  const std::tuple<const char*, std::string, std::string> cases[] = {  // name, content, capture time
      {"a.jpg", good, kTaken}, {"B.JPEG", good, kTaken}, {"raw.nef", raw, kTaken}, {"clip.mp4", good, "mtime"},
      {"digitized.jpg", ExifJpeg(kDate, 0x9004), "mtime"}, {"no-leap.jpg", ExifJpeg("2025:02:29 10:00:00"), "mtime"},
      {"year0.jpg", ExifJpeg("0000:01:01 00:00:00"), "mtime"}, {"5x.jpg", ExifJpeg("2026:11:23 14:30:5x"), "mtime"},
      {"dashes.jpg", ExifJpeg("2026-11-23 14:30:05"), "mtime"}, {"t.jpg", ExifJpeg("2026:11:23T14:30:05"), "mtime"}};
  for (const auto& [name, content, taken] : cases) {
    WriteFile(std::string("/") + name, content);
    EXPECT_EQ(Taken(Root(), name), taken) << name;
  }
}

// A FIFO is not waited on, nor a link followed; EXIF is read from the file's start whatever its offset.
TEST_F(CaptureTimeTest, OnlyRegularFilesAreReadAndFromTheirStart) {
  ASSERT_EQ(mkfifo(Path("/x.jpg").c_str(), 0600), 0);
  auto fifo = std::async(std::launch::async, [this] { return Taken(Root(), "x.jpg"); });
  const bool done = fifo.wait_for(std::chrono::seconds(5)) == std::future_status::ready;
  if (!done) close(open(Path("/x.jpg").c_str(), O_WRONLY | O_NONBLOCK));  // lets a blocked reader go
  EXPECT_TRUE(done);
  EXPECT_EQ(fifo.get(), "mtime");
  WriteFile("/a.jpg", ExifJpeg(kDate));
  ASSERT_EQ(symlink("a.jpg", Path("/link.jpg").c_str()), 0);
  EXPECT_EQ(Taken(Root(), "link.jpg"), "mtime");
  Plovo::UniqueFd fd(open(Path("/a.jpg").c_str(), O_RDONLY | O_CLOEXEC));
  std::tm t{};
  ASSERT_GT(lseek(fd.get(), 0, SEEK_END), 0);
  EXPECT_TRUE(plovod::ExifCaptureTime(fd.get(), t) && plovod::CaptureName(t, "") == kTaken);
}

TEST(CaptureNames, KindsAndNamesFollowTheLastExtensionAsWritten) {
  std::tm t{};
  t.tm_year = 2026 - 1900, t.tm_mon = 10, t.tm_mday = 3, t.tm_hour = 4, t.tm_min = 5, t.tm_sec = 6;
  EXPECT_EQ(plovod::DateFolderName(t), "2026-11-03");
  const std::tuple<const char*, bool, bool, const char*> cases[] = {  // name, photo, video, extension kept
      {"IMG_1.JPG", true, false, ".JPG"}, {"x.txt.Dng", true, false, ".Dng"}, {"MVI_2.MoV", false, true, ".MoV"},
      {"x.jpg.txt", false, false, ".txt"}, {".jpg", false, false, ""}, {"README", false, false, ""}};
  for (const auto& [name, photo, video, extension] : cases) {
    EXPECT_EQ(plovod::IsPhoto(name), photo) << name;
    EXPECT_EQ(plovod::IsVideo(name), video) << name;
    EXPECT_EQ(plovod::CaptureName(t, name), std::string("20261103_040506") + extension) << name;
  }
}

}  // namespace
