#include "ipc/channel.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <functional>
#include <string>
#include <thread>

#include "ipc/error-code.h"
#include "log-capture.h"
#include "sandbox.h"

namespace {

class ChannelTest : public plovo_test::SandboxTest {
 protected:
  void TearDown() override {
    if (peer_ >= 0) close(peer_);
    SandboxTest::TearDown();
  }

  // Gives ch one end of a fresh socket pair; the test speaks raw bytes on the other.
  void Adopt(Channel& ch) {
    int fds[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
    ASSERT_EQ(ch.Open(fds[0], true), P_SUCCESS);
    peer_ = fds[1];
  }
  void SendRaw(const std::string& bytes) const {
    ASSERT_EQ(send(peer_, bytes.data(), bytes.size(), 0), static_cast<ssize_t>(bytes.size()));
  }
  // Everything the channel has sent so far, without waiting for more.
  std::string RecvAvailable() const {
    std::string out;
    char buf[4096];
    for (ssize_t n; (n = recv(peer_, buf, sizeof(buf), MSG_DONTWAIT)) > 0;) out.append(buf, n);
    return out;
  }

  int peer_ = -1;
};

std::string Pattern(size_t n) {
  std::string s(n, '\0');
  for (size_t i = 0; i < n; ++i) s[i] = static_cast<char>(i * 7 % 251);
  return s;
}

TEST_F(ChannelTest, IntegersTravelMostSignificantByteFirst) {
  Channel ch(64);
  Adopt(ch);
  SendRaw(std::string("\x00\x00\x01\x02\xAB\xCD\x01\x02\x03\x04\x05\x06\x07\x08\xFE", 15));
  unsigned int v32 = 0;
  unsigned short v16 = 0;
  unsigned long v64 = 0;
  unsigned char v8 = 0;  // the first read fills the ring, the others are served from it
  ASSERT_EQ(ch.ReadInt32(&v32), P_SUCCESS);
  ASSERT_EQ(ch.ReadInt16(&v16), P_SUCCESS);
  ASSERT_EQ(ch.ReadInt64(&v64), P_SUCCESS);
  ASSERT_EQ(ch.ReadByte(&v8), P_SUCCESS);
  EXPECT_EQ(v32, 258u);
  EXPECT_EQ(v16, 0xABCD);
  EXPECT_EQ(v64, 0x0102030405060708ul);
  EXPECT_EQ(v8, 0xFE);

  ASSERT_EQ(ch.WriteInt16(0x1234), P_SUCCESS);
  ASSERT_EQ(ch.WriteInt32(0xA1B2C3D4u), P_SUCCESS);
  ASSERT_EQ(ch.WriteInt64(0x0102030405060708ul), P_SUCCESS);
  ASSERT_EQ(ch.WriteByte(0x7F), P_SUCCESS);
  ASSERT_EQ(ch.FlushWrite(0), P_SUCCESS);
  EXPECT_EQ(RecvAvailable(), std::string("\x12\x34\xA1\xB2\xC3\xD4\x01\x02\x03\x04\x05\x06\x07\x08\x7F", 15));
}

TEST_F(ChannelTest, SmallRingKeepsReadsInOrder) {
  Channel ch(7);
  Adopt(ch);
  const std::string data = Pattern(600);
  // Reads of odd sizes, some larger than the ring, mixed with single bytes.
  SendRaw(data);
  std::string in;
  for (size_t size = 1; in.size() < data.size(); size = size % 11 + 1) {
    size = std::min(size, data.size() - in.size());
    std::string piece(size, '\0');
    if (size == 1) {
      unsigned char c;
      ASSERT_EQ(ch.ReadByte(&c), P_SUCCESS);
      piece[0] = static_cast<char>(c);
    } else {
      ASSERT_EQ(ch.Read(&piece[0], size), P_SUCCESS);
    }
    in += piece;
  }
  EXPECT_EQ(in, data);
}

TEST_F(ChannelTest, PartialSendsToASlowReaderKeepBytesInOrder) {
  // A small socket buffer makes sends stop short, so the write ring keeps
  // bytes at its end and new ones wrap around to its start.
  int fds[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
  int small = 4096;
  ASSERT_EQ(setsockopt(fds[0], SOL_SOCKET, SO_SNDBUF, &small, sizeof(small)), 0);
  Channel ch(65521);
  ASSERT_EQ(ch.Open(fds[0], true), P_SUCCESS);
  peer_ = fds[1];
  const std::string data = Pattern(4 << 20);
  std::string out;
  std::thread reader([&] {
    char buf[1500];
    for (ssize_t n; out.size() < data.size() && (n = recv(peer_, buf, sizeof(buf), 0)) > 0;) out.append(buf, n);
  });
  for (size_t pos = 0, size = 1; pos < data.size(); pos += size, size = (size * 37 + 11) % 65521 + 1) {
    size = std::min(size, data.size() - pos);
    ASSERT_EQ(ch.Write(data.data() + pos, size), P_SUCCESS);
  }
  EXPECT_EQ(ch.FlushWrite(0), P_SUCCESS);
  ch.Close();  // ends the reader should anything be missing
  reader.join();
  EXPECT_TRUE(out == data);
}

TEST_F(ChannelTest, WritesWaitForRoomOrCloseAndClosedChannelRefusesIo) {
  Channel ch(16);
  Adopt(ch);
  const std::string block(17, 'x');
  EXPECT_EQ(ch.Write(block.data(), 17), P_ERR_INVALID_ARGUMENT);
  EXPECT_EQ(ch.Write(block.data(), 16), P_SUCCESS);
  EXPECT_EQ(RecvAvailable(), "");
  EXPECT_EQ(ch.Write("abc", 3), P_SUCCESS);
  std::string out = RecvAvailable();
  EXPECT_GE(out.size(), 3u);  // at least the room the new bytes needed
  EXPECT_EQ(ch.Close(), P_SUCCESS);
  out += RecvAvailable();
  EXPECT_EQ(out, std::string(16, 'x') + "abc");  // nothing of the refused block
  char c;
  EXPECT_EQ(recv(peer_, &c, 1, 0), 0);  // and the peer sees the end
  EXPECT_TRUE(ch.IsClosed());
  EXPECT_EQ(ch.Read(&c, 1), P_ERR_IO);
  EXPECT_EQ(ch.Write("x", 1), P_ERR_IO);
  EXPECT_EQ(ch.WriteByte('x'), P_ERR_IO);
  EXPECT_EQ(ch.Close(), P_SUCCESS);
}

TEST_F(ChannelTest, VanishedPeerIsAnIoErrorWithBytesSoFarDelivered) {
  Channel ch(16);
  Adopt(ch);
  SendRaw("abc");
  close(peer_);
  peer_ = -1;
  char buf[10];
  unsigned long got = 99;
  EXPECT_EQ(ch.Read(buf, sizeof(buf), got), P_ERR_IO);
  ASSERT_EQ(got, 3u);
  EXPECT_EQ(std::string(buf, 3), "abc");
  // Sending to it must fail, not raise SIGPIPE.
  ASSERT_EQ(ch.Write("x", 1), P_SUCCESS);
  EXPECT_EQ(ch.FlushWrite(0), P_ERR_IO);
}

TEST_F(ChannelTest, CancelFlagStopsReadAndFlush) {
  Channel ch(16);
  Adopt(ch);
  ch.SetTimeout(30);  // a flag that is not seen would end in a timeout instead
  int flag = 0;
  ch.SetFlag(&flag);
  std::thread canceller([&flag] {
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    __atomic_store_n(&flag, 1, __ATOMIC_RELAXED);
  });
  char buf[4];
  EXPECT_EQ(ch.Read(buf, sizeof(buf)), P_ERR_INTERRUPTED);
  canceller.join();
  ASSERT_EQ(ch.Write("abcd", 4), P_SUCCESS);
  EXPECT_EQ(ch.FlushWrite(0), P_ERR_INTERRUPTED);
  EXPECT_EQ(RecvAvailable(), "");
  flag = 0;
  EXPECT_EQ(ch.FlushWrite(0), P_SUCCESS);
  EXPECT_EQ(RecvAvailable(), "abcd");
}

TEST_F(ChannelTest, TimeLimitEndsReadsAndFlushesWithoutProgress) {
  plovo_test::LogCapture log;
  Channel ch(4096);
  Adopt(ch);
  ch.SetTimeout(1);
  SendRaw("ab");
  char buf[4];
  unsigned long got = 0;
  EXPECT_EQ(ch.Read(buf, sizeof(buf), got), P_ERR_TIMEOUT);
  EXPECT_EQ(got, 2u);
  EXPECT_TRUE(log.Contains(LOG_WARNING, "ReadMore: Channel timeout for 1 seconed")) << log.Dump();
  // The peer never reads: writes succeed until the socket is full.
  const std::string block(4096, 'z');
  int r = P_SUCCESS;
  for (int i = 0; i < 100000 && r == P_SUCCESS; ++i) r = ch.Write(block.data(), block.size());
  EXPECT_EQ(r, P_ERR_TIMEOUT);
  EXPECT_TRUE(log.Contains(LOG_WARNING, "FlushWrite: Channel timeout for 1 seconds")) << log.Dump();
  EXPECT_TRUE(log.Contains(LOG_WARNING, "Write: FlushWrite failed"));
  ch.ClearWrite();  // nothing left for Close to wait on
}

TEST_F(ChannelTest, OpenConnectsToUnixPathAndRefusesBadTargets) {
  const std::string path = Root() + "/sock";
  int listener = socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", path.c_str());
  ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)), 0);
  ASSERT_EQ(listen(listener, 1), 0);
  Channel ch(16);
  ASSERT_EQ(ch.Open(path.c_str()), P_SUCCESS);
  peer_ = accept(listener, nullptr, nullptr);
  close(listener);
  std::string ip = "stale";
  int port = 5;
  EXPECT_EQ(ch.GetPeerInfo(ip, port), P_SUCCESS);
  EXPECT_TRUE(ip.empty() && port == 0);  // a Unix peer has no address

  int other[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, other), 0);
  EXPECT_EQ(ch.Open(other[0], true), P_ERR_INVALID_ARGUMENT);
  close(other[0]);
  close(other[1]);
  ASSERT_EQ(ch.WriteInt32(7), P_SUCCESS);
  ASSERT_EQ(ch.FlushWrite(0), P_SUCCESS);
  EXPECT_EQ(RecvAvailable(), std::string("\0\0\0\x07", 4));  // still the first connection

  plovo_test::LogCapture log;
  Channel fresh(16);
  EXPECT_EQ(fresh.Open(-1, false), P_ERR_INVALID_ARGUMENT);
  EXPECT_EQ(fresh.Open("127.0.0.1", -1), P_SUCCESS);
  EXPECT_TRUE(fresh.IsClosed());
  const std::string missing = Root() + "/no-socket";
  EXPECT_EQ(fresh.Open(missing.c_str()), P_ERR_IO);
  EXPECT_TRUE(fresh.IsClosed());
  EXPECT_TRUE(log.Contains(LOG_WARNING, "Channel: Can not connect to server at '" + missing + "'")) << log.Dump();
}

// A loopback TCP socket bound to an ephemeral port; listening when asked.
int LoopbackSocket(bool listening, int& port) {
  int fd = socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof(addr);
  if (bind(fd, reinterpret_cast<sockaddr*>(&addr), len) != 0 || (listening && listen(fd, 1) != 0) ||
      getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
    close(fd);
    return -1;
  }
  port = ntohs(addr.sin_port);
  return fd;
}

TEST_F(ChannelTest, TcpConnectsToLoopbackAndReportsBothPeersOrIsRefused) {
  int port = 0;
  int listener = LoopbackSocket(true, port);
  ASSERT_GE(listener, 0);
  Channel client(16), server(16);
  ASSERT_EQ(client.Open("127.0.0.1", port), P_SUCCESS);
  sockaddr_in from{};
  socklen_t len = sizeof(from);
  int accepted = accept(listener, reinterpret_cast<sockaddr*>(&from), &len);
  close(listener);
  ASSERT_EQ(server.Open(accepted, true), P_SUCCESS);
  std::string ip;
  int peerPort = 0;
  ASSERT_EQ(client.GetPeerInfo(ip, peerPort), P_SUCCESS);
  EXPECT_EQ(ip, "127.0.0.1");
  EXPECT_EQ(peerPort, port);
  ASSERT_EQ(server.GetPeerInfo(ip, peerPort), P_SUCCESS);
  EXPECT_EQ(ip, "127.0.0.1");
  EXPECT_EQ(peerPort, ntohs(from.sin_port));

  int refusing = LoopbackSocket(false, port);  // bound, not listening
  ASSERT_GE(refusing, 0);
  Channel refused(16);
  EXPECT_EQ(refused.Open("127.0.0.1", port), P_ERR_IO);
  EXPECT_TRUE(refused.IsClosed());
  close(refusing);
}

// Writes a new self-signed certificate and its key as PEM files.
void MakeSelfSigned(const std::string& certPath, const std::string& keyPath) {
  EVP_PKEY* key = EVP_EC_gen("P-256");
  X509* cert = X509_new();
  ASSERT_TRUE(key != nullptr && cert != nullptr);
  X509_set_version(cert, 2);
  ASN1_INTEGER_set(X509_get_serialNumber(cert), 1);
  X509_gmtime_adj(X509_getm_notBefore(cert), -60);
  X509_gmtime_adj(X509_getm_notAfter(cert), 3600);
  X509_set_pubkey(cert, key);
  X509_NAME* name = X509_get_subject_name(cert);
  X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC, reinterpret_cast<const unsigned char*>("plovo-test"), -1, -1, 0);
  X509_set_issuer_name(cert, name);
  ASSERT_GT(X509_sign(cert, key, EVP_sha256()), 0);
  FILE* c = fopen(certPath.c_str(), "w");
  FILE* k = fopen(keyPath.c_str(), "w");
  ASSERT_TRUE(c != nullptr && k != nullptr);
  EXPECT_EQ(PEM_write_X509(c, cert), 1);
  EXPECT_EQ(PEM_write_PrivateKey(k, key, nullptr, nullptr, 0, nullptr, nullptr), 1);
  fclose(c);
  fclose(k);
  X509_free(cert);
  EVP_PKEY_free(key);
}

class ChannelTlsTest : public ChannelTest {
 protected:
  void SetUp() override {
    ChannelTest::SetUp();
    ASSERT_NO_FATAL_FAILURE(MakeSelfSigned(Root() + "/a.crt", Root() + "/a.key"));
    ASSERT_NO_FATAL_FAILURE(MakeSelfSigned(Root() + "/b.crt", Root() + "/b.key"));
    Channel::SetCERTPath(Root() + "/a.crt");
    Channel::SetPriKeyPath(Root() + "/a.key");
  }
  // Opens both channels on a socket pair and runs the server end (its
  // conversion result, then work) on a thread the caller joins.
  std::thread StartServer(Channel& server, Channel& client, std::function<void(int)> work) {
    int fds[2];
    EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
    EXPECT_EQ(server.Open(fds[0], true), P_SUCCESS);
    EXPECT_EQ(client.Open(fds[1], true), P_SUCCESS);
    server.SetTimeout(2);
    client.SetTimeout(2);
    return std::thread([&server, work] { work(server.ConvertToSSLChannel(true)); });
  }
};

TEST_F(ChannelTlsTest, TrustedServerCarriesDataBothWays) {
  Channel::SetVerifyCAPath(Root() + "/a.crt");
  Channel server(4096), client(4096);
  client.SetAllowUntrust(false);
  const std::string data = Pattern(300000);  // more than the socket holds at once
  int serverResult = -99;
  std::string received(data.size(), '\0');
  std::thread thread = StartServer(server, client, [&](int converted) {
    serverResult = converted;
    if (converted != P_SUCCESS) return;
    serverResult = server.Read(&received[0], received.size());
    if (serverResult == P_SUCCESS && server.Write("reply", 5) == P_SUCCESS) serverResult = server.FlushWrite(0);
  });
  ASSERT_EQ(client.ConvertToSSLChannel(false), P_SUCCESS);
  EXPECT_EQ(client.ConvertToSSLChannel(false), P_SUCCESS);  // once is enough
  for (size_t pos = 0; pos < data.size(); pos += 4096) {
    ASSERT_EQ(client.Write(data.data() + pos, std::min<size_t>(4096, data.size() - pos)), P_SUCCESS);
  }
  ASSERT_EQ(client.FlushWrite(0), P_SUCCESS);
  char reply[5];
  EXPECT_EQ(client.Read(reply, 5), P_SUCCESS);
  thread.join();
  EXPECT_EQ(serverResult, P_SUCCESS);
  EXPECT_TRUE(received == data);
  EXPECT_EQ(std::string(reply, 5), "reply");
}

TEST_F(ChannelTlsTest, UnknownServerFailsVerificationUnlessUntrustedAllowed) {
  Channel::SetVerifyCAPath(Root() + "/b.crt");
  plovo_test::LogCapture log;
  for (bool allow : {false, true}) {
    SCOPED_TRACE(allow ? "untrusted allowed" : "untrusted refused");
    Channel server(64), client(64);
    client.SetAllowUntrust(allow);
    int serverRead = -99;
    std::thread thread = StartServer(server, client, [&](int converted) {
      char c;
      serverRead = converted != P_SUCCESS ? converted : server.Read(&c, 1);
    });
    int converted = client.ConvertToSSLChannel(false);
    if (converted == P_SUCCESS) {
      EXPECT_EQ(client.WriteByte('!'), P_SUCCESS);
    }
    client.Close();  // also ends the server's read when nothing was sent
    thread.join();
    EXPECT_EQ(converted, allow ? P_SUCCESS : P_ERR_SSL_VERIFY);
    EXPECT_EQ(serverRead == P_SUCCESS, allow);
  }
  EXPECT_TRUE(log.Contains(LOG_WARNING, "ConvertToSSLChannel: Verify Fail!"));
}

}  // namespace
