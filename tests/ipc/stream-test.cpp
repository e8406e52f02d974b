#include "ipc/stream.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <syslog.h>
#include <unistd.h>

#include <string>
#include <thread>

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

PObject Int(uint64_t n) { return PObject(n); }

template <typename C>
PObject Container(const C& empty) {
  PObject v;
  v = empty;
  return v;
}

// One end of a socket pair behind a Channel, the other end raw, so that the
// bytes a stream writes can be compared with literal bytes and literal bytes
// fed to the receiver.
class WireTest : public plovo_test::SandboxTest {
 protected:
  void SetUp() override {
    SandboxTest::SetUp();
    int fds[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
    ASSERT_EQ(channel_.Open(fds[0], true), 0);
    channel_.SetTimeout(2);
    peer_ = fds[1];
  }
  void TearDown() override {
    channel_.Close();
    if (peer_ >= 0) close(peer_);
    SandboxTest::TearDown();
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
  int Received(const std::string& bytes, PObject& target, PStream& stream) {
    EXPECT_EQ(write(peer_, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    shutdown(peer_, SHUT_WR);
    return stream.Recv(channel_, target);
  }
  int Received(const std::string& bytes, PObject& target) {
    PStream stream;
    return Received(bytes, target, stream);
  }

  Channel channel_{81920};
  int peer_ = -1;
};

TEST_F(WireTest, IntegersTakeTheSmallestWidth) {
  EXPECT_EQ(Sent(Int(0)), B({1, 1, 0}));
  EXPECT_EQ(Sent(Int(255)), B({1, 1, 0xFF}));
  EXPECT_EQ(Sent(Int(256)), B({1, 2, 1, 0}));
  EXPECT_EQ(Sent(Int(65535)), B({1, 2, 0xFF, 0xFF}));
  EXPECT_EQ(Sent(Int(65536)), B({1, 4, 0, 1, 0, 0}));
  EXPECT_EQ(Sent(Int(4294967296ull)), B({1, 8, 0, 0, 0, 1, 0, 0, 0, 0}));
  EXPECT_EQ(Sent(Int(UINT64_MAX)), B({1, 8, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}));
}

TEST_F(WireTest, EmptyValuesAndMapsInKeyOrder) {
  EXPECT_EQ(Sent(PObject()), B({0, 0}));
  EXPECT_EQ(Sent(Container(PObject::map_type())), B({0x42, 0x40}));
  EXPECT_EQ(Sent(Container(PObject::array_type())), B({0x41, 0x40}));
  EXPECT_EQ(Sent(PObject("")), B({0x10, 0, 0}));

  PObject listTask;
  listTask["action"] = "list_task";
  EXPECT_EQ(Sent(listTask), B({0x42}) + Str("action") + Str("list_task") + B({0x40}));

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

TEST_F(WireTest, NestedValueRoundTrips) {
  PObject v;
  v["action"] = "set_task_setting";
  v["task_id"] = 4294967296ul;
  v["list"].asArray().push_back(Int(1));
  v["list"].asArray().push_back(PObject());
  v["list"].asArray().push_back("three");
  v["sub"]["empty"].asMap();
  std::string bytes = Sent(v);
  PObject back;
  ASSERT_EQ(Received(bytes, back), 0);
  EXPECT_EQ(back.toString(), v.toString());
  EXPECT_EQ(back["task_id"].asUInt64(), 4294967296ull);
  EXPECT_TRUE(back["list"].asArray()[1].isNull());
}

TEST_F(WireTest, ReceivedContainersMergeIntoTheTarget) {
  PObject array;
  array.asArray().push_back(Int(7));
  ASSERT_EQ(Received(B({0x41, 1, 1, 1, 0x40}), array), 0);
  ASSERT_EQ(array.asArray().size(), 2u);
  EXPECT_EQ(array.asArray()[0].asUInt64(), 7u);
  EXPECT_EQ(array.asArray()[1].asUInt64(), 1u);
}

TEST_F(WireTest, ReceivedMapKeepsMembersTheStreamDoesNotName) {
  PObject map;
  map["b"] = 2;
  ASSERT_EQ(Received(B({0x42}) + Str("a") + B({1, 1, 1, 0x40}), map), 0);
  EXPECT_EQ(map.toString(), "{\"a\": 1, \"b\": 2}");
}

TEST_F(WireTest, ReceivedStringEndsAtItsFirstZeroByte) {
  PObject v;
  ASSERT_EQ(Received(B({0x10, 0, 5, 'a', 'b', 0, 'c', 'd'}), v), 0);
  EXPECT_EQ(v.asString(), "ab");
}

TEST_F(WireTest, MalformedInputIsRefused) {
  plovo_test::LogCapture log;
  PObject v;
  EXPECT_EQ(Received(B({0x42, 0x01, 1, 5}), v), -5);
  EXPECT_TRUE(log.Contains("PStream: expect string, but get tag 1")) << log.Dump();
}

TEST_F(WireTest, NullWithALengthIsRefused) {
  PObject v;
  EXPECT_EQ(Received(B({0x00, 0x01}), v), -5);
}

TEST_F(WireTest, UnknownTagIsRefused) {
  PObject v;
  EXPECT_EQ(Received(B({0x42}) + Str("k") + B({0x99}), v), -5);
}

TEST_F(WireTest, NestingIsLimitedTo64Containers) {
  std::string ok = std::string(64, '\x41') + std::string(64, '\x40');
  PObject v;
  ASSERT_EQ(Received(ok, v), 0);
  const PObject* level = &v;
  int depth = 0;
  while (level->isArray()) {
    ++depth;
    level = &(*level)[0];
  }
  EXPECT_EQ(depth, 64);
}

TEST_F(WireTest, SixtyFiveNestedContainersAreRefused) {
  std::string deep = std::string(65, '\x41') + std::string(65, '\x40');
  PObject v;
  EXPECT_EQ(Received(deep, v), -5);
}

TEST_F(WireTest, PeerClosingMidMessageIsAnIOErrorWithTheKeyPath) {
  plovo_test::LogCapture log;
  PObject v;
  EXPECT_EQ(Received(B({0x42}) + Str("outer") + B({0x42}) + Str("inner") + B({0x10, 0, 9, 'a', 'b'}), v), -2);
  EXPECT_TRUE(log.Contains("Error stack: outer.inner")) << log.Dump();
}

TEST_F(WireTest, BufferValueFailsTheWholeSendAndNamesItsKey) {
  plovo_test::LogCapture log;
  PObject v;
  v["ok"] = 1;
  v["outer"]["raw"] = PObject::buffer_type();
  EXPECT_EQ(PStream().Send(channel_, v), -1);
  EXPECT_TRUE(log.Contains(LOG_ERR, "Error stack: outer.raw")) << log.Dump();
  EXPECT_EQ(Drain(), "");  // nothing is flushed after a failure
}

TEST_F(WireTest, StringsMustFitTheirLength) {
  EXPECT_EQ(Sent(PObject(std::string(65535, 'x'))).size(), 3u + 65535u);
  plovo_test::LogCapture log;
  PObject v;
  v["name"] = std::string(65536, 'x');
  EXPECT_EQ(PStream().Send(channel_, v), -4);
  EXPECT_TRUE(log.Contains("Error stack: name")) << log.Dump();
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

TEST_F(BinaryTest, ShortSourceFileFailsAfterSendingWhatItHas) {
  WriteFile("/src", "abc");
  EXPECT_EQ(PStream().Send(channel_, Section("/src", 0, 10)), -5);
  EXPECT_EQ(PStream().Send(channel_, Section("/missing", 0, 1)), -1);
}

TEST_F(BinaryTest, ReceiverRecreatesTheTargetFileAtOffsetZero) {
  WriteFile("/dst", "old content that is longer");
  PObject target = Section("/dst", 0, 0);
  ASSERT_EQ(Received(B({0x30, 0, 0, 0, 0, 0, 0, 0, 3}) + "new", target), 0);
  EXPECT_EQ(ReadFile("/dst"), "new");
  EXPECT_EQ(target.asBinary().length, 3u);
}

TEST_F(BinaryTest, ResumeCutsTheFileToTheOffsetAndAppends) {
  WriteFile("/dst", "abcXXXX");
  PObject target = Section("/dst", 3, 7);  // recorded length differs from the offset
  ASSERT_EQ(Received(B({0x30, 0, 0, 0, 0, 0, 0, 0, 2}) + "de", target), 0);
  EXPECT_EQ(ReadFile("/dst"), "abcde");
  EXPECT_EQ(target.asBinary().length, 5u);
}

TEST_F(BinaryTest, TargetWithoutPathGetsATemporaryFileInTheReceiveLocation) {
  MakeDir("/incoming");
  PStream stream;
  stream.SetDefaultRecvLocation(Path("/incoming"));
  PObject target;
  ASSERT_EQ(Received(B({0x30, 0, 0, 0, 0, 0, 0, 0, 4}) + "data", target, stream), 0);
  const std::string& path = target.asBinary().path;
  ASSERT_EQ(path.size(), Path("/incoming/").size() + 8);
  EXPECT_EQ(ReadFile(path.substr(Root().size())), "data");
  uint64_t done = 0, total = 0;
  std::string history;
  stream.GetStatus(history, done, total);
  EXPECT_EQ(done, 4u);
  EXPECT_EQ(total, 4u);
}

TEST_F(BinaryTest, PeerClosingMidTransferKeepsAndCountsTheBytesReceived) {
  PObject target = Section("/dst", 0, 0);
  EXPECT_EQ(Received(B({0x30, 0, 0, 0, 0, 0, 0, 0, 9}) + "part", target), -2);
  EXPECT_EQ(ReadFile("/dst"), "part");
  EXPECT_EQ(target.asBinary().length, 4u);
}

TEST_F(BinaryTest, FullDiskIsAnInvalidArgument) {
  PObject target;
  PObject::binary_type b;
  b.path = "/dev/full";
  target = b;
  EXPECT_EQ(Received(B({0x30, 0, 0, 0, 0, 0, 0, 0, 3}) + "abc", target), -4);
}

}  // namespace
