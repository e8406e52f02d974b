/*
 * Platform extended-attribute data: what the platform keeps about a file
 * (thumbnails, indexes, attributes of other file systems) beside the file
 * itself. Removing a file leaves that data behind unless it is removed too.
 */
#ifndef VELT_EA_H
#define VELT_EA_H

#include "velt/vlibc.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Removes the extended-attribute data kept for path. kind -1 removes every
 * kind; flags is reserved (0). Returns 0 when nothing is left (also when
 * there was nothing), negative with errno set when removal failed. The path
 * itself need not exist any more. */
VELT_API int VELTEARemove(const char* path, int kind, int flags);

#ifdef __cplusplus
}
#endif

#endif
