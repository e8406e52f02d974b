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
// cut or padded to the 19 characters of "YYYY:MM:DD HH:MM:SS".
inline std::string ExifJpeg(const std::string& date, uint16_t tag = 0x9003) {
  std::string tiff;
  auto put16 = [&tiff](uint32_t v) {
    tiff += static_cast<char>(v & 0xff);
    tiff += static_cast<char>(v >> 8 & 0xff);
  };
  auto put32 = [&](uint32_t v) {
    put16(v & 0xffff);
    put16(v >> 16);
  };
  // One-entry IFD: count, entry (tag, type, count, value), next IFD = 0.
  auto ifd = [&](uint16_t entryTag, uint16_t type, uint32_t count, uint32_t value) {
    put16(1);
    put16(entryTag);
    put16(type);
    put32(count);
    put32(value);
    put32(0);
  };
  tiff = std::string("II*\0", 4);
  put32(8);                        // IFD0 right after the header
  ifd(0x8769, 4, 1, 8 + 18);       // LONG: where the EXIF IFD starts
  ifd(tag, 2, 20, 8 + 18 + 18);    // ASCII, 19 characters and a NUL
  std::string text = date.substr(0, 19);
  tiff += text + std::string(20 - text.size(), '\0');
  const std::string body = std::string("Exif\0\0", 6) + tiff;
  const size_t length = body.size() + 2;  // the length counts itself
  return std::string("\xFF\xD8\xFF\xE1", 4) + static_cast<char>(length >> 8) + static_cast<char>(length & 0xff) +
         body + "\xFF\xD9";
}

}  // namespace plovo_test

#endif
