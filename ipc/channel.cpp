#include "ipc/channel.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <openssl/err.h>
#include <openssl/x509.h>
#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <sys/select.h>
#include <sys/socket.h>
#include <sys/types.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <climits>
#include <cstring>
#include <mutex>
#include <new>

#include "common/log.h"
#include "ipc/error-code.h"

std::string Channel::m_cert_path = "/usr/velt/etc/ssl/ssl.crt/server.crt";
std::string Channel::m_key_path = "/usr/velt/etc/ssl/ssl.key/server.key";
std::string Channel::m_ca_path = "/certs.pem";

const Channel::Ops Channel::kPlainOps = {PlainRead, PlainWrite, PlainFd, PlainDestroy, PlainClosed};
const Channel::Ops Channel::kTlsOps = {TlsRead, TlsWrite, TlsFd, TlsDestroy, TlsClosed};

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kWaitReady = 1;
constexpr int kWaitTimeout = 0;
constexpr int kWaitError = -1;  // errno tells why
constexpr int kWaitNotSet = 2;  // select returned, but not for this descriptor

// One wait of at most interval for fd to become readable or writable.
// select() cannot watch descriptors at or above FD_SETSIZE; the web server
// that loads us may hold that many files, so those wait with poll() instead
// of overrunning the fd_set.
int WaitFd(int fd, bool forWrite, timeval interval) {
  if (fd < 0) {
    errno = EBADF;
    return kWaitError;
  }
  int r;
  if (fd < FD_SETSIZE) {
    fd_set set;
    FD_ZERO(&set);
    FD_SET(fd, &set);
    r = select(fd + 1, forWrite ? nullptr : &set, forWrite ? &set : nullptr, nullptr, &interval);
    if (r > 0 && !FD_ISSET(fd, &set)) return kWaitNotSet;
  } else {
    pollfd p{fd, static_cast<short>(forWrite ? POLLOUT : POLLIN), 0};
    r = poll(&p, 1, static_cast<int>(interval.tv_sec * 1000 + interval.tv_usec / 1000));
  }
  if (r > 0) return kWaitReady;
  return r == 0 ? kWaitTimeout : kWaitError;
}

// Waits one interval for the socket of a read or write operation. 0 when it
// is ready, else the operation's result. An expired interval is routine (an
// idle peer) and the callers decide when it becomes a failure, so it is
// logged at debug level only.
long WaitForSocket(int fd, bool forWrite, timeval interval) {
  for (;;) {
    int r = WaitFd(fd, forWrite, interval);
    if (r == kWaitReady) return P_SUCCESS;
    if (r == kWaitTimeout) {
      PLOVO_LIB_DBG("select: timeout");
      return P_ERR_TIMEOUT;
    }
    if (r == kWaitNotSet) {
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
      PLOVO_LIB_WARN("select: %s", strerror(errno));
    } else {
      PLOVO_LIB_WARN("select: [%d] %s", errno, strerror(errno));
    }
    return P_ERR_IO;
  }
}

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

int ClampToInt(unsigned long n) { return n > INT_MAX ? INT_MAX : static_cast<int>(n); }

// The TLS library writes to the socket with write(), which raises SIGPIPE
// when the peer is gone, and the host process may not ignore that signal.
// The guard holds SIGPIPE back on this thread for one call and takes a
// SIGPIPE the call raised off the thread again.
class SigPipeGuard {
 public:
  SigPipeGuard() {
    sigemptyset(&pipe_);
    sigaddset(&pipe_, SIGPIPE);
    sigset_t pending;
    sigemptyset(&pending);
    sigpending(&pending);
    wasPending_ = sigismember(&pending, SIGPIPE) == 1;
    pthread_sigmask(SIG_BLOCK, &pipe_, &old_);
  }
  ~SigPipeGuard() {
    int saved = errno;
    sigset_t pending;
    sigemptyset(&pending);
    if (!wasPending_ && sigpending(&pending) == 0 && sigismember(&pending, SIGPIPE) == 1) {
      timespec zero{0, 0};
      while (sigtimedwait(&pipe_, nullptr, &zero) < 0 && errno == EINTR) {
      }
    }
    pthread_sigmask(SIG_SETMASK, &old_, nullptr);
    errno = saved;
  }
  SigPipeGuard(const SigPipeGuard&) = delete;
  SigPipeGuard& operator=(const SigPipeGuard&) = delete;

 private:
  sigset_t pipe_;
  sigset_t old_;
  bool wasPending_ = false;
};

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
  SwitchChannelOp(1);
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
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (fd < 0) {
    PLOVO_LIB_WARN("Channel: Can not open socket. %s", strerror(errno));
    return P_ERR_SYSTEM;
  }
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  strncpy(addr.sun_path, path, sizeof(addr.sun_path) - 1);
  if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
    PLOVO_LIB_WARN("Channel: Can not connect to server at '%s'. %s", path, strerror(errno));
    close(fd);
    return P_ERR_IO;
  }
  if (SetNonBlock(fd) != 0) {
    close(fd);
    return P_ERR_SYSTEM;
  }
  Adopt(fd);
  return P_SUCCESS;
}

int Channel::Open(int fd, bool setOptions) {
  if (!IsClosed()) {
    PLOVO_LIB_WARN("Open: Channel already opened [%d]", m_ops->fd(*this));
    PLOVO_LIB_WARN("Open: %s", PErrorText(P_ERR_INVALID_ARGUMENT));
    return P_ERR_INVALID_ARGUMENT;
  }
  if (fd < 0) {
    PLOVO_LIB_WARN("Open: %s", PErrorText(P_ERR_INVALID_ARGUMENT));
    return P_ERR_INVALID_ARGUMENT;
  }
  if (setOptions) {
    if (SetLinger(fd, 1) != 0) {
      PLOVO_LIB_WARN("Open: SetLinger to socket [%d] failed, %s", fd, strerror(errno));
      return P_ERR_SYSTEM;
    }
    if (SetNonBlock(fd) != 0) {
      PLOVO_LIB_WARN("Open: SetNonBlock to socket [%d] failed, %s", fd, strerror(errno));
      return P_ERR_SYSTEM;
    }
  }
  Adopt(fd);
  PLOVO_LIB_DBG("Channel: opening socket %d", fd);
  return P_SUCCESS;
}

int Channel::Open(const char* ip, int port) {
  if (ip == nullptr || port < 0) return P_SUCCESS;
  int fd = CreateSock();
  if (fd < 0) return P_ERR_IO;
  if (SetLinger(fd, 1) != 0 || SetNonBlock(fd) != 0) {
    close(fd);
    return P_ERR_SYSTEM;
  }
  if (ConnectWithTimeout(fd, ip, port) != 0) {
    close(fd);
    return P_ERR_IO;
  }
  Adopt(fd);
  return P_SUCCESS;
}

// Every Open ends here. A channel that was open is taken over, not refused
// (only Open(fd) refuses it); its old handle must not leak.
void Channel::Adopt(int fd) {
  if (m_handle != nullptr) m_ops->destroy(*this);
  m_ssl = false;
  SwitchChannelOp(1);
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
  if (m_handle != nullptr) m_ops->destroy(*this);
  m_ssl = false;
  SwitchChannelOp(1);
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

int Channel::ConvertToSSLChannel(bool server) {
  if (m_ssl) {
    PLOVO_LIB_DBG("ConvertToSSLChannel: Channel is SSL channel, no need to be converted");
    return P_SUCCESS;
  }
  if (IsClosed()) {
    PLOVO_LIB_WARN("ConvertToSSLChannel: %s", PErrorText(P_ERR_IO));
    return P_ERR_IO;
  }
  SSL* ssl = nullptr;
  SSL_CTX* ctx = nullptr;
  if (InitSSL(&ssl, &ctx, server) != 0) {
    PLOVO_LIB_WARN("Open: init ssl failed");
    return P_ERR_IO;
  }
  if (SSL_set_fd(ssl, PlainFd(*this)) != 1) {
    PLOVO_LIB_WARN("set fd failed");
    log_ssl();
    DeinitSSL(&ssl, &ctx, true);
    return P_ERR_IO;
  }
  // FlushWrite may retry a refused write with more bytes after the caller
  // appended to the buffer, and a partial write is progress it can count.
  SSL_set_mode(ssl, SSL_MODE_ENABLE_PARTIAL_WRITE | SSL_MODE_ACCEPT_MOVING_WRITE_BUFFER);
  if (SSLHandshake(ssl, m_interval, m_timeout) != 0) {
    PLOVO_LIB_WARN("Open to SSL connect to server failed");
    DeinitSSL(&ssl, &ctx, true);
    return P_ERR_IO;
  }
  if (!m_allow_untrust && SSL_get_verify_result(ssl) != X509_V_OK) {
    PLOVO_LIB_WARN("ConvertToSSLChannel: Verify Fail!");
    DeinitSSL(&ssl, &ctx, false);
    return P_ERR_SSL_VERIFY;
  }
  // The session now refers to the descriptor; the channel still closes it.
  delete static_cast<int*>(m_handle);
  m_handle = ssl;
  SwitchChannelOp(2);
  m_ssl = true;
  return P_SUCCESS;
}

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
          long k = m_ops->read(*this, buf + got, n - got);
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
    long r = m_ops->write(*this, m_wbuf + m_whead, chunk);
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
  if (getpeername(m_ops->fd(*this), reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
    PLOVO_LIB_WARN("GetPeerInfo: getpeername: %s", strerror(errno));
    return P_ERR_SYSTEM;
  }
  // A Unix domain peer has no address to report.
  if (addr.ss_family != AF_INET) return P_SUCCESS;
  const sockaddr_in* in = reinterpret_cast<const sockaddr_in*>(&addr);
  char text[17];
  if (inet_ntop(AF_INET, &in->sin_addr, text, sizeof(text)) == nullptr) {
    PLOVO_LIB_WARN("GetPeerInfo: inet_ntop: %s (%d)", strerror(errno), errno);
    return P_ERR_SYSTEM;
  }
  ip = text;
  port = ntohs(in->sin_port);
  return P_SUCCESS;
}

bool Channel::IsClosed() const { return m_ops->closed(*this); }

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
        long r = m_ops->read(*this, m_rbuf + tail, room);
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
  if (fd < 0) PLOVO_LIB_WARN("socket: %s", strerror(errno));
  return fd;
}

int Channel::SetLinger(int fd, int seconds) {
  linger value{1, seconds};
  if (setsockopt(fd, SOL_SOCKET, SO_LINGER, &value, sizeof(value)) != 0) {
    PLOVO_LIB_WARN("setsockopt: %s", strerror(errno));
    return -1;
  }
  return 0;
}

int Channel::SetNonBlock(int fd) {
  if (fd < 0) return -1;
  int flags = fcntl(fd, F_GETFL);
  if (flags < 0 || ((flags & O_NONBLOCK) == 0 && fcntl(fd, F_SETFL, flags | O_NONBLOCK) != 0)) {
    PLOVO_LIB_WARN("fcntl: %s", strerror(errno));
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
    PLOVO_LIB_WARN("connect: %s (%d)", strerror(errno), errno);
    return P_ERR_SYSTEM;
  }
  // Every unanswered round counts 3 seconds whatever the interval, so a
  // connect gives up after a third of the time limit in rounds.
  unsigned int elapsed = 0;
  for (;;) {
    int r = WaitFd(fd, true, WaitInterval());
    if (r == kWaitTimeout) {
      elapsed += 3;
      if ((m_timeout != 0 && elapsed >= m_timeout) || DeadlinePassed(m_has_deadline ? &m_deadline : nullptr)) {
        PLOVO_LIB_WARN("Channel timed out during connect (%d seconds), abort anyway", static_cast<int>(m_timeout));
        return P_ERR_TIMEOUT;
      }
      continue;
    }
    if (r == kWaitError) {
      if (errno == EINTR) continue;
      PLOVO_LIB_WARN("select: %s (%d)", strerror(errno), errno);
      return P_ERR_SYSTEM;
    }
    if (r == kWaitNotSet) {
      PLOVO_LIB_WARN("Unknown err in connect");
      return P_ERR_SYSTEM;
    }
    int error = 0;
    socklen_t len = sizeof(error);
    if (getsockopt(fd, SOL_SOCKET, SO_ERROR, &error, &len) != 0) {
      PLOVO_LIB_WARN("getsockopt: %s (%d)", strerror(errno), errno);
      return P_ERR_SYSTEM;
    }
    if (error != 0) {
      PLOVO_LIB_WARN("Connect error %s (%d). %s (%d)", strerror(error), error, strerror(errno), errno);
      return P_ERR_SYSTEM;
    }
    return P_SUCCESS;
  }
}

void Channel::SwitchChannelOp(int mode) { m_ops = mode == 1 ? &kPlainOps : &kTlsOps; }

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
      PLOVO_LIB_WARN("read: %s", strerror(errno));
      return P_ERR_IO;
    }
    if (waited) return P_ERR_TIMEOUT;  // ready but still empty: let the caller count the round
    if (long w = WaitForSocket(fd, false, ch.WaitInterval()); w != P_SUCCESS) return w;
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
      PLOVO_LIB_WARN("write: %s", strerror(errno));
      return P_ERR_IO;
    }
    if (waited) return P_ERR_TIMEOUT;
    if (long w = WaitForSocket(fd, true, ch.WaitInterval()); w != P_SUCCESS) return w;
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

// The TLS operations follow the plain ones: try the session at once, wait
// one interval in the direction the session asks for, try once more. Bytes
// the session already decrypted come out without any wait.
long Channel::TlsRead(Channel& ch, char* buf, unsigned long n) {
  if (n == 0) {
    PLOVO_LIB_WARN("ReadFd: request 0");
    return P_ERR_INVALID_ARGUMENT;
  }
  SSL* ssl = static_cast<SSL*>(ch.m_handle);
  for (bool waited = false;; waited = true) {
    ERR_clear_error();
    int r;
    {
      SigPipeGuard guard;  // a read may answer the peer (alerts, key updates)
      r = SSL_read(ssl, buf, ClampToInt(n));
    }
    if (r > 0) return r;
    int error = SSL_get_error(ssl, r);
    if (error != SSL_ERROR_WANT_READ && error != SSL_ERROR_WANT_WRITE) {
      PLOVO_LIB_WARN("Diagnose: SSL_read failed");
      log_ssl();
      return P_ERR_IO;
    }
    if (waited) {  // only part of a record has come
      PLOVO_LIB_DBG("SSL want read");
      return P_ERR_TIMEOUT;
    }
    if (long w = WaitForSocket(SSL_get_fd(ssl), error == SSL_ERROR_WANT_WRITE, ch.WaitInterval()); w != P_SUCCESS) {
      return w;
    }
  }
}

long Channel::TlsWrite(Channel& ch, const char* buf, unsigned long n) {
  if (n == 0) {
    PLOVO_LIB_WARN("WriteFd: request 0");
    return P_ERR_INVALID_ARGUMENT;
  }
  SSL* ssl = static_cast<SSL*>(ch.m_handle);
  int len = ClampToInt(n);
  for (bool waited = false;; waited = true) {
    ERR_clear_error();
    int r;
    int savedErrno;
    {
      SigPipeGuard guard;
      errno = 0;
      r = SSL_write(ssl, buf, len);
      savedErrno = errno;
    }
    if (r > 0) return r;
    int error = SSL_get_error(ssl, r);
    if (error == SSL_ERROR_WANT_READ || error == SSL_ERROR_WANT_WRITE) {
      if (waited) {
        PLOVO_LIB_DBG("SSL want write");
        return P_ERR_TIMEOUT;
      }
      if (long w = WaitForSocket(SSL_get_fd(ssl), error == SSL_ERROR_WANT_WRITE, ch.WaitInterval()); w != P_SUCCESS) {
        return w;
      }
      continue;
    }
    if (error == SSL_ERROR_SYSCALL) {
      PLOVO_LIB_WARN("syscall error: n = %d, ssl_ret = %d, errno = %d, err = %s", r, error, savedErrno,
                     strerror(savedErrno));
      log_ssl();
      return P_ERR_SYSTEM;
    }
    PLOVO_LIB_WARN("misc error: n = %d, ssl_ret = %d, errno = %d", r, error, savedErrno);
    log_ssl();
    return P_ERR_IO;
  }
}

int Channel::TlsFd(const Channel& ch) {
  return ch.m_handle != nullptr ? SSL_get_fd(static_cast<const SSL*>(ch.m_handle)) : -1;
}

void Channel::TlsDestroy(Channel& ch) {
  SSL* ssl = static_cast<SSL*>(ch.m_handle);
  if (ssl == nullptr) return;
  int fd = SSL_get_fd(ssl);
  SSL_CTX* ctx = SSL_get_SSL_CTX(ssl);
  DeinitSSL(&ssl, &ctx, false);
  ch.m_handle = nullptr;
  if (fd >= 0) {
    shutdown(fd, SHUT_RDWR);
    close(fd);
    PLOVO_LIB_DBG("Channel: socket %d closed", fd);
  }
}

bool Channel::TlsClosed(const Channel& ch) { return ch.m_handle == nullptr; }

int Channel::InitSSL(SSL** ssl, SSL_CTX** ctx, bool server) {
  *ssl = nullptr;
  *ctx = SSL_CTX_new(server ? TLS_server_method() : TLS_client_method());
  if (*ctx == nullptr) {
    PLOVO_LIB_WARN("m_ssl_ctx created failed");
    log_ssl();
    return -1;
  }
  *ssl = SSL_new(*ctx);
  if (*ssl == nullptr) {
    PLOVO_LIB_WARN("m_ssl created failed");
    log_ssl();
    DeinitSSL(ssl, ctx, true);
    return -1;
  }
  if (server) {
    if (SSL_use_certificate_file(*ssl, m_cert_path.c_str(), SSL_FILETYPE_PEM) != 1) {
      PLOVO_LIB_WARN("Install certificate failed");
      PLOVO_LIB_WARN("Open: init ssl certificate failed");
      log_ssl();
      DeinitSSL(ssl, ctx, true);
      return -1;
    }
    if (SSL_use_PrivateKey_file(*ssl, m_key_path.c_str(), SSL_FILETYPE_PEM) != 1) {
      PLOVO_LIB_WARN("Install private key failed");
      PLOVO_LIB_WARN("Open: init ssl private key failed");
      log_ssl();
      DeinitSSL(ssl, ctx, true);
      return -1;
    }
    SSL_set_accept_state(*ssl);
    return 0;
  }
  // Current TLS libraries no longer offer this suite; the defaults stay in
  // force then, so the failure is only noted.
  if (SSL_set_cipher_list(*ssl, "RC4-MD5") != 1) {
    PLOVO_LIB_WARN("can't set cipher suit to SSL3_TXT_RSA_RC4_128_MD5");
    ERR_clear_error();
  }
  if (SSL_CTX_load_verify_locations(*ctx, m_ca_path.c_str(), nullptr) != 1) {
    PLOVO_LIB_WARN("SSL_CTX_load_verify_locations(%s) failed", m_ca_path.c_str());
    PLOVO_LIB_WARN("InitSSL(): set Verify store fail");
    log_ssl();
    DeinitSSL(ssl, ctx, true);
    return -1;
  }
  // The handshake completes whatever the verification says; the result is
  // judged afterwards against the channel's allow-untrusted setting.
  SSL_set_verify(*ssl, SSL_VERIFY_NONE, nullptr);
  SSL_set_connect_state(*ssl);
  return 0;
}

int Channel::SSLHandshake(SSL* ssl, timeval interval, unsigned int limit) {
  int fd = SSL_get_fd(ssl);
  // Each unanswered wait counts its own length (at least a second); any
  // answer from the peer starts the count again.
  const unsigned int step = interval.tv_sec > 0 ? static_cast<unsigned int>(interval.tv_sec) : 1;
  unsigned int elapsed = 0;
  for (;;) {
    ERR_clear_error();
    int r;
    {
      SigPipeGuard guard;
      r = SSL_do_handshake(ssl);
    }
    if (r == 1) return P_SUCCESS;
    int error = SSL_get_error(ssl, r);
    if (r == 0) {
      PLOVO_LIB_WARN("SSLHandshake: SSL error code: %d", error);
      log_ssl();
      return P_ERR_IO;
    }
    if (error != SSL_ERROR_WANT_READ && error != SSL_ERROR_WANT_WRITE) {
      PLOVO_LIB_WARN("SSLHandshake: SSL fatel error code: %d", error);
      log_ssl();
      return P_ERR_IO;
    }
    for (;;) {
      int w = WaitFd(fd, error == SSL_ERROR_WANT_WRITE, interval);
      if (w == kWaitReady) break;
      if (w == kWaitError) {
        if (errno == EINTR) continue;
        PLOVO_LIB_WARN("SSLHandshake: select: Error Code: %s (%d)", strerror(errno), errno);
        return P_ERR_SYSTEM;
      }
      if (w == kWaitNotSet) {
        PLOVO_LIB_WARN("SSLHandshake: select returns but fd is not set");
        return P_ERR_SYSTEM;
      }
      elapsed += step;
      if (limit != 0 && elapsed >= limit) {
        PLOVO_LIB_WARN("SSLHandshake: timed out during connect (%d seconds), abort anyway", static_cast<int>(limit));
        return P_ERR_TIMEOUT;
      }
    }
    if (elapsed != 0) {
      PLOVO_LIB_DBG("SSLHandshake: reset timeout");
      elapsed = 0;
    }
  }
}

void Channel::DeinitSSL(SSL** ssl, SSL_CTX** ctx, bool quiet) {
  if (*ssl != nullptr) {
    if (quiet) SSL_set_quiet_shutdown(*ssl, 1);
    {
      SigPipeGuard guard;
      SSL_shutdown(*ssl);
    }
    ERR_clear_error();  // a refused close notice must not show up in later calls
    SSL_free(*ssl);
    *ssl = nullptr;
  }
  SSL_CTX_free(*ctx);
  *ctx = nullptr;
}

void Channel::log_ssl() {
  char text[256];
  for (unsigned long e = ERR_get_error(); e != 0; e = ERR_get_error()) {
    ERR_error_string_n(e, text, sizeof(text));
    PLOVO_LIB_WARN("ssl-errors: %s", text);
  }
}
