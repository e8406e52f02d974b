#include "ipc/channel.h"

#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdio>
#include <string>
#include <thread>

#include "ipc/error-code.h"
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

TEST_F(ChannelTest, RingsKeepBytesInOrderThroughPartialSendsAndOddReads) {
  // A small socket buffer makes sends stop short, so the write ring keeps
  // bytes at its end and new ones wrap around to its start. The reading
  // channel's ring is smaller than most of its reads.
  int fds[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
  int small = 4096;
  ASSERT_EQ(setsockopt(fds[0], SOL_SOCKET, SO_SNDBUF, &small, sizeof(small)), 0);
  Channel out(65521), in(7);
  ASSERT_EQ(out.Open(fds[0], true), P_SUCCESS);
  ASSERT_EQ(in.Open(fds[1], true), P_SUCCESS);
  in.SetTimeout(2);
  const std::string data = Pattern(1 << 20);
  std::string got;
  std::thread reader([&] {
    for (size_t size = 1; got.size() < data.size(); size = size % 11 + 1) {
      std::string piece(std::min(size, data.size() - got.size()), '\0');
      unsigned char c = 0;
      if ((piece.size() == 1 ? in.ReadByte(&c) : in.Read(&piece[0], piece.size())) != P_SUCCESS) break;
      got += piece.size() == 1 ? std::string(1, static_cast<char>(c)) : piece;
    }
  });
  size_t pos = 0;
  for (size_t size = 1; pos < data.size(); pos += size, size = (size * 37 + 11) % 65521 + 1) {
    size = std::min(size, data.size() - pos);
    if (out.Write(data.data() + pos, size) != P_SUCCESS) break;
  }
  EXPECT_EQ(pos, data.size());
  EXPECT_EQ(out.FlushWrite(0), P_SUCCESS);
  out.Close();  // ends the reader should anything be missing
  reader.join();
  EXPECT_TRUE(got == data);
}

TEST_F(ChannelTest, WritesWaitForRoomOrCloseAndClosedChannelRefusesIo) {
  Channel ch(16);
  Adopt(ch);
  EXPECT_EQ(ch.Open(peer_, true), P_ERR_INVALID_ARGUMENT);  // already open: the first descriptor stays
  EXPECT_EQ(Channel(16).Open(-1, false), P_ERR_INVALID_ARGUMENT);
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

TEST_F(ChannelTest, TimeLimitEndsReadsAndFlushesWithoutProgress) {
  Channel ch(4096);
  Adopt(ch);
  ch.SetTimeout(1);
  SendRaw("ab");
  char buf[4];
  unsigned long got = 0;
  EXPECT_EQ(ch.Read(buf, sizeof(buf), got), P_ERR_TIMEOUT);
  EXPECT_EQ(got, 2u);
  // The peer never reads: writes succeed until the socket is full.
  const std::string block(4096, 'z');
  int r = P_SUCCESS;
  for (int i = 0; i < 100000 && r == P_SUCCESS; ++i) r = ch.Write(block.data(), block.size());
  EXPECT_EQ(r, P_ERR_TIMEOUT);
  ch.ClearWrite();  // nothing left for Close to wait on
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

// The server's certificate is a.crt; the client trusts the one named, or
// any when it allows untrusted servers. Data crosses only a verified or
// allowed connection, and more of it than the socket holds at once.
TEST_F(ChannelTest, TlsCarriesDataOnlyOnceTheServerIsTrustedOrAllowed) {
  ASSERT_NO_FATAL_FAILURE(MakeSelfSigned(Root() + "/a.crt", Root() + "/a.key"));
  ASSERT_NO_FATAL_FAILURE(MakeSelfSigned(Root() + "/b.crt", Root() + "/b.key"));
  Channel::SetCERTPath(Root() + "/a.crt");
  Channel::SetPriKeyPath(Root() + "/a.key");
  const std::string data = Pattern(300000);
  const struct {
    const char* ca;
    bool allowUntrust;
    int converted;
  } cases[] = {{"/a.crt", false, P_SUCCESS}, {"/b.crt", false, P_ERR_SSL_VERIFY}, {"/b.crt", true, P_SUCCESS}};
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.ca) + (c.allowUntrust ? " allowing untrusted" : ""));
    Channel::SetVerifyCAPath(Root() + c.ca);
    Channel server(4096), client(4096);
    int fds[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
    ASSERT_EQ(server.Open(fds[0], true), P_SUCCESS);
    ASSERT_EQ(client.Open(fds[1], true), P_SUCCESS);
    server.SetTimeout(2);
    client.SetTimeout(2);
    client.SetAllowUntrust(c.allowUntrust);
    std::string received(data.size(), '\0');
    int serverResult = -99;
    std::thread thread([&] {
      serverResult = server.ConvertToSSLChannel(true);
      if (serverResult == P_SUCCESS) serverResult = server.Read(&received[0], received.size());
    });
    const int converted = client.ConvertToSSLChannel(false);
    if (converted == P_SUCCESS) {
      EXPECT_EQ(client.ConvertToSSLChannel(false), P_SUCCESS);  // once is enough
      // No ASSERT while the server thread runs: it must be joined.
      size_t pos = 0;
      while (pos < data.size() &&
             client.Write(data.data() + pos, std::min<size_t>(4096, data.size() - pos)) == P_SUCCESS) {
        pos += 4096;
      }
      EXPECT_EQ(client.FlushWrite(0), P_SUCCESS);
    }
    client.Close();  // also ends the server's read when nothing was sent
    thread.join();
    EXPECT_EQ(converted, c.converted);
    EXPECT_EQ(serverResult == P_SUCCESS, c.converted == P_SUCCESS);
    EXPECT_EQ(received == data, c.converted == P_SUCCESS);
  }
}

}  // namespace
