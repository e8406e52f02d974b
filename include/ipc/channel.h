// Channel: a buffered, time-limited byte channel over one stream socket (a
// Unix domain socket, an IPv4 TCP socket, or an adopted descriptor),
// optionally switched to TLS. PStream reads and writes messages through it;
// IPCSender and IPCListener own and open it.
//
// Writes collect in a write buffer and leave on FlushWrite (or when the
// buffer must make room); reads pull whole buffer-loads into a read ring.
// Every wait on the socket is a select() with a short interval (1 second),
// repeated until the time limit (60 seconds, 0 = none) passes without
// progress, until the deadline (none unless set) passes whatever the
// progress, or until the caller's cancel flag is raised. The socket
// is read or written at once when it is ready; select() is used only when
// it is not.
//
// Results are the shared codes of ipc/error-code.h: 0 success, -1 cancel
// flag raised, -2 I/O error (peer closed, closed channel), -3 system error,
// -4 invalid argument, -5 time limit, -6 TLS peer not verified. Every
// failure is logged at warning level.
//
// Ownership: the channel owns its descriptor (or TLS session and context)
// and its two buffers; Close() and the destructor release the handle.
// Threading: one thread at a time uses a channel. The cancel flag is the one
// cross-thread input: another thread may set the pointed-to int to stop a
// blocked read or flush within one interval.
//
// Binary interface: code compiled separately against this class (a
// subclass, another program's build of it) depends on its layout, so some
// members are here for their place rather than for a use in this module.
// Every virtual function is a slot, declared in slot order from the
// destructor to SwitchChannelOp: add none, drop none, reorder none, and keep
// new members non-virtual (as SetDeadline and Capacity are). The fields from m_handle to
// m_allow_untrust keep their order and types; new fields go after them. The
// static certificate paths are named data of the interface. Members marked
// "binary interface" below have no other reason to exist: Convert has no
// caller, CreateSock, SetLinger and SetNonBlock could be plain functions,
// and SwitchChannelOp takes a mode number (kPlainMode or kTlsMode) rather
// than a type of its own.
#ifndef PLOVO_IPC_CHANNEL_H
#define PLOVO_IPC_CHANNEL_H

#include <openssl/ssl.h>
#include <sys/time.h>

#include <chrono>
#include <string>

class Channel {
 public:
  // Allocates both buffers of capacity bytes; capacity is also the largest
  // block one Write accepts. The channel starts closed, in plain mode.
  explicit Channel(unsigned long capacity);
  virtual ~Channel();
  Channel(const Channel&) = delete;
  Channel& operator=(const Channel&) = delete;

  // Connects a Unix domain stream socket to path, without blocking: a peer
  // whose listen queue is full fails at once. -3 when no socket can be
  // made or set non-blocking, -2 when the connect fails. Does not refuse an
  // already open channel.
  virtual int Open(const char* path);
  // Adopts an open descriptor. With setOptions: 1-second linger and
  // non-blocking mode (-3 on failure). -4 for fd -1 or when the channel is
  // already open (the old descriptor is kept).
  virtual int Open(int fd, bool setOptions);
  // Connects to a dotted IPv4 address with the channel's waits. A null ip or
  // a negative port returns 0 without opening anything.
  virtual int Open(const char* ip, int port);
  // Flushes what is buffered, drops both buffers, releases the handle and
  // returns to plain mode. Returns 0.
  virtual int Close();
  // The overall time limit in seconds; 0 waits without limit.
  virtual void SetTimeout(unsigned int seconds);
  // Every read, flush and connect must end within seconds from now (0: no
  // deadline): -5 once it passes. Unlike the time limit, progress does not
  // extend it, so a peer that sends a byte now and then cannot hold an
  // exchange open. Not virtual: it is no part of the channel's interface to
  // subclasses.
  void SetDeadline(unsigned int seconds);
  // Installs the caller-owned cancel flag (null: none).
  virtual void SetFlag(int* flag);
  // Runs the TLS handshake on the open descriptor, as the server or the
  // client end, and switches the channel to TLS. 0 when already converted.
  virtual int ConvertToSSLChannel(bool server);

  // Integers travel most significant byte first.
  virtual int ReadByte(unsigned char* value);
  virtual int ReadInt16(unsigned short* value);
  virtual int ReadInt32(unsigned int* value);
  virtual int ReadInt64(unsigned long* value);
  virtual int WriteByte(unsigned char value);
  virtual int WriteInt16(unsigned short value);
  virtual int WriteInt32(unsigned int value);
  virtual int WriteInt64(unsigned long value);

  // Reads exactly n bytes. On failure got holds the bytes delivered so far.
  virtual int Read(char* buf, unsigned long n);
  virtual int Read(char* buf, unsigned long n, unsigned long& got);
  // Buffers n bytes (n <= capacity, else -4 and nothing buffered), flushing
  // first only as much as needed to make room.
  virtual int Write(const char* data, unsigned long n);
  virtual void ClearRead();
  virtual void ClearWrite();
  // Sends buffered bytes until at least atLeast of them left (0: all).
  virtual int FlushWrite(unsigned long atLeast);
  // The peer's dotted IPv4 address and port; ip empty and port 0 when
  // unknown. Returns 0 (also on a closed channel) or -3.
  virtual int GetPeerInfo(std::string& ip, int& port) const;
  virtual bool IsClosed() const;
  // The size of each buffer: the largest block one Write accepts.
  unsigned long Capacity() const { return m_capacity; }

  // TLS settings. The paths are shared by all channels.
  void SetAllowUntrust(bool allow) { m_allow_untrust = allow; }
  bool IsAllowingUntrust() const { return m_allow_untrust; }
  static void SetCERTPath(const std::string& path) { m_cert_path = path; }
  static void SetPriKeyPath(const std::string& path) { m_key_path = path; }
  static void SetVerifyCAPath(const std::string& path) { m_ca_path = path; }

  // Server certificate, server private key (both PEM), and the CA file a
  // client verifies the server with.
  static std::string m_cert_path;  // binary interface
  static std::string m_key_path;   // binary interface
  static std::string m_ca_path;    // binary interface

 protected:
  // Fills the read buffer with at least want bytes.
  virtual int ReadMore(unsigned long want);
  // Byte order reversal at each width.
  virtual unsigned long Convert(unsigned long value);    // binary interface
  virtual unsigned int Convert(unsigned int value);      // binary interface
  virtual unsigned short Convert(unsigned short value);  // binary interface
  // An IPv4 stream socket, or -1.
  virtual int CreateSock();                   // binary interface
  virtual int SetLinger(int fd, int seconds);  // binary interface
  virtual int SetNonBlock(int fd);             // binary interface
  // Non-blocking connect with the channel's waits; every unanswered
  // interval counts 3 towards the time limit.
  virtual int ConnectWithTimeout(int fd, const char* ip, int port);
  // kPlainMode selects the plain operations, any other mode the TLS ones.
  virtual void SwitchChannelOp(int mode);  // binary interface
  static constexpr int kPlainMode = 1;
  static constexpr int kTlsMode = 2;

 private:
  // The five operations of a mode.
  struct Ops {
    long (*read)(Channel& ch, char* buf, unsigned long n);
    long (*write)(Channel& ch, const char* buf, unsigned long n);
    int (*fd)(const Channel& ch);
    void (*destroy)(Channel& ch);
    bool (*closed)(const Channel& ch);
  };
  static const Ops kPlainOps;
  static const Ops kTlsOps;

  static long PlainRead(Channel& ch, char* buf, unsigned long n);
  static long PlainWrite(Channel& ch, const char* buf, unsigned long n);
  static int PlainFd(const Channel& ch);
  static void PlainDestroy(Channel& ch);
  static bool PlainClosed(const Channel& ch);
  static long TlsRead(Channel& ch, char* buf, unsigned long n);
  static long TlsWrite(Channel& ch, const char* buf, unsigned long n);
  static int TlsFd(const Channel& ch);
  static void TlsDestroy(Channel& ch);
  static bool TlsClosed(const Channel& ch);

  void Adopt(int fd);
  int TakeBytes(unsigned char* out, unsigned long n);
  int PutBytes(const unsigned char* in, unsigned long n);
  int InitSSL(SSL** ssl, SSL_CTX** ctx, bool server);
  int SSLHandshake(SSL* ssl, timeval interval, unsigned int limit);
  static void DeinitSSL(SSL** ssl, SSL_CTX** ctx, bool quiet);
  static void log_ssl();
  // The flag is written by another thread, hence the atomic read.
  bool Cancelled() const { return m_flag != nullptr && __atomic_load_n(m_flag, __ATOMIC_RELAXED) != 0; }
  // The interval of one wait, cut short to what is left before the deadline.
  timeval WaitInterval() const;

  // The fields of the binary interface, in its order.
  void* m_handle = nullptr;  // plain: int* holding the descriptor; TLS: SSL*
  Ops m_ops;  // the five operations in place, not a pointer to a table
  char* m_wbuf = nullptr;
  unsigned long m_whead = 0;
  unsigned long m_wsize = 0;
  char* m_rbuf = nullptr;
  unsigned long m_rhead = 0;
  unsigned long m_rsize = 0;
  unsigned long m_capacity;
  timeval m_interval{1, 0};
  unsigned int m_timeout = 60;
  int* m_flag = nullptr;
  bool m_ssl = false;
  bool m_allow_untrust = true;

  bool m_has_deadline = false;
  std::chrono::steady_clock::time_point m_deadline;
  // Whether the per-call debug lines are written; decided once per channel
  // so that a server that masks them out pays nothing for them.
  bool m_trace;
};

#endif
