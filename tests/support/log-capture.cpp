#include "log-capture.h"

#include "common/log.h"

namespace plovo_test {

LogCapture::LogCapture() {
  Plovo::SetLogSink([state = state_](int priority, const std::string& line) {
    std::lock_guard<std::mutex> lock(state->mutex);
    state->lines.push_back({priority, line});
  });
}

LogCapture::~LogCapture() { Plovo::SetLogSink(nullptr); }

std::vector<LogCapture::Line> LogCapture::Lines() const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  return state_->lines;
}

bool LogCapture::Contains(const std::string& text) const {
  for (const Line& l : Lines()) {
    if (l.text.find(text) != std::string::npos) return true;
  }
  return false;
}

bool LogCapture::Contains(int priority, const std::string& text) const {
  for (const Line& l : Lines()) {
    if (l.priority == priority && l.text.find(text) != std::string::npos) return true;
  }
  return false;
}

std::string LogCapture::Dump() const {
  std::string out;
  for (const Line& l : Lines()) out += "<" + std::to_string(l.priority) + "> " + l.text + "\n";
  return out;
}

}  // namespace plovo_test
