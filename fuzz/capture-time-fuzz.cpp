// Feeds arbitrary bytes, as a photo's contents, to the EXIF reader that
// dates imported photos. Any input must end quickly without a crash or a
// leak, and a date it accepts must be a real calendar date and time.
#include <sys/mman.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <ctime>

#include "common/unique-fd.h"
#include "daemon/engine/capture-time.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  Plovo::UniqueFd fd(memfd_create("photo", MFD_CLOEXEC));
  if (fd.get() < 0 || write(fd.get(), data, size) != static_cast<ssize_t>(size)) abort();
  std::tm taken{};
  if (!plovod::ExifCaptureTime(fd.get(), taken)) return 0;
  // A date that mktime would have to normalise is one the reader let through.
  std::tm normalised = taken;
  normalised.tm_isdst = 0;
  if (taken.tm_year < -1899 || taken.tm_mon < 0 || taken.tm_mon > 11 || taken.tm_mday < 1 || taken.tm_hour < 0 ||
      taken.tm_hour > 23 || taken.tm_min < 0 || taken.tm_min > 59 || taken.tm_sec < 0 || taken.tm_sec > 59 ||
      timegm(&normalised) == -1 || normalised.tm_mday != taken.tm_mday) {
    abort();
  }
  return 0;
}
