// The fuzz input as a peer's bytes on a socket, the way the targets'
// receivers read them.
#ifndef PLOVO_FUZZ_FUZZ_SOCKET_H
#define PLOVO_FUZZ_FUZZ_SOCKET_H

#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>

// The reading end of a socket pair holding the input, its writing end
// closed: the receiver sees the bytes, then the peer gone.
inline int InputSocket(const uint8_t* data, size_t size) {
  int fds[2];
  if (socketpair(AF_UNIX, SOCK_STREAM, 0, fds) != 0) abort();
  int buffer = 1 << 20;  // the whole input fits, so one thread can write it all first
  setsockopt(fds[1], SOL_SOCKET, SO_SNDBUF, &buffer, sizeof(buffer));
  setsockopt(fds[0], SOL_SOCKET, SO_RCVBUF, &buffer, sizeof(buffer));
  size_t written = 0;
  while (written < size) {
    ssize_t n = send(fds[1], data + written, size - written, MSG_DONTWAIT | MSG_NOSIGNAL);
    if (n <= 0) break;  // what does not fit is simply not part of this input
    written += static_cast<size_t>(n);
  }
  close(fds[1]);
  return fds[0];
}

#endif
