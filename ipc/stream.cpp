#include "ipc/stream.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>

#include "common/error-text.h"
#include "common/log.h"
#include "common/tmp-name.h"
#include "ipc/error-code.h"

namespace {

constexpr uint64_t kProgressStep = 104857600;  // 100 MiB between progress lines
constexpr size_t kMaxIndent = 11;              // levels of debug indentation
constexpr size_t kMaxString = 65535;           // what a 16-bit length can say

struct FileCloser {
  void operator()(FILE* f) const {
    if (f != nullptr) fclose(f);
  }
};
using File = std::unique_ptr<FILE, FileCloser>;

// The receiver's mapping of a failed write to its file.
int StoreError(int error) { return error == ENOSPC ? P_ERR_INVALID_ARGUMENT : P_ERR_INTERRUPTED; }

// Every channel failure ends the value with -2, after naming the channel's
// own code.
int ChannelFailure(int code) {
  PLOVO_LIB_ERR("Channel: %d", code);
  return P_ERR_IO;
}

}  // namespace

void PStream::GetVersion(int& major, int& minor, int& patch) {
  major = 1;
  minor = 0;
  patch = 0;
}

// ---- error stack and progress ------------------------------------------------

void PStream::PushHistory() {
  std::lock_guard<std::mutex> lock(m_mutex);
  m_history.emplace_back();
}

void PStream::SetHistoryTop(std::string_view key) {
  std::lock_guard<std::mutex> lock(m_mutex);
  m_history.back() = key;
}

void PStream::PrependHistory(std::string_view key) {
  std::lock_guard<std::mutex> lock(m_mutex);
  m_history.insert(m_history.begin(), key);
}

void PStream::PopHistory() {
  std::lock_guard<std::mutex> lock(m_mutex);
  if (!m_history.empty()) m_history.pop_back();
}

std::string PStream::JoinHistory() const {
  std::string joined;
  for (std::string_view key : m_history) {
    if (key.data() == nullptr) continue;  // a container that had no key yet
    if (!joined.empty()) joined += '.';
    joined += key;
  }
  return joined;
}

void PStream::GetStatus(std::string& history, uint64_t& done, uint64_t& total) {
  std::lock_guard<std::mutex> lock(m_mutex);
  history = JoinHistory();
  done = m_done;
  total = m_total;
}

void PStream::DumpHistory() {
  std::lock_guard<std::mutex> lock(m_mutex);
  PLOVO_LIB_ERR("Error stack: %s", JoinHistory().c_str());
}

std::string PStream::GetHistory() {
  std::lock_guard<std::mutex> lock(m_mutex);
  return JoinHistory();
}

void PStream::ClearHistory() {
  std::lock_guard<std::mutex> lock(m_mutex);
  m_history.clear();
}

// Records the progress of the binary transfer under way for GetStatus.
void PStream::UpdateStatus(uint64_t done, uint64_t total) {
  std::lock_guard<std::mutex> lock(m_mutex);
  m_done = done;
  m_total = total;
}

int PStream::Skip(Channel&, uint8_t) { return P_ERR_MALFORMED; }

std::string PStream::Indent() const { return std::string(2 * std::min<uint64_t>(m_depth, kMaxIndent), ' '); }

// ---- sending -----------------------------------------------------------------

int PStream::Send(Channel& ch, const PObject& value) {
  m_trace = Plovo::LogWillWrite(LOG_DEBUG);
  int ret = CheckSendable(value, 0);
  if (ret == 0) ret = SendObject(ch, value);
  if (ret == 0) {
    int flushed = ch.FlushWrite(0);
    if (flushed != 0) {
      PLOVO_LIB_ERR("Channel: %d", flushed);
      ret = P_ERR_IO;
    }
  } else {
    DumpHistory();
    // What a failed value left in the buffer must not go out when the
    // channel closes: the peer would take a cut message for a whole one.
    ch.ClearWrite();
  }
  ClearHistory();
  return ret;
}

// Everything that can make a value unsendable without the peer's doing is
// found here, so that a refused value puts no byte on the wire. The key
// path of the offending value is left on the stack for DumpHistory.
int PStream::CheckSendable(const PObject& value, uint64_t depth) {
  if (value.isString()) {
    // A longer string cannot state its length in 16 bits; the peer would
    // read the rest of it as values.
    if (value.asStringRef().size() > kMaxString) {
      PLOVO_LIB_ERR("PStream: string of %zu bytes exceeds %zu", value.asStringRef().size(), kMaxString);
      return P_ERR_INVALID_ARGUMENT;
    }
    return 0;
  }
  if (value.isBinary()) {
    const PObject::binary_type& binary = value.asBinary();
    struct stat st;
    if (stat(binary.path.c_str(), &st) != 0) {
      PLOVO_LIB_ERR("fopen(%s) error", binary.path.c_str());
      return P_ERR_INTERRUPTED;
    }
    if (S_ISREG(st.st_mode) && static_cast<uint64_t>(st.st_size) < binary.offset + binary.length) {
      PLOVO_LIB_ERR("file length is incorrect.");
      return P_ERR_MALFORMED;
    }
    return 0;
  }
  if (value.isBuffer()) {
    PLOVO_LIB_ERR("PStream: type %s has no wire form", "buffer");
    return P_ERR_INTERRUPTED;
  }
  if (!value.isMap() && !value.isArray()) return 0;
  // The peer refuses deeper nesting, and this walk must not recurse
  // without bound either.
  if (depth >= kMaxDepth) {
    PLOVO_LIB_ERR("PStream: containers nested deeper than %lu", static_cast<unsigned long>(kMaxDepth));
    return P_ERR_MALFORMED;
  }
  if (value.isArray()) {
    for (const PObject& element : value.asArray()) {
      if (int r = CheckSendable(element, depth + 1); r != 0) return r;
    }
    return 0;
  }
  for (const auto& [key, member] : value.asMap()) {
    std::string_view wireKey = key;
    if (!wireKey.empty() && wireKey[0] == '_') wireKey.remove_prefix(1);
    int r = 0;
    if (wireKey.size() > kMaxString) {
      PLOVO_LIB_ERR("PStream: key of %zu bytes exceeds %zu", wireKey.size(), kMaxString);
      r = P_ERR_INVALID_ARGUMENT;
    } else {
      r = CheckSendable(member, depth + 1);
    }
    if (r != 0) {
      // The path is built on the way out, from the failing key up, so that
      // a value that passes costs no lock per key.
      PrependHistory(wireKey);
      return r;
    }
  }
  return 0;
}

int PStream::SendObject(Channel& ch, const PObject& value) {
  if (value.isNull()) return SendNull(ch);
  if (value.isInteger()) return Send(ch, value.asUInt64());
  if (value.isString()) return Send(ch, std::string_view(value.asStringRef()));
  if (value.isMap()) return Send(ch, value.asMap());
  if (value.isArray()) return Send(ch, value.asArray());
  if (value.isBinary()) return Send(ch, value.asBinary());
  PLOVO_LIB_ERR("PStream: type %s has no wire form", value.isBuffer() ? "buffer" : "unknown");
  return P_ERR_INTERRUPTED;
}

int PStream::SendNull(Channel& ch) {
  static const char kNull[2] = {TAG_NULL, 0};
  int r = ch.Write(kNull, sizeof(kNull));
  return r == 0 ? 0 : ChannelFailure(r);
}

int PStream::Send(Channel& ch, uint64_t number) {
  unsigned char bytes[10];
  unsigned width = number <= 0xFF ? 1 : number <= 0xFFFF ? 2 : number <= 0xFFFFFFFFull ? 4 : 8;
  bytes[0] = TAG_INTEGER;
  bytes[1] = static_cast<unsigned char>(width);
  for (unsigned i = 0; i < width; ++i) bytes[2 + i] = static_cast<unsigned char>(number >> (8 * (width - 1 - i)));
  if (int r = ch.Write(reinterpret_cast<const char*>(bytes), 2 + width); r != 0) return ChannelFailure(r);
  if (m_trace) PLOVO_LIB_DBG("%s%lu", Indent().c_str(), static_cast<unsigned long>(number));
  return 0;
}

int PStream::Send(Channel& ch, std::string_view text) {
  // CheckSendable has refused longer strings.
  unsigned char head[3] = {TAG_STRING, static_cast<unsigned char>(text.size() >> 8),
                           static_cast<unsigned char>(text.size())};
  if (int r = ch.Write(reinterpret_cast<const char*>(head), sizeof(head)); r != 0) return ChannelFailure(r);
  // A string may be longer than the channel's block; write it in blocks.
  const size_t block = std::min<size_t>(kBlockSize, ch.Capacity());
  for (size_t at = 0; at < text.size(); at += block) {
    size_t n = std::min(text.size() - at, block);
    if (int r = ch.Write(text.data() + at, n); r != 0) return ChannelFailure(r);
  }
  if (m_trace) PLOVO_LIB_DBG("%s\"%.*s\"", Indent().c_str(), static_cast<int>(text.size()), text.data());
  return 0;
}

int PStream::Send(Channel& ch, const PObject::map_type& map) {
  if (int r = ch.WriteByte(TAG_MAP); r != 0) return ChannelFailure(r);
  if (m_trace) PLOVO_LIB_DBG("%s{", Indent().c_str());
  ++m_depth;
  PushHistory();
  for (const auto& [key, value] : map) {
    // One leading underscore marks a key that the peer knows without it.
    std::string_view wireKey = key;
    if (!wireKey.empty() && wireKey[0] == '_') wireKey.remove_prefix(1);
    SetHistoryTop(wireKey);
    int ret = Send(ch, wireKey);
    if (ret == 0) ret = SendObject(ch, value);
    if (ret != 0) {  // the failing key stays on the stack for DumpHistory
      --m_depth;
      return ret;
    }
  }
  PopHistory();
  --m_depth;
  if (int r = ch.WriteByte(TAG_END); r != 0) return ChannelFailure(r);
  if (m_trace) PLOVO_LIB_DBG("%s}", Indent().c_str());
  return 0;
}

int PStream::Send(Channel& ch, const PObject::array_type& array) {
  if (int r = ch.WriteByte(TAG_ARRAY); r != 0) return ChannelFailure(r);
  if (m_trace) PLOVO_LIB_DBG("%s[", Indent().c_str());
  ++m_depth;
  for (const PObject& element : array) {
    int ret = SendObject(ch, element);
    if (ret != 0) {
      --m_depth;
      return ret;
    }
  }
  --m_depth;
  if (int r = ch.WriteByte(TAG_END); r != 0) return ChannelFailure(r);
  if (m_trace) PLOVO_LIB_DBG("%s]", Indent().c_str());
  return 0;
}

int PStream::Send(Channel& ch, const PObject::binary_type& binary) {
  int header = ch.WriteByte(TAG_BINARY);
  if (header == 0) header = ch.WriteInt64(binary.length);
  if (header != 0) return ChannelFailure(header);
  std::unique_ptr<char[]> buffer(new (std::nothrow) char[kBlockSize]);
  if (!buffer) {
    PLOVO_LIB_ERR("malloc error");
    return P_ERR_INTERRUPTED;
  }
  File file(fopen(binary.path.c_str(), "rb"));
  if (!file) {
    PLOVO_LIB_ERR("fopen(%s) error", binary.path.c_str());
    return P_ERR_INTERRUPTED;
  }
  setvbuf(file.get(), nullptr, _IONBF, 0);  // whole blocks; stdio's buffer would split them
  if (fseeko(file.get(), static_cast<off_t>(binary.offset), SEEK_SET) != 0) {
    PLOVO_LIB_ERR("fseek error");
    return P_ERR_INTERRUPTED;
  }
  const uint64_t block = std::min<uint64_t>(kBlockSize, ch.Capacity());
  uint64_t sent = 0;
  UpdateStatus(0, binary.length);
  while (sent < binary.length) {
    size_t want = static_cast<size_t>(std::min(binary.length - sent, block));
    size_t got = fread(buffer.get(), 1, want, file.get());
    if (got == 0) {
      if (ferror(file.get())) {
        PLOVO_LIB_ERR("fread error");
        return P_ERR_INTERRUPTED;
      }
      break;  // the file ended early
    }
    if (int r = ch.Write(buffer.get(), got); r != 0) return ChannelFailure(r);
    sent += got;
    UpdateStatus(sent, binary.length);
    if (sent % kProgressStep == 0) {
      PLOVO_LIB_INFO("sending %s ... (%lu / %lu)", binary.path.c_str(), static_cast<unsigned long>(sent),
                     static_cast<unsigned long>(binary.length));
    }
  }
  if (sent < binary.length) {
    PLOVO_LIB_ERR("file length is incorrect.");
    return P_ERR_MALFORMED;
  }
  if (m_trace) PLOVO_LIB_DBG("%sbinary, %lu bytes", Indent().c_str(), static_cast<unsigned long>(binary.length));
  return 0;
}

// ---- receiving ---------------------------------------------------------------

int PStream::Recv(Channel& ch, PObject& target) {
  m_trace = Plovo::LogWillWrite(LOG_DEBUG);
  m_depth = 0;
  m_used = 0;
  int ret = RecvObject(ch, target);
  if (ret != 0) DumpHistory();
  ClearHistory();
  return ret;
}

int PStream::RecvTag(Channel& ch, uint8_t& tag) {
  int ret = ch.ReadByte(&tag);
  return ret == 0 ? 0 : ChannelFailure(ret);
}

int PStream::RecvObject(Channel& ch, PObject& target) {
  uint8_t tag = 0;
  int ret = RecvTag(ch, tag);
  return ret != 0 ? ret : RecvDispatch(ch, tag, target);
}

bool PStream::Charge(uint64_t bytes) {
  m_used += bytes;
  if (m_used <= m_max_size) return true;
  PLOVO_LIB_ERR("PStream: message exceeds %lu bytes", static_cast<unsigned long>(m_max_size));
  return false;
}

int PStream::RecvDispatch(Channel& ch, uint8_t tag, PObject& target) {
  if (!Charge(kValueCharge)) return P_ERR_INVALID_ARGUMENT;
  int ret;
  switch (tag) {
    case TAG_STRING: {
      std::string text;
      ret = Recv(ch, text);
      if (ret == 0) target = std::move(text);
      break;
    }
    case TAG_INTEGER: {
      uint64_t number = 0;
      ret = Recv(ch, number);
      if (ret == 0) target = static_cast<unsigned long>(number);
      break;
    }
    case TAG_MAP:
      ret = Recv(ch, target.asMap());
      break;
    case TAG_ARRAY:
      ret = Recv(ch, target.asArray());
      break;
    case TAG_BINARY:
      ret = Recv(ch, target.asBinary());
      break;
    case TAG_NULL: {
      uint8_t length = 0;
      if (int r = ch.ReadByte(&length); r != 0) return ChannelFailure(r);
      if (length != 0) {
        PLOVO_LIB_ERR("expect length 0, but we've got %u", length);
        return P_ERR_MALFORMED;
      }
      target.clear();
      return 0;
    }
    default:
      PLOVO_LIB_ERR("PStream: unknown tag %u", tag);
      return P_ERR_MALFORMED;
  }
  return ret > 0 ? 0 : ret;
}

int PStream::Recv(Channel& ch, uint64_t& number) {
  uint8_t width = 0;
  int ret = ch.ReadByte(&width);
  unsigned char bytes[255];
  if (ret == 0) ret = ch.Read(reinterpret_cast<char*>(bytes), width);
  if (ret != 0) return ChannelFailure(ret);
  number = 0;
  for (unsigned i = 0; i < width; ++i) number = (number << 8) | bytes[i];
  if (m_trace) PLOVO_LIB_DBG("%s%lu", Indent().c_str(), static_cast<unsigned long>(number));
  return 0;
}

int PStream::Recv(Channel& ch, std::string& text) {
  unsigned short length = 0;
  int ret = ch.ReadInt16(&length);
  if (ret == 0 && !Charge(length)) return P_ERR_INVALID_ARGUMENT;
  // The text ends at its first zero byte, as the peer's C strings do.
  if (ret == 0 && length <= kShortString) {
    // Most texts are keys and short values: read them on the stack and
    // build the string once, at its final length.
    char bytes[kShortString];
    ret = ch.Read(bytes, length);
    if (ret == 0) text.assign(bytes, strnlen(bytes, length));
  } else if (ret == 0) {
    text.resize(length);
    // Read in blocks: a channel reads at most its capacity at a time.
    for (size_t at = 0; ret == 0 && at < length; at += kBlockSize) {
      ret = ch.Read(&text[at], std::min<size_t>(length - at, kBlockSize));
    }
    if (ret == 0) text.resize(strnlen(text.c_str(), length));
  }
  if (ret != 0) return ChannelFailure(ret);
  if (m_trace) PLOVO_LIB_DBG("%s\"%s\"", Indent().c_str(), text.c_str());
  return 0;
}

// Refuses one more container level past the limit, so that a hostile peer
// cannot exhaust the caller's stack.
bool PStream::TooDeep() const {
  if (m_depth < kMaxDepth) return false;
  PLOVO_LIB_ERR("PStream: containers nested deeper than %lu", static_cast<unsigned long>(kMaxDepth));
  return true;
}

int PStream::Recv(Channel& ch, PObject::map_type& map) {
  if (TooDeep()) return P_ERR_MALFORMED;
  if (m_trace) PLOVO_LIB_DBG("%s{", Indent().c_str());
  ++m_depth;
  int ret = 0;
  PushHistory();
  for (;;) {
    uint8_t tag = 0;
    ret = RecvTag(ch, tag);
    if (ret != 0) break;
    if (tag == TAG_END) break;
    if (tag != TAG_STRING) {
      PLOVO_LIB_ERR("PStream: expect string, but get tag %u", tag);
      ret = P_ERR_MALFORMED;
      break;
    }
    std::string key;
    ret = Recv(ch, key);
    if (ret != 0) break;
    // Keys arrive in the map's order, so a new key normally goes last; the
    // hint saves the search. A key already present is merged into.
    auto member = !map.empty() && map.rbegin()->first < key ? map.emplace_hint(map.end(), std::move(key), PObject())
                                                            : map.try_emplace(std::move(key)).first;
    SetHistoryTop(member->first);
    ret = RecvObject(ch, member->second);
    if (ret != 0) break;  // the key stays on the stack for DumpHistory
  }
  if (ret == 0) PopHistory();
  --m_depth;
  if (ret == 0 && m_trace) PLOVO_LIB_DBG("%s}", Indent().c_str());
  return ret;
}

int PStream::Recv(Channel& ch, PObject::array_type& array) {
  if (TooDeep()) return P_ERR_MALFORMED;
  if (m_trace) PLOVO_LIB_DBG("%s[", Indent().c_str());
  ++m_depth;
  int ret = 0;
  for (;;) {
    uint8_t tag = 0;
    ret = RecvTag(ch, tag);
    if (ret != 0 || tag == TAG_END) break;
    array.emplace_back();
    ret = RecvDispatch(ch, tag, array.back());
    if (ret != 0) break;
  }
  --m_depth;
  if (ret == 0 && m_trace) PLOVO_LIB_DBG("%s]", Indent().c_str());
  return ret;
}

namespace {

// Opens the file a received binary goes to: the target's own file (re-created
// at offset 0; cut to the offset and appended to when resuming), or a new
// temporary file in location when the target names none.
int OpenRecvFile(PObject::binary_type& binary, const std::string& location, File& file) {
  const char* mode = "wb";
  if (!binary.path.empty()) {
    PLOVO_LIB_INFO("store binary to %s, offset %lu", binary.path.c_str(), static_cast<unsigned long>(binary.offset));
    if (binary.offset != 0) {
      // Resume: whatever follows the offset is stale and is replaced.
      if (binary.length != binary.offset && truncate(binary.path.c_str(), static_cast<off_t>(binary.offset)) != 0) {
        int error = errno;
        PLOVO_LIB_ERR("truncate: %s (%d)", Plovo::ErrorText(error).c_str(), error);
        return P_ERR_INTERRUPTED;
      }
      mode = "ab";
    }
  } else {
    binary.path = TmpNameGen::getInstance().getTmpPath(location);
    binary.offset = 0;
    if (binary.path.empty()) return P_ERR_INTERRUPTED;
  }
  file.reset(fopen(binary.path.c_str(), mode));
  if (!file) {
    PLOVO_LIB_ERR("fopen(%s) error", binary.path.c_str());
    return P_ERR_INTERRUPTED;
  }
  setvbuf(file.get(), nullptr, _IONBF, 0);  // one write per block
  return 0;
}

}  // namespace

int PStream::Recv(Channel& ch, PObject::binary_type& binary) {
  // A file goes only where the caller said files may go; a target without
  // a file of its own and no receive folder has no such place.
  if (binary.path.empty() && m_recv_location.empty()) {
    PLOVO_LIB_ERR("PStream: a received file has no folder to go to");
    return P_ERR_INVALID_ARGUMENT;
  }
  unsigned long length = 0;
  uint64_t stored = 0;
  File file;
  int ret = ch.ReadInt64(&length);
  if (ret != 0) ret = ChannelFailure(ret);
  if (ret == 0) ret = OpenRecvFile(binary, m_recv_location, file);
  if (ret == 0) ret = StoreBinary(ch, file.get(), binary.path, length, stored);
  // In every outcome the target says how much of its file holds what was
  // sent, so that a later transfer can resume from there.
  binary.length = binary.offset + stored;
  if (ret == 0 && m_trace) {
    PLOVO_LIB_DBG("%sbinary has been stored at '%s' with length %lu", Indent().c_str(), binary.path.c_str(),
                  static_cast<unsigned long>(binary.length));
  }
  return ret;
}

int PStream::StoreBinary(Channel& ch, FILE* file, const std::string& path, uint64_t length, uint64_t& stored) {
  std::unique_ptr<char[]> buffer(new (std::nothrow) char[kBlockSize]);
  if (!buffer) {
    PLOVO_LIB_ERR("malloc error");
    return P_ERR_INTERRUPTED;
  }
  const uint64_t block = std::min<uint64_t>(kBlockSize, ch.Capacity());
  UpdateStatus(0, length);
  while (stored < length) {
    unsigned long got = 0;
    int read = ch.Read(buffer.get(), static_cast<unsigned long>(std::min(length - stored, block)), got);
    // Bytes that did arrive are kept, so that a resumed transfer need not
    // send them again.
    size_t written = got > 0 ? fwrite(buffer.get(), 1, got, file) : 0;
    stored += written;
    UpdateStatus(stored, length);
    if (written != got) {
      int error = errno;
      PLOVO_LIB_ERR("fwrite(%s): %s", path.c_str(), Plovo::ErrorText(error).c_str());
      return StoreError(error);
    }
    if (read != 0) return ChannelFailure(read);
    if (stored % kProgressStep == 0) {
      PLOVO_LIB_INFO("receiving %s ... (%lu / %lu)", path.c_str(), static_cast<unsigned long>(stored),
                     static_cast<unsigned long>(length));
    }
  }
  if (fflush(file) != 0) {
    int error = errno;
    PLOVO_LIB_ERR("fflush(%s): %s", path.c_str(), Plovo::ErrorText(error).c_str());
    return StoreError(error);
  }
  return 0;
}
