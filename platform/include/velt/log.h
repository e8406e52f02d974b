/*
 * The platform's system log, the event list an administrator reads in the
 * NAS's log viewer (not syslog). May be called from several threads.
 */
#ifndef VELT_LOG_H
#define VELT_LOG_H

#include "velt/vlibc.h"

#ifdef __cplusplus
extern "C" {
#endif

#define VELT_LOG_CATEGORY_SYSTEM 1
#define VELT_LOG_LEVEL_INFO 1
#define VELT_LOG_LEVEL_WARN 2
#define VELT_LOG_LEVEL_ERR 3

/* Appends one event: category, level, event id, source name and three
 * arguments (NULL is written as empty). Returns 0 on success, negative on
 * failure. */
VELT_API int VELTLogSet1(int category, int level, unsigned int eventId, const char* source,
                         const char* arg1, const char* arg2, const char* arg3);

#ifdef __cplusplus
}
#endif

#endif
