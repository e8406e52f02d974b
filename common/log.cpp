#include "common/log.h"

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

}  // namespace

void SetLogSink(LogSink sink) {
  std::shared_ptr<const LogSink> next;
  if (sink) next = std::make_shared<const LogSink>(std::move(sink));
  std::lock_guard<std::mutex> lock(gSinkMutex);
  gSink = std::move(next);
}

void LogWrite(int priority, const char* format, ...) {
  std::shared_ptr<const LogSink> sink;
  {
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
