// The bytes of a minimal JPEG with an EXIF capture date, as a camera
// writes one, for tests that import photos.
#ifndef PLOVO_TESTS_DAEMON_EXIF_JPEG_H
#define PLOVO_TESTS_DAEMON_EXIF_JPEG_H

#include <cstdint>
#include <string>

namespace plovo_test {

// SOI, an APP1 "Exif" segment holding a little-endian TIFF block whose
// IFD0 points to an EXIF IFD with one ASCII entry, tag (DateTimeOriginal
// unless told otherwise) = date, then EOI. date is written as given and
// cut or padded to the 19 characters of "YYYY:MM:DD HH:MM:SS" and a NUL.
inline std::string ExifJpeg(const std::string& date, uint16_t tag = 0x9003) {
  // IFD entries are tag, type, count, value; each IFD ends with a zero next-IFD offset.
  std::string jpeg(
      "\xFF\xD8\xFF\xE1\0\x48" "Exif\0\0"                   // SOI, APP1 of 72 bytes (its length counts itself)
      "II*\0\x08\0\0\0"                                     // TIFF header, IFD0 at 8
      "\x01\0\x69\x87\x04\0\x01\0\0\0\x1A\0\0\0\0\0\0\0"    // IFD0: a LONG, the EXIF IFD at 26
      "\x01\0\x03\x90\x02\0\x14\0\0\0\x2C\0\0\0\0\0\0\0",  // EXIF IFD: 20 ASCII bytes at 44
      56);
  jpeg[40] = static_cast<char>(tag & 0xff);
  jpeg[41] = static_cast<char>(tag >> 8);
  const std::string text = date.substr(0, 19);
  return jpeg + text + std::string(20 - text.size(), '\0') + "\xFF\xD9";
}

}  // namespace plovo_test

#endif
