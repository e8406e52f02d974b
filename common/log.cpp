#include "common/log.h"

#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <memory>
#include <mutex>
#include <vector>

namespace Plovo {
namespace {

std::mutex gSinkMutex;
// Shared so that a line being written keeps its sink alive while another
// thread replaces it.
std::shared_ptr<const LogSink> gSink;
// Whether gSink is set, readable without the mutex: lines headed for syslog
// (every line in production) take no lock here, and syslog drops masked-out
// priorities before formatting them.
std::atomic<bool> gHasSink{false};

}  // namespace

void SetLogSink(LogSink sink) {
  std::shared_ptr<const LogSink> next;
  if (sink) next = std::make_shared<const LogSink>(std::move(sink));
  std::lock_guard<std::mutex> lock(gSinkMutex);
  gHasSink = next != nullptr;
  gSink = std::move(next);
}

bool LogWillWrite(int priority) {
  return gHasSink || (setlogmask(0) & LOG_MASK(LOG_PRI(priority))) != 0;
}

void LogWrite(int priority, const char* format, ...) {
  std::shared_ptr<const LogSink> sink;
  if (gHasSink) {
    std::lock_guard<std::mutex> lock(gSinkMutex);
    sink = gSink;
  }
  va_list args;
  va_start(args, format);
  if (!sink) {
    vsyslog(priority, format, args);
    va_end(args);
    return;
  }
  va_list copy;
  va_copy(copy, args);
  int n = std::vsnprintf(nullptr, 0, format, copy);
  va_end(copy);
  std::string line;
  if (n > 0) {
    std::vector<char> buffer(static_cast<size_t>(n) + 1);
    std::vsnprintf(buffer.data(), buffer.size(), format, args);
    line.assign(buffer.data(), static_cast<size_t>(n));
  }
  va_end(args);
  (*sink)(priority, line);
}

}  // namespace Plovo
