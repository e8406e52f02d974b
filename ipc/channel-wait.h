// The waits on a channel's socket, shared by the plain and the TLS sources
// of Channel (defined with the plain ones, so that their log lines name the
// channel). Nothing here is part of the library's interface.
//
// Threading: the functions keep no state; any thread may call them.
#ifndef PLOVO_IPC_CHANNEL_WAIT_H
#define PLOVO_IPC_CHANNEL_WAIT_H

#include <sys/time.h>

namespace channel_wait {

constexpr int kReady = 1;
constexpr int kTimeout = 0;
constexpr int kError = -1;  // errno tells why
constexpr int kNotSet = 2;  // select returned, but not for this descriptor

// One wait of at most interval for fd to become readable or writable:
// kReady, kTimeout, kNotSet, or kError with errno set (EINTR included; the
// caller decides whether to wait again).
int WaitFd(int fd, bool forWrite, timeval interval);

// Waits one interval for the socket of a read or write operation, waiting
// again after a signal. P_SUCCESS when it is ready, else the operation's
// result: P_ERR_TIMEOUT when the interval expired (logged at debug level
// only, since an idle peer is routine and the callers decide when it
// becomes a failure), P_ERR_SYSTEM or P_ERR_IO on a failed wait (logged).
long WaitForSocket(int fd, bool forWrite, timeval interval);

}  // namespace channel_wait

#endif
