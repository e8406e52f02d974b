// Marks the module's entry points: C linkage, visible outside the module.
// Everything else is hidden (the build's default visibility and the
// module's version script).
#ifndef PLOVO_COMMON_EXPORT_H
#define PLOVO_COMMON_EXPORT_H

#define PLOVO_EXPORT extern "C" __attribute__((visibility("default")))

#endif
