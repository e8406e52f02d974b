// When a photo or a video was taken, for the date folders and the names
// of a photo import: a photo's EXIF DateTimeOriginal (read with libexif),
// else its modification time; a video's modification time. Times are the
// camera's local time, as the camera wrote them, so nothing is converted.
#ifndef PLOVO_DAEMON_ENGINE_CAPTURE_TIME_H
#define PLOVO_DAEMON_ENGINE_CAPTURE_TIME_H

#include <ctime>
#include <string>

namespace plovod {

// Whether the name's extension (any letter case) is one a camera writes
// for a photo (jpg, jpeg, heic, png, raw formats, ...) or a video (mp4,
// mov, mts, ...).
bool IsPhoto(const std::string& name);
bool IsVideo(const std::string& name);

// The EXIF DateTimeOriginal of the open file fd, a JPEG or a TIFF-based
// raw (read from its start; the offset is not used), as local calendar
// fields; false when the file has none, or one that is not a valid date.
// Reads no more than the file's first 256 KiB, where the EXIF block lies,
// so a hostile file costs a bounded amount of memory and time.
bool ExifCaptureTime(int fd, std::tm& taken);

// The capture time of the file name in its open folder: for a photo its
// EXIF date when it has one; otherwise (videos, other files) mtime in
// local time.
std::tm CaptureTime(int folder, const std::string& name, time_t mtime);

// The n decimal digits at text as a number, or -1 when any of them is not
// a digit: the fields of the dates in EXIF blocks and version names.
int DecimalDigits(const char* text, int n);

// "2026-11-23", the date folder of a capture time.
std::string DateFolderName(const std::tm& taken);
// "20261123_143005" followed by the name's own extension (".JPG" stays
// ".JPG"), the name of a renamed photo or video.
std::string CaptureName(const std::tm& taken, const std::string& name);

}  // namespace plovod

#endif
