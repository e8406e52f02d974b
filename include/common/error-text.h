// The text of an errno value, safe to build on any thread.
//
// strerror() may hand every thread the same buffer, and the module runs
// requests on several threads; ErrorText keeps its text in itself instead.
// It is meant to be made in the argument list of a log call:
//
//   PLOVO_LIB_WARN("read: %s", Plovo::ErrorText(errno).c_str());
//
// The temporary lives until the log call returns, and two of them in one
// call each keep their own text. The texts are the C library's, the same
// strerror() gives ("Unknown error" when it has none).
#ifndef PLOVO_COMMON_ERROR_TEXT_H
#define PLOVO_COMMON_ERROR_TEXT_H

#include <cerrno>
#include <cstdio>
#include <cstring>

namespace Plovo {

class ErrorText {
 public:
  // Leaves errno as it was, so that errno may be passed in the same
  // argument list whatever the order the arguments are evaluated in.
  explicit ErrorText(int errnum) {
    int saved = errno;
    // Which strerror_r the headers declare (GNU: returns the text, which
    // may be a static string; XSI: fills the buffer and returns 0) depends
    // on feature macros; the overloads accept either.
    const char* text = Pick(strerror_r(errnum, text_, sizeof text_), text_);
    if (text != text_) std::snprintf(text_, sizeof text_, "%s", text);
    errno = saved;
  }

  const char* c_str() const { return text_; }

 private:
  [[maybe_unused]] static const char* Pick(int result, const char* buffer) {
    return result == 0 ? buffer : "Unknown error";
  }
  [[maybe_unused]] static const char* Pick(const char* result, const char*) { return result; }

  char text_[128];
};

}  // namespace Plovo

#endif
