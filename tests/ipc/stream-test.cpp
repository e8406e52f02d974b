#include "ipc/stream.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <syslog.h>
#include <unistd.h>

#include <string>

#include "log-capture.h"
#include "sandbox.h"

namespace {

std::string B(std::initializer_list<int> bytes) {
  std::string s;
  for (int b : bytes) s.push_back(static_cast<char>(b));
  return s;
}

// A string value on the wire: tag, 16-bit length, bytes.
std::string Str(const std::string& text) { return B({0x10, 0, static_cast<int>(text.size())}) + text; }

// One end of a socket pair behind a Channel, the other end raw, so that the
// bytes a stream writes can be compared with literal bytes and literal bytes
// fed to the receiver.
class WireTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    Reconnect();
  }
  void TearDown() override {
    channel_.Close();
    if (peer_ >= 0) close(peer_);
    SandboxTest::TearDown();
  }
  // A fresh pair: Received ends the peer's side of the current one.
  void Reconnect() {
    channel_.Close();
    if (peer_ >= 0) close(peer_);
    int fds[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
    ASSERT_EQ(channel_.Open(fds[0], true), 0);
    channel_.SetTimeout(2);
    peer_ = fds[1];
  }

  // What one Send put on the wire.
  std::string Sent(const PObject& value) {
    EXPECT_EQ(PStream().Send(channel_, value), 0);
    return Drain();
  }
  std::string Drain() {
    std::string out;
    char buf[65536];
    ssize_t n;
    while ((n = recv(peer_, buf, sizeof(buf), MSG_DONTWAIT)) > 0) out.append(buf, static_cast<size_t>(n));
    return out;
  }
  // Feeds bytes, ends the peer's side and receives one value into target.
  int Received(const std::string& bytes, PObject& target) {
    EXPECT_EQ(write(peer_, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    shutdown(peer_, SHUT_WR);
    return PStream().Recv(channel_, target);
  }

  Channel channel_{81920};
  int peer_ = -1;
};

TEST_F(WireTest, IntegersTakeTheSmallestWidth) {
  EXPECT_EQ(Sent(PObject(uint64_t{0})), B({1, 1, 0}));
  EXPECT_EQ(Sent(PObject(uint64_t{255})), B({1, 1, 0xFF}));
  EXPECT_EQ(Sent(PObject(uint64_t{256})), B({1, 2, 1, 0}));
  EXPECT_EQ(Sent(PObject(uint64_t{65535})), B({1, 2, 0xFF, 0xFF}));
  EXPECT_EQ(Sent(PObject(uint64_t{65536})), B({1, 4, 0, 1, 0, 0}));
  EXPECT_EQ(Sent(PObject(uint64_t{4294967296})), B({1, 8, 0, 0, 0, 1, 0, 0, 0, 0}));
  EXPECT_EQ(Sent(PObject(uint64_t{UINT64_MAX})), B({1, 8, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}));
}

TEST_F(WireTest, EmptyValuesAndMapsInKeyOrder) {
  PObject map, array;
  map = PObject::map_type();
  array = PObject::array_type();
  EXPECT_EQ(Sent(PObject()), B({0, 0}));
  EXPECT_EQ(Sent(map), B({0x42, 0x40}));
  EXPECT_EQ(Sent(array), B({0x41, 0x40}));
  EXPECT_EQ(Sent(PObject("")), B({0x10, 0, 0}));
  PObject ordered;  // sent in byte-wise key order, whatever the insertion order
  ordered["b"] = 2;
  ordered["a"].asArray().push_back("x");
  EXPECT_EQ(Sent(ordered), B({0x42}) + Str("a") + B({0x41}) + Str("x") + B({0x40}) + Str("b") + B({1, 1, 2, 0x40}));
}

TEST_F(WireTest, OneLeadingUnderscoreIsDroppedAtEveryLevel) {
  PObject v;
  v["_id"] = 7;
  v["__x"] = 1;
  v["inner"]["_name"] = "n";
  EXPECT_EQ(Sent(v), B({0x42}) + Str("_x") + B({1, 1, 1}) + Str("id") + B({1, 1, 7}) + Str("inner") + B({0x42}) +
                         Str("name") + Str("n") + B({0x40, 0x40}));
}

// What the receiver makes of literal bytes; -5 for what it refuses.
TEST_F(WireTest, ReceivedBytesAndRefusals) {
  const auto nested = [](int n) { return std::string(n, '\x41') + std::string(n, '\x40'); };
  const struct {
    std::string bytes;
    int rc;
    const char* value;
  } cases[] = {
      {B({0, 0}), 0, "null"},
      {B({1, 2, 1, 0}), 0, "256"},
      {B({1, 8, 0, 0, 0, 1, 0, 0, 0, 0}), 0, "4294967296"},
      {B({0x10, 0, 5, 'a', 'b', 0, 'c', 'd'}), 0, "\"ab\""},  // ends at the first zero byte
      {B({0x42}) + Str("k") + B({0x41, 1, 1, 1, 0, 0, 0x40, 0x40}), 0, "{\"k\": [1, null]}"},
      {nested(64), 0, nullptr},
      {nested(65), -5, nullptr},
      {B({0x42, 0x01, 1, 5}), -5, nullptr},  // a key that is no string
      {B({0x00, 0x01}), -5, nullptr},        // a null with a length
      {B({0x42}) + Str("k") + B({0x99}), -5, nullptr},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(testing::PrintToString(c.bytes));
    Reconnect();
    PObject v;
    EXPECT_EQ(Received(c.bytes, v), c.rc);
    if (c.value) {
      EXPECT_EQ(v.toString(), c.value);
    }
  }
}

// Texts of every length end at their first zero byte, whichever way the
// receiver reads them (short ones through the stack, long ones in place).
TEST_F(WireTest, ReceivedTextsOfAnyLengthEndAtTheirFirstZeroByte) {
  for (size_t length : {255u, 256u, 257u, 300u, 65535u}) {
    for (size_t zero : {size_t{0}, length / 2, length - 1, length}) {
      SCOPED_TRACE(testing::Message() << length << " bytes, zero at " << zero);
      std::string text(length, 'x');
      if (zero < length) text[zero] = '\0';
      Reconnect();
      PObject v;
      ASSERT_EQ(Received(B({0x10, static_cast<int>(length >> 8), static_cast<int>(length & 0xff)}) + text, v), 0);
      EXPECT_EQ(v.asStringRef(), std::string(std::min(zero, length), 'x'));
    }
  }
}

TEST_F(WireTest, PeerClosingMidMessageIsAnIOErrorWithTheKeyPath) {
  plovo_test::LogCapture log;
  PObject v;
  EXPECT_EQ(Received(B({0x42}) + Str("outer") + B({0x42}) + Str("inner") + B({0x10, 0, 9, 'a', 'b'}), v), -2);
  EXPECT_TRUE(log.Contains("Error stack: outer.inner")) << log.Dump();
}

// A refused value puts no byte on the wire, and its key path is logged.
TEST_F(WireTest, RefusedValuesSendNothingAndNameTheirKey) {
  EXPECT_EQ(Sent(PObject(std::string(65535, 'x'))).size(), 3u + 65535u);
  plovo_test::LogCapture log;
  PObject v;
  v["ok"] = 1;
  v["outer"]["raw"] = PObject::buffer_type();
  EXPECT_EQ(PStream().Send(channel_, v), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Error stack: outer.raw")) << log.Dump();
  v["outer"]["raw"] = std::string(65536, 'x');
  EXPECT_EQ(PStream().Send(channel_, v), -4);
  EXPECT_EQ(Drain(), "");
}

// ---- binary transfers ------------------------------------------------------

class BinaryTest : public WireTest {
 protected:
  PObject Section(const std::string& file, uint64_t offset, uint64_t length) {
    PObject v;
    PObject::binary_type b;
    b.path = Path(file);
    b.offset = offset;
    b.length = length;
    v = b;
    return v;
  }
};

TEST_F(BinaryTest, SendsTheFileSectionAfterItsLength) {
  WriteFile("/src", "0123456789");
  EXPECT_EQ(Sent(Section("/src", 2, 5)), B({0x30, 0, 0, 0, 0, 0, 0, 0, 5}) + "23456");
}

// A full disk on the receiving side is an invalid argument.
TEST_F(BinaryTest, SourceTooShortMissingUnsendableOrTargetFullFails) {
  WriteFile("/src", "abc");
  EXPECT_EQ(PStream().Send(channel_, Section("/src", 0, 10)), -5);
  EXPECT_EQ(PStream().Send(channel_, Section("/missing", 0, 1)), -1);
  PObject full = Section("/src", 0, 0);
  full.asBinary().path = "/dev/full";
  EXPECT_EQ(Received(B({0x30, 0, 0, 0, 0, 0, 0, 0, 3}) + "abc", full), -4);
  channel_.Close();
  EXPECT_EQ(PStream().Send(channel_, Section("/src", 0, 3)), -2);
}

// The target file is cut to the section's offset, then gets what arrives;
// a peer that closes mid-transfer leaves (and counts) what came.
TEST_F(BinaryTest, ReceiverCutsTheTargetAtItsOffsetAndKeepsWhatArrives) {
  const struct {
    const char* before;
    uint64_t offset, recordedLength;
    std::string bytes;
    int rc;
    const char* after;
  } cases[] = {
      {"old content that is longer", 0, 0, B({0x30, 0, 0, 0, 0, 0, 0, 0, 3}) + "new", 0, "new"},
      {"abcXXXX", 3, 7, B({0x30, 0, 0, 0, 0, 0, 0, 0, 2}) + "de", 0, "abcde"},
      {"", 0, 0, B({0x30, 0, 0, 0, 0, 0, 0, 0, 9}) + "part", -2, "part"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.after);
    Reconnect();
    WriteFile("/dst", c.before);
    PObject target = Section("/dst", c.offset, c.recordedLength);
    EXPECT_EQ(Received(c.bytes, target), c.rc);
    EXPECT_EQ(ReadFile("/dst"), c.after);
    EXPECT_EQ(target.asBinary().length, std::string(c.after).size());
  }
}

}  // namespace
