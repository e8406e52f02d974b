// PStream: the wire format spoken with the copy daemon. It writes a PObject
// to a Channel as tag-length-value bytes and reads one back; each request
// and each answer is one value (normally a map), self-delimiting, with no
// outer length prefix. docs/protocol.md describes the bytes.
//
// Results are the shared codes of ipc/error-code.h: 0 success; -1 a local
// resource failure (allocation, a file that cannot be opened or sought, a
// buffer value that has no wire form); -2 a channel failure; -4 a string too
// long for its 16-bit length, or a full disk while storing a received file;
// -5 malformed input, nesting deeper than 64 containers, or a source file
// shorter than its stated length. After any failure the connection is out
// of step and must be dropped.
//
// Received values merge into what the target already holds: a map keeps
// members the stream does not mention, an array gets the new elements
// appended. Receive into a fresh PObject for a clean result.
//
// A received binary (file transfer) is stored in the target's own file when
// the caller named one: with offset 0 the file is re-created; with a
// non-zero offset the new bytes follow the offset (the file is first cut to
// the offset when its recorded length differs), so an interrupted transfer
// can be resumed. A target without a path gets a temporary name inside the
// receive folder the caller set; without one the binary is refused (-4) and
// nothing is written anywhere, which is what a peer's answer to a command
// gets.
//
// A received message may hold at most the size bound (64 MiB by default) in
// memory, counted as its strings' bytes plus a fixed charge for each value;
// a larger one is refused (-4) before anything beyond the bound is
// allocated. The contents of received files go to disk and do not count.
//
// Threading: one stream serves one exchange on one thread; GetStatus,
// GetHistory and DumpHistory may be called from another thread meanwhile.
#ifndef PLOVO_IPC_STREAM_H
#define PLOVO_IPC_STREAM_H

#include <cstdint>
#include <cstdio>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "ipc/channel.h"
#include "ipc/pobject.h"

class PStream {
 public:
  // Wire tags.
  static constexpr uint8_t TAG_NULL = 0x00;
  static constexpr uint8_t TAG_INTEGER = 0x01;
  static constexpr uint8_t TAG_STRING = 0x10;
  static constexpr uint8_t TAG_BINARY = 0x30;
  static constexpr uint8_t TAG_END = 0x40;
  static constexpr uint8_t TAG_ARRAY = 0x41;
  static constexpr uint8_t TAG_MAP = 0x42;

  // Containers nested deeper than this are refused on receipt, so that a
  // broken or hostile peer cannot exhaust the caller's stack.
  static constexpr uint64_t kMaxDepth = 64;
  // Block size of binary transfers, the channel capacity of the endpoints.
  static constexpr uint64_t kBlockSize = 81920;
  // Texts up to this length are received through a buffer on the stack.
  static constexpr unsigned short kShortString = 256;
  // The default size bound of a received message, and what each received
  // value counts towards it besides its string bytes (about what a value
  // costs in memory, so that a message of many tiny values cannot grow the
  // process far beyond its wire size).
  static constexpr uint64_t kMaxMessageSize = 64ull << 20;
  static constexpr uint64_t kValueCharge = 64;

  PStream() = default;
  PStream(const PStream&) = delete;
  PStream& operator=(const PStream&) = delete;

  static void GetVersion(int& major, int& minor, int& patch);

  // Writes value and flushes the channel. On failure the key path of the
  // value that failed is logged ("Error stack: a.b").
  int Send(Channel& ch, const PObject& value);
  // Reads one value into target (merging, see above).
  int Recv(Channel& ch, PObject& target);

  // Folder for received binaries that name no file; empty (the default)
  // refuses them.
  void SetDefaultRecvLocation(const std::string& dir) { m_recv_location = dir; }
  // The size bound of each received message (see above).
  void SetMaxMessageSize(uint64_t bytes) { m_max_size = bytes; }

  // The key path being sent, joined with ".", and the progress of the
  // binary transfer under way (bytes done, bytes total).
  void GetStatus(std::string& history, uint64_t& done, uint64_t& total);
  void DumpHistory();
  std::string GetHistory();
  void ClearHistory();
  void UpdateStatus(uint64_t done, uint64_t total);
  // Unknown tags cannot be skipped: always -5.
  int Skip(Channel& ch, uint8_t tag);

  // The wire tag and the PObject kind of each payload type.
  template <typename T>
  static uint8_t GetTag();
  template <typename T>
  static uint32_t GetType() {
    return PObject::type_trait<T>::value;
  }

 private:
  int SendObject(Channel& ch, const PObject& value);
  int SendNull(Channel& ch);
  int Send(Channel& ch, std::string_view text);
  int Send(Channel& ch, uint64_t number);
  int Send(Channel& ch, const PObject::binary_type& binary);
  int Send(Channel& ch, const PObject::map_type& map);
  int Send(Channel& ch, const PObject::array_type& array);

  // Refuses a value that is not sendable, before any byte is written.
  int CheckSendable(const PObject& value, uint64_t depth);

  int RecvObject(Channel& ch, PObject& target);
  // Counts bytes of the message being received against the size bound.
  bool Charge(uint64_t bytes);
  int RecvTag(Channel& ch, uint8_t& tag);
  int RecvDispatch(Channel& ch, uint8_t tag, PObject& target);
  int Recv(Channel& ch, std::string& text);
  int Recv(Channel& ch, uint64_t& number);
  int Recv(Channel& ch, PObject::binary_type& binary);
  // Copies length bytes from the channel into file, counting them in stored.
  int StoreBinary(Channel& ch, FILE* file, const std::string& path, uint64_t length, uint64_t& stored);
  int Recv(Channel& ch, PObject::map_type& map);
  int Recv(Channel& ch, PObject::array_type& array);

  // The stack holds views of the keys inside the value being sent or
  // received, which outlives the exchange; it is emptied before Send and
  // Recv return. A container pushes one slot and sets it to each key in
  // turn, so that a key costs one lock, not two.
  void PushHistory();
  void SetHistoryTop(std::string_view key);
  void PopHistory();
  void PrependHistory(std::string_view key);
  std::string JoinHistory() const;  // caller holds m_mutex
  std::string Indent() const;
  bool TooDeep() const;

  std::vector<std::string_view> m_history;
  uint64_t m_done = 0;
  uint64_t m_total = 0;
  std::mutex m_mutex;
  uint64_t m_depth = 0;
  std::string m_recv_location;
  uint64_t m_max_size = kMaxMessageSize;
  uint64_t m_used = 0;  // of the message being received
  // Whether the per-value debug trace is written; decided once per message.
  bool m_trace = false;
};

template <> inline uint8_t PStream::GetTag<std::string>() { return TAG_STRING; }
template <> inline uint8_t PStream::GetTag<uint64_t>() { return TAG_INTEGER; }
template <> inline uint8_t PStream::GetTag<PObject::binary_type>() { return TAG_BINARY; }
template <> inline uint8_t PStream::GetTag<PObject::map_type>() { return TAG_MAP; }
template <> inline uint8_t PStream::GetTag<PObject::array_type>() { return TAG_ARRAY; }

#endif
