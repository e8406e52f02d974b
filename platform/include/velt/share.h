/*
 * Platform shares and the devices behind them: a share's mount state and
 * mount point, the block device behind a mounted path, a device's
 * file-system identity, and ejecting a share's device. Every call may be
 * made from several threads; failures set the platform's last error
 * (vlibc.h).
 */
#ifndef VELT_SHARE_H
#define VELT_SHARE_H

#include "velt/vlibc.h"

#ifdef __cplusplus
extern "C" {
#endif

/* One share. */
typedef struct _tag_VELTSHAREINFO {
  char szName[256];   /* the share's name, e.g. usbshare1 */
  char szPath[4096];  /* where it is (or would be) mounted */
  int isMounted;      /* 1 mounted, 0 not */
} VELTSHAREINFO, *PVELTSHAREINFO;

/* Describes the share named name, mounted or not. On success returns 0 and
 * stores in *ppInfo a description freed with VELTShareInfoFree; fails
 * (negative, *ppInfo NULL) with VLIBC_ERR_NOT_FOUND for an unknown name. */
VELT_API int VELTShareInfoGet(const char* name, PVELTSHAREINFO* ppInfo);

/* Frees a description. NULL is allowed. */
VELT_API void VELTShareInfoFree(PVELTSHAREINFO pInfo);

/* Writes into devPath (size bytes) the block device that holds path, a
 * mounted share's mount point or a path under it. Returns 0; negative with
 * VLIBC_ERR_NOT_FOUND when no mounted share holds the path or its device is
 * unknown, VLIBC_ERR_BAD_PARAMETER when the name does not fit. */
VELT_API int VELTDevPathGet(const char* path, char* devPath, size_t size);

/* Writes into uuid (size bytes) the identity of the file system on the
 * block device devPath. Returns 0; negative with VLIBC_ERR_NOT_FOUND when
 * the device holds no file system with an identity, VLIBC_ERR_IO when it
 * cannot be read, VLIBC_ERR_BAD_PARAMETER when the identity does not fit. */
VELT_API int VELTDevFsUuidGet(const char* devPath, char* uuid, size_t size);

/* Writes into binPath (size bytes) the base path under which a package
 * keeps its own folders on the volume volPath (a path such as /volume1).
 * Returns 0; negative with VLIBC_ERR_BAD_PARAMETER for a null or empty
 * volume path or a result that does not fit. */
VELT_API int VELTShareBinPathGet(const char* volPath, char* binPath, size_t size);

/* Ejects the removable device behind the share named name, as a NAS does
 * after a task set to eject its device: the share is unmounted and the
 * event logged. Returns 0; negative with VLIBC_ERR_NOT_FOUND for an unknown
 * name, VLIBC_ERR_NOT_MOUNTED for a share that is not mounted,
 * VLIBC_ERR_BAD_PARAMETER for a null or empty name, VLIBC_ERR_BAD_CONFIG
 * when the platform's share list cannot be read and VLIBC_ERR_IO when it
 * cannot be written. */
VELT_API int VELTShareEject(const char* name);

#ifdef __cplusplus
}
#endif

#endif
