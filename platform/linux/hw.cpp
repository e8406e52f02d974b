// The buzzer. A development host has none: each beep is an event in the
// system log, so that a test or a developer can see it was sounded.
#include "velt/hw.h"

#include "dev-internal.h"
#include "velt/log.h"

namespace {

// The system-log event of a beep (docs/platform.md).
constexpr unsigned int kEventBeep = 0x11A00201;

}  // namespace

extern "C" {

int VELTBuzzerBeep(int kind) {
  if (VELT_FAULT_HIT()) return -1;
  if (kind != VELT_BEEP_SHORT && kind != VELT_BEEP_LONG) {
    VELT_FAIL(VLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  // Here the log line is the beep: when it cannot be written the beep has
  // failed, with the log writer's error.
  return VELTLogSet1(VELT_LOG_CATEGORY_SYSTEM, VELT_LOG_LEVEL_INFO, kEventBeep, "Buzzer",
                     kind == VELT_BEEP_SHORT ? "short" : "long", nullptr, nullptr) == 0
             ? 0
             : -1;
}

}  // extern "C"
