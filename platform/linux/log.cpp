// The system log: one tab-separated line per event in velt-dev/system.log.
#include "velt/log.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <string>

#include "dev-internal.h"

namespace {

// Tabs and line breaks inside a field would shift the columns or split the
// event over two lines.
void AppendField(std::string* line, const char* field) {
  *line += '\t';
  for (const char* p = field ? field : ""; *p; ++p) {
    *line += (*p == '\t' || *p == '\n' || *p == '\r') ? ' ' : *p;
  }
}

// Local time as 2024-05-01T12:34:56+02:00.
std::string Timestamp() {
  time_t now = time(nullptr);
  struct tm local;
  localtime_r(&now, &local);
  char date[32];
  strftime(date, sizeof date, "%Y-%m-%dT%H:%M:%S", &local);
  long minutes = std::labs(local.tm_gmtoff) / 60;
  char zone[32];
  std::snprintf(zone, sizeof zone, "%c%02ld:%02ld", local.tm_gmtoff < 0 ? '-' : '+', minutes / 60,
                minutes % 60);
  return std::string(date) + zone;
}

}  // namespace

extern "C" {

int VELTLogSet1(int category, int level, unsigned int eventId, const char* source, const char* arg1,
                const char* arg2, const char* arg3) {
  if (VELT_FAULT_HIT()) return -1;
  char numbers[64];
  std::snprintf(numbers, sizeof numbers, "\t%d\t%d\t0x%08X", category, level, eventId);
  std::string line = Timestamp() + numbers;
  AppendField(&line, source);
  AppendField(&line, arg1);
  AppendField(&line, arg2);
  AppendField(&line, arg3);
  line += '\n';

  const std::string dir = velt_dev::StateDir();
  if (mkdir(dir.c_str(), 0755) != 0 && errno != EEXIST) {
    VELT_FAIL(VLIBC_ERR_IO);
    return -1;
  }
  const std::string path = dir + "/system.log";
  int fd = open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
  if (fd < 0) {
    VELT_FAIL(VLIBC_ERR_IO);
    return -1;
  }
  // One write per event: with O_APPEND the kernel places it whole at the
  // end, so events of several processes never interleave.
  ssize_t n;
  do {
    n = write(fd, line.data(), line.size());
  } while (n < 0 && errno == EINTR);
  bool ok = n == static_cast<ssize_t>(line.size());
  ok = (close(fd) == 0) && ok;
  if (!ok) {
    VELT_FAIL(VLIBC_ERR_IO);
    return -1;
  }
  return 0;
}

}  // extern "C"
