// The result codes shared by Channel, PStream and the copy daemon's answers.
// 0 is success; every failure is negative. A code's text is looked up by its
// negation; anything beyond the table reads "Unknown error".
#ifndef PLOVO_IPC_ERROR_CODE_H
#define PLOVO_IPC_ERROR_CODE_H

enum PErrorCode {
  P_SUCCESS = 0,
  P_ERR_INTERRUPTED = -1,        // cancel flag raised; local resource failure in PStream
  P_ERR_IO = -2,                 // peer closed, recv/send error, closed channel
  P_ERR_SYSTEM = -3,             // a system call failed
  P_ERR_INVALID_ARGUMENT = -4,   // bad argument, oversize block, disk full on receive
  P_ERR_TIMEOUT = -5,            // time limit reached
  // PStream's code for a malformed or too deeply nested value and for a
  // source file shorter than its binary says. It shares the timeout's code
  // (and text) on the wire, where peers expect -5 for both.
  P_ERR_MALFORMED = -5,
  P_ERR_SSL_VERIFY = -6,         // the TLS peer's certificate did not verify
  P_ERR_STOPPED = -7,
  P_ERR_IGNORE = -8,
  P_ERR_NO_PERMISSION = -9,
  P_ERR_FILE_OPERATION = -10,
  P_ERR_FILE_TOO_LARGE = -11,
  P_ERR_NAME_NOT_SUPPORTED = -12,
  P_ERR_SHARE_NOT_MOUNTED = -13,
  P_ERR_RESUME_FAILED = -14,
  P_ERR_SOURCE_MISSING = -15,
  P_ERR_DEST_EXISTS = -16,
  P_ERR_DEST_CONFLICT = -17,
  P_ERR_DEST_TYPE_CONFLICT = -18,
  P_ERR_DEST_QUOTA_FULL = -19,
  P_ERR_DEST_ROOT_MISSING = -20,
  P_ERR_DEST_PARENT_MISSING = -21,
  P_ERR_SOURCE_ROOT_MISSING = -22,
  P_ERR_WAIT_NOTIFY = -23,
  P_ERR_VERSION_FOLDER_CONFLICT = -24,
  P_ERR_TASK_INFO_NOT_FOUND = -25,
};

// The text of code ("Successful", "Interrupted", ...). Never null.
const char* PErrorText(int code);

#endif
