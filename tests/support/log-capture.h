// Captures the module's log lines for the lifetime of the object, instead of
// sending them to syslog. Only one capture may live at a time.
#ifndef PLOVO_TESTS_SUPPORT_LOG_CAPTURE_H
#define PLOVO_TESTS_SUPPORT_LOG_CAPTURE_H

#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace plovo_test {

class LogCapture {
 public:
  struct Line {
    int priority;
    std::string text;
  };

  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<Line> Lines() const;
  // True when a line contains text.
  bool Contains(const std::string& text) const;
  // True when a line at exactly this priority contains text.
  bool Contains(int priority, const std::string& text) const;
  // Every line, one per row, for failure messages.
  std::string Dump() const;

 private:
  // Shared with the sink: a line another thread is still writing when the
  // capture ends lands here rather than in a destroyed object.
  struct State {
    std::mutex mutex;
    std::vector<Line> lines;
  };
  std::shared_ptr<State> state_ = std::make_shared<State>();
};

}  // namespace plovo_test

#endif
