// The module's entry points are called by C code in another program (the
// web server, the package's service scripts): no exception may leave them.
// NoThrow runs the body of one and turns an escaping exception into its
// failure result, with one error line ("Unexpected failure: <what>") under
// the entry point's own file and line.
#ifndef PLOVO_COMMON_NO_THROW_H
#define PLOVO_COMMON_NO_THROW_H

#include <exception>

#include "common/log.h"

namespace Plovo {

template <typename Fn, typename R>
R NoThrow(Fn body, R failed, const char* file = __builtin_FILE(), int line = __builtin_LINE()) {
  try {
    return body();
  } catch (const std::exception& e) {
    LogWrite(LOG_ERR, "%s:%d Unexpected failure: %s", LogBaseName(file), line, e.what());
  } catch (...) {
    LogWrite(LOG_ERR, "%s:%d Unexpected failure", LogBaseName(file), line);
  }
  return failed;
}

}  // namespace Plovo

#endif
