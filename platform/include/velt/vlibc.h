/*
 * Platform C library: key/value files, processes and the platform's last
 * error. On a NAS the firmware provides these; platform/linux implements
 * them for a development host.
 *
 * Every call records its failure as the platform's last error of the calling
 * thread (code, and the platform's own source file and line), readable with
 * VLIBCErrGet, VLIBCErrorGetFile and VLIBCErrorGetLine until the next failing
 * call of the same thread. Every call may be made from several threads.
 */
#ifndef VELT_VLIBC_H
#define VELT_VLIBC_H

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

#define VELT_API __attribute__((visibility("default")))

/* Platform error codes (VLIBCErrGet). */
#define VLIBC_ERR_NONE 0x0000
#define VLIBC_ERR_BAD_PARAMETER 0x0100
#define VLIBC_ERR_NOT_FOUND 0x0200   /* file, volume or entry does not exist */
#define VLIBC_ERR_IO 0x0300          /* reading or writing failed */
#define VLIBC_ERR_NO_MEMORY 0x0400
#define VLIBC_ERR_EXEC 0x0500        /* a program could not run or failed */
#define VLIBC_ERR_NOT_MOUNTED 0x0600
#define VLIBC_ERR_BAD_CONFIG 0x0700  /* the platform's own configuration is unreadable */

/*
 * Key/value files hold one line per key: key="value". Lines of any other
 * shape are kept as they are when the file is rewritten.
 */

/* Reads key's value into buffer (always NUL-terminated, cut to size - 1
 * bytes). Returns the number of bytes stored including the NUL (so at least
 * 1) when the key is found, 0 when the file has no such key, and a negative
 * number when the file cannot be read. flags is reserved (0). */
VELT_API int VLIBCFileGetKeyValue(const char* file, const char* key, char* buffer, size_t size,
                                  int flags);

/* Sets key to value: replaces the key's line, or appends one, using format
 * (a printf format taking key and value, normally "%s=\"%s\"\n"). Creates the
 * file when missing. The file is replaced atomically. Returns 0 on success,
 * negative on failure. */
VELT_API int VLIBCFileSetKeyValue(const char* file, const char* key, const char* value,
                                  const char* format);

/* Returns 1 when key holds exactly value, 0 when it holds another value or is
 * absent, negative when the file cannot be read. flags is reserved (0). */
VELT_API int VLIBCFileCheckKeyValue(const char* file, const char* key, const char* value,
                                    int flags);

/* Removes key's line. Returns 0 on success (also when the key is absent),
 * negative when the file cannot be read or written. */
VELT_API int VLIBCFileRemoveKey(const char* file, const char* key);

/* Returns 1 when path names an existing file or folder, 0 otherwise. */
VELT_API int VLIBCFileExist(const char* path);

/* Runs program with up to four arguments (unused ones NULL; the list ends at
 * the first NULL) and waits for it. Returns 0 when it exits with status 0,
 * negative when it cannot be started, exits non-zero or is killed. */
VELT_API int VLIBCExec(const char* program, const char* arg1, const char* arg2, const char* arg3,
                       const char* arg4);

/* Starts program like VLIBCExec but does not wait; the child is reaped by a
 * detached intermediate process. Returns 0 when it was started, negative
 * otherwise. */
VELT_API int VLIBCBackgroundExec(const char* program, const char* arg1, const char* arg2,
                                 const char* arg3, const char* arg4);

/* Returns the process id written in a pid file, or a number below 1 when the
 * file is missing or holds no positive number. */
VELT_API int VLIBCReadPidFile(const char* path);

/* Returns 1 when a process with this id exists, 0 otherwise. */
VELT_API int VLIBCProcAlive(int pid);

/* The calling thread's last platform error: code, the platform's source file
 * (a static string, never NULL) and line. */
VELT_API int VLIBCErrGet(void);
VELT_API const char* VLIBCErrorGetFile(void);
VELT_API int VLIBCErrorGetLine(void);

#ifdef __cplusplus
}
#endif

#endif
