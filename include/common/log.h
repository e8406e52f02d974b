// The one logging function of the module, over syslog.
//
// Handlers and service control write "<file>:<line> <message>" through
// PLOVO_LOG; the library parts write "[ERR] <name>(<line>): <message>" and
// the like through PLOVO_LIB_LOG, where <name> is the source file's name
// without its extension ("task-db", "file-op"). Priorities are syslog's
// (LOG_ERR, LOG_WARNING, LOG_AUTH | LOG_CRIT, ...).
//
// Tests install a sink to see each line as it is written. LogWrite and
// SetLogSink may be called from several threads.
#ifndef PLOVO_COMMON_LOG_H
#define PLOVO_COMMON_LOG_H

#include <syslog.h>

#include <functional>
#include <string>

namespace Plovo {

void LogWrite(int priority, const char* format, ...) __attribute__((format(printf, 2, 3)));

// Replaces syslog with sink for every following line; an empty sink
// restores syslog. The sink receives the priority and the formatted line.
using LogSink = std::function<void(int priority, const std::string& line)>;
void SetLogSink(LogSink sink);

// Whether a line at priority would be written anywhere: always with a sink
// installed, otherwise when the process's syslog mask (setlogmask) admits
// it. Code that traces every value of a message asks once per message, so
// that a server which masks out debug lines pays nothing for them.
bool LogWillWrite(int priority);

// Length of a file name without its extension, for "[ERR] %s(%d): ".
constexpr int LogStemLength(const char* name) {
  int dot = -1, n = 0;
  for (; name[n] != '\0'; ++n) {
    if (name[n] == '.') dot = n;
  }
  return dot < 0 ? n : dot;
}

// The file name of a source path, for compilers without __FILE_NAME__.
constexpr const char* LogBaseName(const char* path) {
  const char* name = path;
  for (const char* p = path; *p != '\0'; ++p) {
    if (*p == '/') name = p + 1;
  }
  return name;
}

}  // namespace Plovo

#ifdef __FILE_NAME__
#define PLOVO_FILE_NAME __FILE_NAME__
#else
#define PLOVO_FILE_NAME ::Plovo::LogBaseName(__FILE__)
#endif

#define PLOVO_LOG(priority, format, ...) \
  ::Plovo::LogWrite((priority), "%s:%d " format, PLOVO_FILE_NAME, __LINE__, ##__VA_ARGS__)

#define PLOVO_LIB_LOG_(priority, tag, format, ...)                                            \
  ::Plovo::LogWrite((priority), tag " %.*s(%d): " format, ::Plovo::LogStemLength(PLOVO_FILE_NAME), \
                    PLOVO_FILE_NAME, __LINE__, ##__VA_ARGS__)
#define PLOVO_LIB_ERR(format, ...) PLOVO_LIB_LOG_(LOG_ERR, "[ERR]", format, ##__VA_ARGS__)
#define PLOVO_LIB_WARN(format, ...) PLOVO_LIB_LOG_(LOG_WARNING, "[WARN]", format, ##__VA_ARGS__)
#define PLOVO_LIB_INFO(format, ...) PLOVO_LIB_LOG_(LOG_INFO, "[INFO]", format, ##__VA_ARGS__)
#define PLOVO_LIB_DBG(format, ...) PLOVO_LIB_LOG_(LOG_DEBUG, "[DBG]", format, ##__VA_ARGS__)

#endif
