#include "ipc/channel.h"

#include <openssl/err.h>
#include <openssl/x509.h>
#include <pthread.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <climits>

#include "channel-wait.h"
#include "common/error-text.h"
#include "common/log.h"
#include "ipc/error-code.h"

std::string Channel::m_cert_path = "/usr/velt/etc/ssl/ssl.crt/server.crt";
std::string Channel::m_key_path = "/usr/velt/etc/ssl/ssl.key/server.key";
std::string Channel::m_ca_path = "/certs.pem";

const Channel::Ops Channel::kTlsOps = {TlsRead, TlsWrite, TlsFd, TlsDestroy, TlsClosed};

namespace {

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

}  // namespace

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
  SwitchChannelOp(kTlsMode);
  m_ssl = true;
  return P_SUCCESS;
}

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
    bool forWrite = error == SSL_ERROR_WANT_WRITE;
    if (long w = channel_wait::WaitForSocket(SSL_get_fd(ssl), forWrite, ch.WaitInterval()); w != P_SUCCESS) return w;
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
      bool forWrite = error == SSL_ERROR_WANT_WRITE;
      if (long w = channel_wait::WaitForSocket(SSL_get_fd(ssl), forWrite, ch.WaitInterval()); w != P_SUCCESS) return w;
      continue;
    }
    if (error == SSL_ERROR_SYSCALL) {
      PLOVO_LIB_WARN("syscall error: n = %d, ssl_ret = %d, errno = %d, err = %s", r, error, savedErrno,
                     Plovo::ErrorText(savedErrno).c_str());
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
      int w = channel_wait::WaitFd(fd, error == SSL_ERROR_WANT_WRITE, interval);
      if (w == channel_wait::kReady) break;
      if (w == channel_wait::kError) {
        if (errno == EINTR) continue;
        PLOVO_LIB_WARN("SSLHandshake: select: Error Code: %s (%d)", Plovo::ErrorText(errno).c_str(), errno);
        return P_ERR_SYSTEM;
      }
      if (w == channel_wait::kNotSet) {
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
