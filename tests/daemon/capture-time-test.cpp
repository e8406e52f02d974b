// Photo dates from EXIF, the fall back to the modification time, and the
// folder and file names made of them.
#include "daemon/engine/capture-time.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cstdlib>
#include <optional>

#include "common/unique-fd.h"
#include "exif-jpeg.h"
#include "sandbox.h"

namespace {

using plovo_test::ExifJpeg;

constexpr time_t kMtime = 1000000000;
constexpr const char* kMtimeText = "2001-09-09 01:46:40";  // kMtime in UTC

class CaptureTimeTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    if (const char* tz = std::getenv("TZ")) oldTz_ = tz;
    setenv("TZ", "UTC0", 1);
    tzset();
    folder_.reset(open(Root().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    ASSERT_TRUE(folder_);
  }
  void TearDown() override {
    oldTz_ ? setenv("TZ", oldTz_->c_str(), 1) : unsetenv("TZ");
    tzset();
    SandboxTest::TearDown();
  }
  // The capture time of name, as "YYYY-MM-DD HH:MM:SS", when its mtime is kMtime.
  std::string Taken(const std::string& name) {
    std::tm t = plovod::CaptureTime(folder_.get(), name, kMtime);
    char text[32];
    return std::string(text, strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S", &t));
  }
  Plovo::UniqueFd folder_;
  std::optional<std::string> oldTz_;
};

TEST_F(CaptureTimeTest, PhotosTakeTheirExifDateAndAnythingElseItsMtime) {
  const std::string good = ExifJpeg("2026:11:23 14:30:05");
  std::string lying = good;
  lying[4] = lying[5] = '\xFF';  // APP1 length far past the end of the file
  const struct {
    const char* name;
    std::string content;
    const char* taken;
  } cases[] = {{"a.jpg", good, "2026-11-23 14:30:05"},
               {"B.JPEG", good, "2026-11-23 14:30:05"},
               {"raw.dng", good.substr(12, good.size() - 14), "2026-11-23 14:30:05"},  // bare TIFF
               {"leap.jpg", ExifJpeg("2024:02:29 23:59:59"), "2024-02-29 23:59:59"},
               {"no-leap.jpg", ExifJpeg("2025:02:29 10:00:00"), kMtimeText},
               {"month13.jpg", ExifJpeg("2026:13:01 10:00:00"), kMtimeText},
               {"hour24.jpg", ExifJpeg("2026:11:23 24:00:00"), kMtimeText},
               {"zeros.jpg", ExifJpeg("0000:00:00 00:00:00"), kMtimeText},
               {"year0.jpg", ExifJpeg("0000:01:01 00:00:00"), kMtimeText},
               {"blank.jpg", ExifJpeg("    :  :     :  :  "), kMtimeText},
               {"garbage.jpg", ExifJpeg("2026:11:23 14:30:5x"), kMtimeText},
               {"dashes.jpg", ExifJpeg("2026-11-23 14:30:05"), kMtimeText},
               {"t.jpg", ExifJpeg("2026:11:23T14:30:05"), kMtimeText},
               {"short.jpg", ExifJpeg("2026:11:23"), kMtimeText},
               {"digitized.jpg", ExifJpeg("2026:11:23 14:30:05", 0x9004), kMtimeText},
               {"no-exif.jpg", "\xFF\xD8\xFF\xD9", kMtimeText},
               {"truncated.jpg", good.substr(0, 40), kMtimeText},
               {"lying.jpg", lying, kMtimeText},
               {"text.jpg", "not a picture at all", kMtimeText},
               {"clip.mp4", good, kMtimeText},
               {"notes.txt", good, kMtimeText}};
  for (const auto& c : cases) {
    WriteFile(std::string("/") + c.name, c.content);
    EXPECT_EQ(Taken(c.name), c.taken) << c.name;
  }
}

// A FIFO is not waited on, a link not followed out of the folder.
TEST_F(CaptureTimeTest, OnlyRegularFilesAreRead) {
  ASSERT_EQ(mkfifo(Path("/x.jpg").c_str(), 0600), 0);
  EXPECT_EQ(Taken("x.jpg"), kMtimeText);
  WriteFile("/a.jpg", ExifJpeg("2026:11:23 14:30:05"));
  ASSERT_EQ(symlink("a.jpg", Path("/link.jpg").c_str()), 0);
  EXPECT_EQ(Taken("link.jpg"), kMtimeText);
}

TEST_F(CaptureTimeTest, ExifIsReadFromTheStartWhateverTheOffset) {
  WriteFile("/a.jpg", ExifJpeg("2026:11:23 14:30:05"));
  Plovo::UniqueFd fd(open(Path("/a.jpg").c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_GT(lseek(fd.get(), 0, SEEK_END), 0);
  std::tm t{};
  ASSERT_TRUE(plovod::ExifCaptureTime(fd.get(), t));
  EXPECT_EQ(plovod::CaptureName(t, "a.jpg"), "20261123_143005.jpg");
}

TEST(CaptureNames, KindsAndNamesFollowTheLastExtensionAsWritten) {
  std::tm t{};
  t.tm_year = 2026 - 1900, t.tm_mon = 10, t.tm_mday = 3, t.tm_hour = 4, t.tm_min = 5, t.tm_sec = 6;
  EXPECT_EQ(plovod::DateFolderName(t), "2026-11-03");
  const struct {
    const char* name;
    bool photo, video;
    const char* renamed;
  } cases[] = {{"IMG_1.JPG", true, false, "20261103_040506.JPG"}, {"x.txt.Dng", true, false, "20261103_040506.Dng"},
               {"MVI_2.MoV", false, true, "20261103_040506.MoV"}, {"c.m2ts", false, true, "20261103_040506.m2ts"},
               {"x.jpg.txt", false, false, "20261103_040506.txt"}, {"README", false, false, "20261103_040506"},
               {".jpg", false, false, "20261103_040506"},        {"jpg", false, false, "20261103_040506"}};
  for (const auto& c : cases) {
    EXPECT_EQ(plovod::IsPhoto(c.name), c.photo) << c.name;
    EXPECT_EQ(plovod::IsVideo(c.name), c.video) << c.name;
    EXPECT_EQ(plovod::CaptureName(t, c.name), c.renamed) << c.name;
  }
}

}  // namespace
