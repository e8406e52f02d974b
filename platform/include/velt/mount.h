/*
 * Platform volumes: the NAS's storage volumes and their mount state.
 * Every call may be made from several threads; failures set the platform's
 * last error (vlibc.h).
 */
#ifndef VELT_MOUNT_H
#define VELT_MOUNT_H

#include "velt/vlibc.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Where a volume's disks are. Only internal volumes may hold a repository. */
#define VELT_VOL_LOCATION_UNKNOWN 0
#define VELT_VOL_LOCATION_INTERNAL 1
#define VELT_VOL_LOCATION_EXTERNAL 2

/* One volume. Lists returned by VELTMountVolAllEnum are chained by pNext. */
typedef struct _tag_VELTMOUNTVOLINFO {
  char szPath[4096];                /* the volume's path, e.g. /volume1 */
  int isMounted;                    /* 1 mounted, 0 not */
  int isWritable;                   /* 1 writable, 0 read-only */
  int location;                     /* VELT_VOL_LOCATION_* */
  unsigned long long freeBytes;     /* space left */
  unsigned long long totalBytes;    /* size */
  struct _tag_VELTMOUNTVOLINFO* pNext;
} VELTMOUNTVOLINFO, *PVELTMOUNTVOLINFO;

/* Describes the mounted volume whose path is exactly path (a trailing '/'
 * is ignored). On success returns 0 and stores in *ppInfo a description that
 * the caller frees with VELTMountVolInfoFree. Fails (negative, *ppInfo NULL)
 * when no volume has that path (VLIBC_ERR_NOT_FOUND) or it is not mounted
 * (VLIBC_ERR_NOT_MOUNTED). */
VELT_API int VELTMountVolInfoGet(const char* path, PVELTMOUNTVOLINFO* ppInfo);

/* Lists every volume, mounted or not, in the platform's order. Returns the
 * number of volumes and stores the chained list (NULL when there is none) in
 * *ppList, freed by the caller with VELTMountVolInfoFree; negative on
 * failure. */
VELT_API int VELTMountVolAllEnum(PVELTMOUNTVOLINFO* ppList);

/* Frees a description or a whole list. NULL is allowed. */
VELT_API void VELTMountVolInfoFree(PVELTMOUNTVOLINFO pInfo);

#ifdef __cplusplus
}
#endif

#endif
