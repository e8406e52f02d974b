// The usage-statistics document the platform's collector gathers: the
// package's settings, every registered device and every task's copy
// options, with no file names, paths or task names in it.
#ifndef PLOVO_SERVICE_USAGE_STATISTICS_H
#define PLOVO_SERVICE_USAGE_STATISTICS_H

#include "common/export.h"

// Prints the document, indented, on standard output and nothing else
// there. 0, or -1 (nothing printed) when the repository's task database
// cannot be opened or read.
PLOVO_EXPORT int CollectUageStatistics(void);

#endif
