#include "ipc/channel.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/select.h>
#include <sys/socket.h>
#include <sys/types.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <mutex>
#include <new>

#include "channel-wait.h"
#include "common/error-text.h"
#include "common/log.h"
#include "common/unique-fd.h"
#include "ipc/error-code.h"

const Channel::Ops Channel::kPlainOps = {PlainRead, PlainWrite, PlainFd, PlainDestroy, PlainClosed};

namespace channel_wait {

// select() cannot watch descriptors at or above FD_SETSIZE; the web server
// that loads us may hold that many files, so those wait with poll() instead
// of overrunning the fd_set.
int WaitFd(int fd, bool forWrite, timeval interval) {
  if (fd < 0) {
    errno = EBADF;
    return kError;
  }
  int r;
  if (fd < FD_SETSIZE) {
    fd_set set;
    FD_ZERO(&set);
    FD_SET(fd, &set);
    r = select(fd + 1, forWrite ? nullptr : &set, forWrite ? &set : nullptr, nullptr, &interval);
    if (r > 0 && !FD_ISSET(fd, &set)) return kNotSet;
  } else {
    pollfd p{fd, static_cast<short>(forWrite ? POLLOUT : POLLIN), 0};
    r = poll(&p, 1, static_cast<int>(interval.tv_sec * 1000 + interval.tv_usec / 1000));
  }
  if (r > 0) return kReady;
  return r == 0 ? kTimeout : kError;
}

long WaitForSocket(int fd, bool forWrite, timeval interval) {
  for (;;) {
    int r = WaitFd(fd, forWrite, interval);
    if (r == kReady) return P_SUCCESS;
    if (r == kTimeout) {
      PLOVO_LIB_DBG("select: timeout");
      return P_ERR_TIMEOUT;
    }
    if (r == kNotSet) {
      if (forWrite) {
        PLOVO_LIB_WARN("WriteFd: select but fd [%d] not ready", fd);
      } else {
        PLOVO_LIB_WARN("ReadFd: select but fd [%d] not ready", fd);
      }
      return P_ERR_SYSTEM;
    }
    if (errno == EINTR) {
      PLOVO_LIB_DBG("select: EINTR");
      continue;
    }
    if (forWrite) {
      PLOVO_LIB_WARN("select: %s", Plovo::ErrorText(errno).c_str());
    } else {
      PLOVO_LIB_WARN("select: [%d] %s", errno, Plovo::ErrorText(errno).c_str());
    }
    return P_ERR_IO;
  }
}

}  // namespace channel_wait

namespace {

using Clock = std::chrono::steady_clock;

// The ring helpers: a ring of capacity bytes holds size bytes from head on.
void RingTake(const char* ring, unsigned long capacity, unsigned long& head, unsigned long& size, void* out,
              unsigned long n) {
  unsigned long first = std::min(n, capacity - head);
  memcpy(out, ring + head, first);
  memcpy(static_cast<char*>(out) + first, ring, n - first);
  size -= n;
  head = size == 0 ? 0 : (head + n) % capacity;
}

void RingPut(char* ring, unsigned long capacity, unsigned long head, unsigned long& size, const void* in,
             unsigned long n) {
  unsigned long tail = head + size;
  if (tail >= capacity) tail -= capacity;
  unsigned long first = std::min(n, capacity - tail);
  memcpy(ring + tail, in, first);
  memcpy(ring, static_cast<const char*>(in) + first, n - first);
  size += n;
}

bool TimeLimitPassed(Clock::time_point lastProgress, unsigned int limit) {
  return limit != 0 && Clock::now() - lastProgress >= std::chrono::seconds(limit);
}

bool DeadlinePassed(const Clock::time_point* deadline) { return deadline != nullptr && Clock::now() >= *deadline; }

// The wait loop of every read: step() reads the socket once (a byte count
// or a result code) and is repeated until want bytes came in total, the
// time limit passed without a byte, the deadline (when not null) passed, or
// the cancel flag went up.
template <typename Step, typename Cancelled>
int ReadAtLeast(unsigned long want, unsigned int limit, const Clock::time_point* deadline, Step step,
                Cancelled cancelled) {
  unsigned long total = 0;
  Clock::time_point lastProgress = Clock::now();
  while (!cancelled()) {
    if (DeadlinePassed(deadline)) {
      PLOVO_LIB_WARN("ReadMore: exchange deadline passed");
      return P_ERR_TIMEOUT;
    }
    long r = step();
    if (r > 0) {
      total += static_cast<unsigned long>(r);
      if (total >= want) return P_SUCCESS;
      lastProgress = Clock::now();
      continue;
    }
    if (r != P_ERR_TIMEOUT) return static_cast<int>(r);
    if (TimeLimitPassed(lastProgress, limit)) {
      PLOVO_LIB_WARN("ReadMore: Channel timeout for %u seconed", limit);
      return P_ERR_TIMEOUT;
    }
  }
  PLOVO_LIB_WARN("ReadMore: %s", PErrorText(P_ERR_INTERRUPTED));
  return P_ERR_INTERRUPTED;
}

// A channel is made per command, and its two buffers are large enough that
// the allocator hands them back to the system when they are freed and takes
// fresh page faults when the next command allocates them: about a quarter
// of a command's round trip. A few freed buffers are kept for the next
// channel instead.
class BufferCache {
 public:
  char* Take(unsigned long capacity) {
    {
      std::lock_guard<std::mutex> lock(mutex_);
      for (size_t i = 0; i < count_; ++i) {
        if (kept_[i].capacity == capacity) {
          char* buffer = kept_[i].buffer;
          kept_[i] = kept_[--count_];
          return buffer;
        }
      }
    }
    return new char[capacity];
  }
  void Give(char* buffer, unsigned long capacity) {
    {
      std::lock_guard<std::mutex> lock(mutex_);
      if (!drained_ && count_ < kKeep) {
        kept_[count_++] = {buffer, capacity};
        return;
      }
    }
    delete[] buffer;
  }
  // Frees what is kept, and keeps nothing from now on.
  void Drain() {
    std::lock_guard<std::mutex> lock(mutex_);
    drained_ = true;
    while (count_ > 0) delete[] kept_[--count_].buffer;
  }

 private:
  static constexpr size_t kKeep = 8;  // four channels' worth
  struct Kept {
    char* buffer;
    unsigned long capacity;
  };
  std::mutex mutex_;
  Kept kept_[kKeep] = {};
  size_t count_ = 0;
  bool drained_ = false;
};

// In static storage and never destroyed, so that a channel released during
// static destruction still finds it.
BufferCache& Buffers() {
  alignas(BufferCache) static unsigned char storage[sizeof(BufferCache)];
  static BufferCache* cache = new (storage) BufferCache;
  return *cache;
}

// The kept buffers are freed when the program ends or the module that holds
// this code is unloaded: after an unload nothing could reach them again.
struct BufferDrain {
  ~BufferDrain() { Buffers().Drain(); }
} gBufferDrain;

}  // namespace

Channel::Channel(unsigned long capacity)
    : m_capacity(capacity), m_trace(Plovo::LogWillWrite(LOG_DEBUG)) {
  m_wbuf = Buffers().Take(capacity);
  m_rbuf = Buffers().Take(capacity);
  SwitchChannelOp(kPlainMode);
}

Channel::~Channel() {
  Close();
  Buffers().Give(m_wbuf, m_capacity);
  Buffers().Give(m_rbuf, m_capacity);
}

int Channel::Open(const char* path) {
  if (path == nullptr) {
    PLOVO_LIB_WARN("Open: %s", PErrorText(P_ERR_INVALID_ARGUMENT));
    return P_ERR_INVALID_ARGUMENT;
  }
  // Non-blocking from the start: a blocking connect to a peer whose listen
  // queue is full would wait for ever, out of reach of every time limit.
  Plovo::UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!fd) {
    PLOVO_LIB_WARN("Channel: Can not open socket. %s", Plovo::ErrorText(errno).c_str());
    return P_ERR_SYSTEM;
  }
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  strncpy(addr.sun_path, path, sizeof(addr.sun_path) - 1);
  if (connect(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
    PLOVO_LIB_WARN("Channel: Can not connect to server at '%s'. %s", path, Plovo::ErrorText(errno).c_str());
    return P_ERR_IO;
  }
  if (SetNonBlock(fd.get()) != 0) return P_ERR_SYSTEM;
  Adopt(fd.release());
  return P_SUCCESS;
}

int Channel::Open(int fd, bool setOptions) {
  if (!IsClosed()) {
    PLOVO_LIB_WARN("Open: Channel already opened [%d]", m_ops.fd(*this));
    PLOVO_LIB_WARN("Open: %s", PErrorText(P_ERR_INVALID_ARGUMENT));
    return P_ERR_INVALID_ARGUMENT;
  }
  if (fd < 0) {
    PLOVO_LIB_WARN("Open: %s", PErrorText(P_ERR_INVALID_ARGUMENT));
    return P_ERR_INVALID_ARGUMENT;
  }
  if (setOptions) {
    if (SetLinger(fd, 1) != 0) {
      PLOVO_LIB_WARN("Open: SetLinger to socket [%d] failed, %s", fd, Plovo::ErrorText(errno).c_str());
      return P_ERR_SYSTEM;
    }
    if (SetNonBlock(fd) != 0) {
      PLOVO_LIB_WARN("Open: SetNonBlock to socket [%d] failed, %s", fd, Plovo::ErrorText(errno).c_str());
      return P_ERR_SYSTEM;
    }
  }
  Adopt(fd);
  PLOVO_LIB_DBG("Channel: opening socket %d", fd);
  return P_SUCCESS;
}

int Channel::Open(const char* ip, int port) {
  if (ip == nullptr || port < 0) return P_SUCCESS;
  Plovo::UniqueFd fd(CreateSock());
  if (!fd) return P_ERR_IO;
  if (SetLinger(fd.get(), 1) != 0 || SetNonBlock(fd.get()) != 0) return P_ERR_SYSTEM;
  if (ConnectWithTimeout(fd.get(), ip, port) != 0) return P_ERR_IO;
  Adopt(fd.release());
  return P_SUCCESS;
}

// Every Open ends here. A channel that was open is taken over, not refused
// (only Open(fd) refuses it); its old handle must not leak.
void Channel::Adopt(int fd) {
  if (m_handle != nullptr) m_ops.destroy(*this);
  m_ssl = false;
  SwitchChannelOp(kPlainMode);
  m_handle = new int(fd);
  ClearRead();
  ClearWrite();
}

int Channel::Close() {
  if (!IsClosed()) {
    int r = FlushWrite(0);
    if (r != P_SUCCESS) PLOVO_LIB_WARN("FlushWrite: %s", PErrorText(r));
    ClearRead();
    ClearWrite();
  }
  if (m_handle != nullptr) m_ops.destroy(*this);
  m_ssl = false;
  SwitchChannelOp(kPlainMode);
  return P_SUCCESS;
}

void Channel::SetTimeout(unsigned int seconds) { m_timeout = seconds; }

void Channel::SetDeadline(unsigned int seconds) {
  m_has_deadline = seconds != 0;
  m_deadline = Clock::now() + std::chrono::seconds(seconds);
}

timeval Channel::WaitInterval() const {
  if (!m_has_deadline) return m_interval;
  auto left = std::chrono::duration_cast<std::chrono::microseconds>(m_deadline - Clock::now()).count();
  // At least a millisecond: a zero timeval would make the wait a busy poll.
  left = std::max<long long>(left, 1000);
  long long interval = m_interval.tv_sec * 1000000LL + m_interval.tv_usec;
  if (left >= interval) return m_interval;
  return timeval{static_cast<time_t>(left / 1000000), static_cast<suseconds_t>(left % 1000000)};
}

void Channel::SetFlag(int* flag) { m_flag = flag; }

// Small reads and writes (every tag and length of a message) take their
// bytes straight from the ring or put them straight into it when they can;
// otherwise they go through Read and Write, which wait, flush and refuse a
// closed channel.
int Channel::TakeBytes(unsigned char* out, unsigned long n) {
  if (m_rsize >= n) {
    RingTake(m_rbuf, m_capacity, m_rhead, m_rsize, out, n);
    if (m_trace) {
      PLOVO_LIB_DBG("Read: read %zd bytes, head = %zd, size = %zd", static_cast<ssize_t>(n),
                    static_cast<ssize_t>(m_rhead), static_cast<ssize_t>(m_rsize));
    }
    return P_SUCCESS;
  }
  return Read(reinterpret_cast<char*>(out), n);
}

int Channel::PutBytes(const unsigned char* in, unsigned long n) {
  if (m_capacity - m_wsize >= n && !IsClosed()) {
    RingPut(m_wbuf, m_capacity, m_whead, m_wsize, in, n);
    if (m_trace) PLOVO_LIB_DBG("Write: write %zd bytes", static_cast<ssize_t>(n));
    return P_SUCCESS;
  }
  return Write(reinterpret_cast<const char*>(in), n);
}

namespace {

template <typename T>
T FromBigEndian(const unsigned char* b) {
  T v = 0;
  for (size_t i = 0; i < sizeof(T); ++i) v = static_cast<T>(v << 8 | b[i]);
  return v;
}

template <typename T>
void ToBigEndian(T value, unsigned char* b) {
  for (size_t i = sizeof(T); i-- > 0; value = static_cast<T>(value >> 8)) b[i] = static_cast<unsigned char>(value);
}

}  // namespace

int Channel::ReadByte(unsigned char* value) { return TakeBytes(value, 1); }

int Channel::ReadInt16(unsigned short* value) {
  unsigned char b[2];
  int r = TakeBytes(b, sizeof(b));
  if (r == P_SUCCESS) *value = FromBigEndian<unsigned short>(b);
  return r;
}

int Channel::ReadInt32(unsigned int* value) {
  unsigned char b[4];
  int r = TakeBytes(b, sizeof(b));
  if (r == P_SUCCESS) *value = FromBigEndian<unsigned int>(b);
  return r;
}

int Channel::ReadInt64(unsigned long* value) {
  unsigned char b[8];
  int r = TakeBytes(b, sizeof(b));
  if (r == P_SUCCESS) *value = FromBigEndian<unsigned long>(b);
  return r;
}

int Channel::WriteByte(unsigned char value) { return PutBytes(&value, 1); }

int Channel::WriteInt16(unsigned short value) {
  unsigned char b[2];
  ToBigEndian(value, b);
  return PutBytes(b, sizeof(b));
}

int Channel::WriteInt32(unsigned int value) {
  unsigned char b[4];
  ToBigEndian(value, b);
  return PutBytes(b, sizeof(b));
}

int Channel::WriteInt64(unsigned long value) {
  unsigned char b[8];
  ToBigEndian(value, b);
  return PutBytes(b, sizeof(b));
}

int Channel::Read(char* buf, unsigned long n) {
  unsigned long got = 0;
  return Read(buf, n, got);
}

int Channel::Read(char* buf, unsigned long n, unsigned long& got) {
  got = 0;
  if (IsClosed()) {
    PLOVO_LIB_WARN("Read: %s", PErrorText(P_ERR_IO));
    return P_ERR_IO;
  }
  got = std::min(n, m_rsize);
  RingTake(m_rbuf, m_capacity, m_rhead, m_rsize, buf, got);
  // Whatever is still missing, the ring is now empty with its head at 0.
  unsigned long left = n - got;
  if (left > 0 && left >= m_capacity / 2) {
    // A large remainder goes straight into the caller's memory, which saves
    // copying bulk data through the ring; the bytes and results are the same.
    int r = ReadAtLeast(
        left, m_timeout, m_has_deadline ? &m_deadline : nullptr,
        [&] {
          long k = m_ops.read(*this, buf + got, n - got);
          if (k > 0) got += static_cast<unsigned long>(k);
          return k;
        },
        [this] { return Cancelled(); });
    if (r != P_SUCCESS) return r;
  } else if (left > 0) {
    // A small one pulls a buffer-load into the ring, so that the next small
    // reads find their bytes there.
    int r = ReadMore(left);
    unsigned long take = std::min(left, m_rsize);
    memcpy(buf + got, m_rbuf, take);
    got += take;
    m_rsize -= take;
    m_rhead = m_rsize == 0 ? 0 : take;
    if (r != P_SUCCESS) return r;
  }
  if (m_trace) PLOVO_LIB_DBG("Read: read %zd bytes, head = %zd, size = %zd", static_cast<ssize_t>(n),
                static_cast<ssize_t>(m_rhead), static_cast<ssize_t>(m_rsize));
  return P_SUCCESS;
}

int Channel::Write(const char* data, unsigned long n) {
  if (IsClosed()) {
    PLOVO_LIB_WARN("Write: %s", PErrorText(P_ERR_IO));
    return P_ERR_IO;
  }
  if (n > m_capacity) {
    PLOVO_LIB_WARN("Write: Exceed maximum data block size");
    return P_ERR_INVALID_ARGUMENT;
  }
  if (m_wsize + n > m_capacity) {
    int r = FlushWrite(m_wsize + n - m_capacity);
    if (r != P_SUCCESS) {
      PLOVO_LIB_WARN("Write: FlushWrite failed");
      return r;
    }
  }
  RingPut(m_wbuf, m_capacity, m_whead, m_wsize, data, n);
  if (m_trace) PLOVO_LIB_DBG("Write: write %zd bytes", static_cast<ssize_t>(n));
  return P_SUCCESS;
}

void Channel::ClearRead() { m_rhead = m_rsize = 0; }

void Channel::ClearWrite() { m_whead = m_wsize = 0; }

int Channel::FlushWrite(unsigned long atLeast) {
  if (m_wsize == 0) return P_SUCCESS;
  if (IsClosed()) {
    PLOVO_LIB_WARN("FlushWrite: %s", PErrorText(P_ERR_IO));
    return P_ERR_IO;
  }
  unsigned long target = atLeast == 0 ? m_wsize : std::min(atLeast, m_wsize);
  unsigned long sent = 0;
  Clock::time_point lastProgress = Clock::now();
  while (!Cancelled()) {
    if (DeadlinePassed(m_has_deadline ? &m_deadline : nullptr)) {
      PLOVO_LIB_WARN("FlushWrite: exchange deadline passed");
      return P_ERR_TIMEOUT;
    }
    unsigned long chunk = std::min(m_wsize, m_capacity - m_whead);
    long r = m_ops.write(*this, m_wbuf + m_whead, chunk);
    if (r > 0) {
      unsigned long n = static_cast<unsigned long>(r);
      m_whead += n;
      m_wsize -= n;
      if (m_whead == m_capacity || m_wsize == 0) m_whead = 0;
      sent += n;
      if (sent >= target) {
        if (m_trace) PLOVO_LIB_DBG("FlushWrite: flush at least %zu bytes", static_cast<size_t>(atLeast));
        return P_SUCCESS;
      }
      lastProgress = Clock::now();
      continue;
    }
    if (r != P_ERR_TIMEOUT) return static_cast<int>(r);
    if (TimeLimitPassed(lastProgress, m_timeout)) {
      PLOVO_LIB_WARN("FlushWrite: Channel timeout for %u seconds", m_timeout);
      return P_ERR_TIMEOUT;
    }
  }
  PLOVO_LIB_WARN("FlushWrite: %s", PErrorText(P_ERR_INTERRUPTED));
  return P_ERR_INTERRUPTED;
}

int Channel::GetPeerInfo(std::string& ip, int& port) const {
  ip.clear();
  port = 0;
  if (IsClosed()) {
    PLOVO_LIB_WARN("GetPeerInfo: Attempting to get info of an uninitialized channel");
    return P_SUCCESS;
  }
  sockaddr_storage addr{};
  socklen_t len = sizeof(addr);
  if (getpeername(m_ops.fd(*this), reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
    PLOVO_LIB_WARN("GetPeerInfo: getpeername: %s", Plovo::ErrorText(errno).c_str());
    return P_ERR_SYSTEM;
  }
  // A Unix domain peer has no address to report.
  if (addr.ss_family != AF_INET) return P_SUCCESS;
  const sockaddr_in* in = reinterpret_cast<const sockaddr_in*>(&addr);
  char text[17];
  if (inet_ntop(AF_INET, &in->sin_addr, text, sizeof(text)) == nullptr) {
    PLOVO_LIB_WARN("GetPeerInfo: inet_ntop: %s (%d)", Plovo::ErrorText(errno).c_str(), errno);
    return P_ERR_SYSTEM;
  }
  ip = text;
  port = ntohs(in->sin_port);
  return P_SUCCESS;
}

bool Channel::IsClosed() const { return m_ops.closed(*this); }

int Channel::ReadMore(unsigned long want) {
  if (want == 0) return P_SUCCESS;
  if (want > m_capacity - m_rsize) {  // could never be satisfied
    PLOVO_LIB_WARN("ReadMore: %s", PErrorText(P_ERR_INVALID_ARGUMENT));
    return P_ERR_INVALID_ARGUMENT;
  }
  return ReadAtLeast(
      want, m_timeout, m_has_deadline ? &m_deadline : nullptr,
      [this] {
        if (m_rsize == 0) m_rhead = 0;  // one contiguous free block
        unsigned long tail = m_rhead + m_rsize;
        if (tail >= m_capacity) tail -= m_capacity;
        unsigned long room = tail >= m_rhead ? m_capacity - tail : m_rhead - tail;
        long r = m_ops.read(*this, m_rbuf + tail, room);
        if (r > 0) m_rsize += static_cast<unsigned long>(r);
        return r;
      },
      [this] { return Cancelled(); });
}

unsigned long Channel::Convert(unsigned long value) { return __builtin_bswap64(value); }

unsigned int Channel::Convert(unsigned int value) { return __builtin_bswap32(value); }

unsigned short Channel::Convert(unsigned short value) { return __builtin_bswap16(value); }

int Channel::CreateSock() {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) PLOVO_LIB_WARN("socket: %s", Plovo::ErrorText(errno).c_str());
  return fd;
}

int Channel::SetLinger(int fd, int seconds) {
  linger value{1, seconds};
  if (setsockopt(fd, SOL_SOCKET, SO_LINGER, &value, sizeof(value)) != 0) {
    PLOVO_LIB_WARN("setsockopt: %s", Plovo::ErrorText(errno).c_str());
    return -1;
  }
  return 0;
}

int Channel::SetNonBlock(int fd) {
  if (fd < 0) return -1;
  int flags = fcntl(fd, F_GETFL);
  if (flags < 0 || ((flags & O_NONBLOCK) == 0 && fcntl(fd, F_SETFL, flags | O_NONBLOCK) != 0)) {
    PLOVO_LIB_WARN("fcntl: %s", Plovo::ErrorText(errno).c_str());
    return -1;
  }
  return 0;
}

int Channel::ConnectWithTimeout(int fd, const char* ip, int port) {
  if (fd < 0 || ip == nullptr) {
    PLOVO_LIB_WARN("Invalid argumants (ip: %s, port: %d", ip != nullptr ? ip : "(null)", port);
    return P_ERR_INVALID_ARGUMENT;
  }
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = inet_addr(ip);
  addr.sin_port = htons(static_cast<uint16_t>(port));
  if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0) return P_SUCCESS;
  if (errno != EINPROGRESS) {
    PLOVO_LIB_WARN("connect: %s (%d)", Plovo::ErrorText(errno).c_str(), errno);
    return P_ERR_SYSTEM;
  }
  // Every unanswered round counts 3 seconds whatever the interval, so a
  // connect gives up after a third of the time limit in rounds.
  unsigned int elapsed = 0;
  for (;;) {
    int r = channel_wait::WaitFd(fd, true, WaitInterval());
    if (r == channel_wait::kTimeout) {
      elapsed += 3;
      if ((m_timeout != 0 && elapsed >= m_timeout) || DeadlinePassed(m_has_deadline ? &m_deadline : nullptr)) {
        PLOVO_LIB_WARN("Channel timed out during connect (%d seconds), abort anyway", static_cast<int>(m_timeout));
        return P_ERR_TIMEOUT;
      }
      continue;
    }
    if (r == channel_wait::kError) {
      if (errno == EINTR) continue;
      PLOVO_LIB_WARN("select: %s (%d)", Plovo::ErrorText(errno).c_str(), errno);
      return P_ERR_SYSTEM;
    }
    if (r == channel_wait::kNotSet) {
      PLOVO_LIB_WARN("Unknown err in connect");
      return P_ERR_SYSTEM;
    }
    int error = 0;
    socklen_t len = sizeof(error);
    if (getsockopt(fd, SOL_SOCKET, SO_ERROR, &error, &len) != 0) {
      PLOVO_LIB_WARN("getsockopt: %s (%d)", Plovo::ErrorText(errno).c_str(), errno);
      return P_ERR_SYSTEM;
    }
    if (error != 0) {
      PLOVO_LIB_WARN("Connect error %s (%d). %s (%d)", Plovo::ErrorText(error).c_str(), error,
                     Plovo::ErrorText(errno).c_str(), errno);
      return P_ERR_SYSTEM;
    }
    return P_SUCCESS;
  }
}

void Channel::SwitchChannelOp(int mode) { m_ops = mode == kPlainMode ? kPlainOps : kTlsOps; }

// The plain operations try the socket at once and wait only when it has
// nothing to give or no room to take; MSG_DONTWAIT keeps that true for an
// adopted descriptor left blocking, so the time limit and the cancel flag
// still hold. Each call waits at most one interval.
long Channel::PlainRead(Channel& ch, char* buf, unsigned long n) {
  if (n == 0) {
    PLOVO_LIB_WARN("ReadFd: request 0");
    return P_ERR_INVALID_ARGUMENT;
  }
  int fd = PlainFd(ch);
  for (bool waited = false;;) {
    ssize_t r = recv(fd, buf, n, MSG_DONTWAIT);
    if (r > 0) return r;
    if (r == 0) {
      PLOVO_LIB_WARN("read: %s", "connection closed by peer");
      PLOVO_LIB_WARN("Diagnose: select says the socket is readable but actually we can't read ... connection closed?");
      return P_ERR_IO;
    }
    if (errno == EINTR) continue;
    if (errno != EAGAIN && errno != EWOULDBLOCK) {
      PLOVO_LIB_WARN("read: %s", Plovo::ErrorText(errno).c_str());
      return P_ERR_IO;
    }
    if (waited) return P_ERR_TIMEOUT;  // ready but still empty: let the caller count the round
    if (long w = channel_wait::WaitForSocket(fd, false, ch.WaitInterval()); w != P_SUCCESS) return w;
    waited = true;
  }
}

long Channel::PlainWrite(Channel& ch, const char* buf, unsigned long n) {
  if (n == 0) {
    PLOVO_LIB_WARN("WriteFd: request 0");
    return P_ERR_INVALID_ARGUMENT;
  }
  int fd = PlainFd(ch);
  for (bool waited = false;;) {
    // MSG_NOSIGNAL: a vanished peer is an I/O error here, not SIGPIPE.
    ssize_t r = send(fd, buf, n, MSG_DONTWAIT | MSG_NOSIGNAL);
    if (r > 0) return r;
    if (r == 0) {
      PLOVO_LIB_WARN("write: %s", "nothing written");
      PLOVO_LIB_WARN(
          "Diagnose: select says the socket is writeable but actually we can't write ... connection closed?");
      return P_ERR_IO;
    }
    if (errno == EINTR) continue;
    if (errno != EAGAIN && errno != EWOULDBLOCK) {
      PLOVO_LIB_WARN("write: %s", Plovo::ErrorText(errno).c_str());
      return P_ERR_IO;
    }
    if (waited) return P_ERR_TIMEOUT;
    if (long w = channel_wait::WaitForSocket(fd, true, ch.WaitInterval()); w != P_SUCCESS) return w;
    waited = true;
  }
}

int Channel::PlainFd(const Channel& ch) {
  return ch.m_handle != nullptr ? *static_cast<const int*>(ch.m_handle) : -1;
}

void Channel::PlainDestroy(Channel& ch) {
  int* handle = static_cast<int*>(ch.m_handle);
  if (handle != nullptr && *handle >= 0) {
    shutdown(*handle, SHUT_RDWR);
    close(*handle);
    PLOVO_LIB_DBG("Channel: socket %d closed", *handle);
  }
  delete handle;
  ch.m_handle = nullptr;
}

bool Channel::PlainClosed(const Channel& ch) { return PlainFd(ch) == -1; }

