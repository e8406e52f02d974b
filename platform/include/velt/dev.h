/*
 * Controls of the platform's development implementation. They exist only on
 * a development host, for tests and tools; module code never calls them.
 *
 * State: the development platform keeps its configuration and state under
 * the sandbox root named by the environment variable PLOVO_ROOT ("/" when
 * unset), in the folder "velt-dev" (docs/platform.md).
 *
 * Fault switches: any platform call can be told to fail, to reach the error
 * paths of its callers. A failing call returns its failure value and sets
 * the platform's last error to the switch's code. Switches are per process
 * and may be set and cleared from any thread.
 */
#ifndef VELT_DEV_H
#define VELT_DEV_H

#include "velt/vlibc.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Makes the platform call named `call` (e.g. "VLIBCFileGetKeyValue") fail on
 * its nth call from now (1 = the next call) and the times - 1 calls after
 * it; times below 1 means every call from the nth on. err is the code
 * VLIBCErrGet then reports. Setting a switch for a call replaces its old
 * one. */
VELT_API void VeltDevFailCall(const char* call, int nth, int times, int err);

/* Removes every fault switch. */
VELT_API void VeltDevClearFaults(void);

/* The development platform's state folder: $PLOVO_ROOT/velt-dev. The result
 * points to a thread-local buffer valid until the next call. */
VELT_API const char* VeltDevStateDir(void);

#ifdef __cplusplus
}
#endif

#endif
