#include "daemon/engine/capture-time.h"

#include <fcntl.h>
#include <libexif/exif-data.h>
#include <strings.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <vector>

#include "common/unique-fd.h"

namespace {

// A JPEG's EXIF segment is at most 64 KiB and sits near its start, behind
// at most a few small segments; a TIFF-based raw keeps its IFDs there too.
// Reading no more than this bounds what a hostile or huge file costs.
constexpr size_t kHeadSize = 256 * 1024;

const char* const kPhotoExtensions[] = {"jpg", "jpeg", "heic", "heif", "png", "tif", "tiff", "dng", "cr2",
                                        "cr3", "nef",  "arw",  "orf",  "rw2", "raf", "srw",  "pef"};
const char* const kVideoExtensions[] = {"mp4", "mov", "m4v", "avi", "mts", "m2ts", "3gp", "mkv"};

struct ExifDataFree {
  void operator()(ExifData* data) const { exif_data_unref(data); }
};

// The position of the dot before the name's last extension, or npos. A
// leading dot (".jpg") names a hidden file, not an extension, and a
// trailing one ("a.") has no extension after it.
size_t ExtensionDot(const std::string& name) {
  size_t dot = name.rfind('.');
  size_t slash = name.rfind('/');
  if (dot == std::string::npos || dot + 1 == name.size()) return std::string::npos;
  if (dot == 0 || (slash != std::string::npos && dot <= slash + 1)) return std::string::npos;
  return dot;
}

template <size_t N>
bool HasExtension(const std::string& name, const char* const (&extensions)[N]) {
  size_t dot = ExtensionDot(name);
  if (dot == std::string::npos) return false;
  for (const char* ext : extensions) {
    if (strcasecmp(name.c_str() + dot + 1, ext) == 0) return true;
  }
  return false;
}

// "YYYY:MM:DD HH:MM:SS" as calendar fields. A camera whose clock was never
// set writes zeros or blanks there; those, and any field out of its range,
// are not a date.
bool ParseExifDate(const char* text, std::tm& taken) {
  if (text[4] != ':' || text[7] != ':' || text[10] != ' ' || text[13] != ':' || text[16] != ':') return false;
  std::tm t{};
  t.tm_year = plovod::DecimalDigits(text, 4) - 1900;
  t.tm_mon = plovod::DecimalDigits(text + 5, 2) - 1;
  t.tm_mday = plovod::DecimalDigits(text + 8, 2);
  t.tm_hour = plovod::DecimalDigits(text + 11, 2);
  t.tm_min = plovod::DecimalDigits(text + 14, 2);
  t.tm_sec = plovod::DecimalDigits(text + 17, 2);
  // Year 0, not digits, or a clock never set: such a date would make no
  // date folder that sorts with the others.
  if (t.tm_year < 1970 - 1900) return false;
  // timegm moves a field out of range into the next one (February 30th
  // becomes March 2nd), so a date that comes back changed was not one. It
  // also fills the week day and the day of the year.
  std::tm check = t;
  timegm(&check);
  if (check.tm_year != t.tm_year || check.tm_mon != t.tm_mon || check.tm_mday != t.tm_mday ||
      check.tm_hour != t.tm_hour || check.tm_min != t.tm_min || check.tm_sec != t.tm_sec) {
    return false;
  }
  taken = check;
  taken.tm_isdst = -1;
  return true;
}

std::string Format(const std::tm& taken, const char* format) {
  char text[64];
  size_t n = strftime(text, sizeof text, format, &taken);
  return std::string(text, n);
}

}  // namespace

namespace plovod {

int DecimalDigits(const char* text, int n) {
  int value = 0;
  for (int i = 0; i < n; ++i) {
    if (text[i] < '0' || text[i] > '9') return -1;
    value = value * 10 + (text[i] - '0');
  }
  return value;
}

bool IsPhoto(const std::string& name) { return HasExtension(name, kPhotoExtensions); }

bool IsVideo(const std::string& name) { return HasExtension(name, kVideoExtensions); }

bool ExifCaptureTime(int fd, std::tm& taken) {
  // Room in front for the header libexif expects before a bare TIFF block.
  const size_t front = 6;
  std::vector<unsigned char> buffer(front + kHeadSize);
  size_t size = 0;
  while (size < kHeadSize) {
    ssize_t n = pread(fd, buffer.data() + front + size, kHeadSize - size, static_cast<off_t>(size));
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    size += static_cast<size_t>(n);
  }
  const unsigned char* data = buffer.data() + front;
  if (size >= 4 && (std::memcmp(data, "II*\0", 4) == 0 || std::memcmp(data, "MM\0*", 4) == 0)) {
    // A TIFF-based raw is an EXIF block without the JPEG around it.
    std::memcpy(buffer.data(), "Exif\0\0", front);
    data = buffer.data();
    size += front;
  }
  std::unique_ptr<ExifData, ExifDataFree> exif(exif_data_new());
  if (!exif) return false;
  // By the book, libexif makes up the entries a file lacks (some of them
  // dates, set to now); only what the camera wrote is wanted here.
  exif_data_unset_option(exif.get(), EXIF_DATA_OPTION_FOLLOW_SPECIFICATION);
  exif_data_load_data(exif.get(), data, static_cast<unsigned int>(size));
  ExifEntry* entry = exif_content_get_entry(exif->ifd[EXIF_IFD_EXIF], EXIF_TAG_DATE_TIME_ORIGINAL);
  if (!entry || entry->format != EXIF_FORMAT_ASCII || !entry->data || entry->size < 19) return false;
  return ParseExifDate(reinterpret_cast<const char*>(entry->data), taken);
}

std::tm CaptureTime(int folder, const std::string& name, time_t mtime) {
  std::tm taken{};
  if (IsPhoto(name)) {
    // O_NONBLOCK: a FIFO given a photo's name must not hold the run up.
    Plovo::UniqueFd fd(openat(folder, name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    struct stat st;
    if (fd && fstat(fd.get(), &st) == 0 && S_ISREG(st.st_mode) && ExifCaptureTime(fd.get(), taken)) return taken;
  }
  localtime_r(&mtime, &taken);
  return taken;
}

std::string DateFolderName(const std::tm& taken) { return Format(taken, "%Y-%m-%d"); }

std::string CaptureName(const std::tm& taken, const std::string& name) {
  size_t dot = ExtensionDot(name);
  return Format(taken, "%Y%m%d_%H%M%S") + (dot == std::string::npos ? std::string() : name.substr(dot));
}

}  // namespace plovod
