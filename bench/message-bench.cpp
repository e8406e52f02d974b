// One large answer, {"tasks": [100 maps of 28 keys]}, sent with PStream
// through a Channel on one end of a socket pair and received into a fresh
// PObject from the other end, on one thread. Where msgpack-c is present the
// same message is packed from the same PObject and unpacked in memory, as
// the figure of a widely used binary encoding.
//
// Sending and receiving on one thread keeps the figure comparable with the
// in-memory peer: it is the cost of both ends added up, not of the slower
// end while the other runs on the second core. The socket buffers are
// enlarged so that the whole message fits before the receive starts.
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>

#include "bench-support.h"
#include "common/log.h"
#include "ipc/channel.h"
#include "ipc/pobject.h"
#include "ipc/stream.h"

#ifdef PLOVO_BENCH_HAVE_MSGPACK
#include <msgpack.hpp>
#endif

namespace {

constexpr int kTasks = 100;
constexpr int kSocketBuffer = 4 << 20;

// 28 keys of 10 to 25 characters; the first 14 hold small integers, the
// others strings of 10 to 40 bytes.
const char* const kKeys[28] = {
    "task_identifier",      "schedule_enabled",       "schedule_interval",     "retry_count_limit",
    "bandwidth_limit_kb",   "conflict_policy_code",   "filter_rule_count",     "last_result_code",
    "progress_percentage",  "files_transferred_count", "folders_created_count", "error_count_total",
    "priority_level",       "encryption_enabled_flag", "task_display_name",    "source_folder_path",
    "destination_folder",   "source_share_name",      "destination_share_name", "last_run_start_time",
    "last_run_finish_time", "next_scheduled_run",     "owner_account_name",    "status_description",
    "source_volume_uuid",   "destination_volume_uuid", "filter_rule_summary",  "notification_address",
};

PObject BuildMessage() {
  PObject message;
  PObject::array_type& tasks = message["tasks"].asArray();
  for (int t = 0; t < kTasks; ++t) {
    PObject task;
    for (int k = 0; k < 28; ++k) {
      if (k < 14) {
        task[kKeys[k]] = static_cast<unsigned int>((t * 37 + k * 11) % 1000);
        continue;
      }
      // Lengths cycle through 10..40 bytes.
      size_t length = 10 + static_cast<size_t>(t * 7 + k * 3) % 31;
      std::string value = "/volume1/" + std::string(kKeys[k]) + "_" + std::to_string(t) + "_";
      while (value.size() < length) value += static_cast<char>('a' + (value.size() + k) % 26);
      value.resize(length);
      task[kKeys[k]] = value;
    }
    tasks.push_back(std::move(task));
  }
  return message;
}

const PObject& Message() {
  static const PObject message = BuildMessage();
  return message;
}

bool SameAsSent(const PObject& got) {
  return got.toString() == Message().toString();
}

void BM_PStreamMessage(benchmark::State& state, bool traced) {
  int pair[2];
  if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) {
    state.SkipWithError("socketpair failed");
    return;
  }
  for (int fd : pair) {
    setsockopt(fd, SOL_SOCKET, SO_SNDBUF, &kSocketBuffer, sizeof(kSocketBuffer));
    setsockopt(fd, SOL_SOCKET, SO_RCVBUF, &kSocketBuffer, sizeof(kSocketBuffer));
  }
  Channel writer(PStream::kBlockSize);
  Channel reader(PStream::kBlockSize);
  if (writer.Open(pair[0], true) != 0 || reader.Open(pair[1], true) != 0) {
    state.SkipWithError("cannot adopt the socket pair");
    return;
  }
  // Should the message not fit in the socket after all, a send fails after
  // this long instead of the program hanging for the 60-second default.
  writer.SetTimeout(5);
  if (traced) Plovo::SetLogSink([](int, const std::string&) {});
  const PObject& message = Message();
  PStream sendStream;
  PStream recvStream;
  PObject last;
  for (auto _ : state) {
    PObject got;
    if (sendStream.Send(writer, message) != 0 || recvStream.Recv(reader, got) != 0) {
      state.SkipWithError("PStream exchange failed");
      break;
    }
    last.swap(got);
  }
  if (traced) Plovo::SetLogSink(nullptr);
  if (!state.error_occurred() && !SameAsSent(last)) state.SkipWithError("received message differs");
}

#ifdef PLOVO_BENCH_HAVE_MSGPACK

void Pack(msgpack::packer<msgpack::sbuffer>& packer, const PObject& value) {
  if (value.isMap()) {
    const PObject::map_type& map = value.asMap();
    packer.pack_map(static_cast<uint32_t>(map.size()));
    for (const auto& [key, member] : map) {
      packer.pack(key);
      Pack(packer, member);
    }
  } else if (value.isArray()) {
    const PObject::array_type& array = value.asArray();
    packer.pack_array(static_cast<uint32_t>(array.size()));
    for (const PObject& element : array) Pack(packer, element);
  } else if (value.isInteger()) {
    packer.pack_uint64(value.asUInt64());
  } else if (value.isString()) {
    packer.pack(value.asString());
  } else {
    packer.pack_nil();
  }
}

// Checks the unpacked message: 100 maps of 28 members under "tasks".
bool UnpackedShapeOk(const msgpack::object& root) {
  if (root.type != msgpack::type::MAP || root.via.map.size != 1) return false;
  const msgpack::object& tasks = root.via.map.ptr[0].val;
  if (tasks.type != msgpack::type::ARRAY || tasks.via.array.size != kTasks) return false;
  for (uint32_t i = 0; i < tasks.via.array.size; ++i) {
    const msgpack::object& task = tasks.via.array.ptr[i];
    if (task.type != msgpack::type::MAP || task.via.map.size != 28) return false;
  }
  return true;
}

// Builds the PObject tree PStream's receiver builds, from an unpacked
// message, so that the cost of the tree itself can be told apart from the
// cost of the wire format.
void ToPObject(const msgpack::object& from, PObject& to) {
  switch (from.type) {
    case msgpack::type::MAP:
      for (uint32_t i = 0; i < from.via.map.size; ++i) {
        const msgpack::object_kv& kv = from.via.map.ptr[i];
        ToPObject(kv.val, to[std::string(kv.key.via.str.ptr, kv.key.via.str.size)]);
      }
      break;
    case msgpack::type::ARRAY: {
      PObject::array_type& array = to.asArray();
      for (uint32_t i = 0; i < from.via.array.size; ++i) {
        array.emplace_back();
        ToPObject(from.via.array.ptr[i], array.back());
      }
      break;
    }
    case msgpack::type::STR:
      to = std::string(from.via.str.ptr, from.via.str.size);
      break;
    case msgpack::type::POSITIVE_INTEGER:
      to = static_cast<unsigned long>(from.via.u64);
      break;
    default:
      to.clear();
  }
}

void BM_MsgpackMessage(benchmark::State& state) {
  const PObject& message = Message();
  msgpack::sbuffer buffer;
  msgpack::object_handle last;
  for (auto _ : state) {
    buffer.clear();
    msgpack::packer<msgpack::sbuffer> packer(buffer);
    Pack(packer, message);
    msgpack::object_handle handle = msgpack::unpack(buffer.data(), buffer.size());
    benchmark::DoNotOptimize(handle.get());
    last = std::move(handle);
  }
  state.counters["bytes"] = static_cast<double>(buffer.size());
  if (!UnpackedShapeOk(last.get())) state.SkipWithError("unpacked message differs");
}

// The same, and the received tree built and released as PStream does it.
void BM_MsgpackMessageToPObject(benchmark::State& state) {
  const PObject& message = Message();
  msgpack::sbuffer buffer;
  PObject last;
  for (auto _ : state) {
    buffer.clear();
    msgpack::packer<msgpack::sbuffer> packer(buffer);
    Pack(packer, message);
    msgpack::object_handle handle = msgpack::unpack(buffer.data(), buffer.size());
    PObject got;
    ToPObject(handle.get(), got);
    last.swap(got);
  }
  if (!SameAsSent(last)) state.SkipWithError("converted message differs");
}

#endif

void Register(benchmark::internal::Benchmark* b, int repetitions) {
  b->Repetitions(repetitions)->ReportAggregatesOnly(true)->UseRealTime()->Unit(benchmark::kMicrosecond);
}

// The bytes one message takes on the wire, as PStream writes them.
long WireSize() {
  int pair[2];
  if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) return -1;
  setsockopt(pair[0], SOL_SOCKET, SO_SNDBUF, &kSocketBuffer, sizeof(kSocketBuffer));
  Channel writer(PStream::kBlockSize);
  writer.Open(pair[0], true);
  writer.SetTimeout(5);
  PStream stream;
  long total = stream.Send(writer, Message()) == 0 ? 0 : -1;
  char buffer[65536];
  for (ssize_t n; total >= 0 && (n = recv(pair[1], buffer, sizeof(buffer), MSG_DONTWAIT)) > 0;) total += n;
  close(pair[1]);
  return total;
}

}  // namespace

int main(int argc, char** argv) {
  plovo_bench::UseServerLogMask();
  plovo_bench::Sandbox sandbox;
  std::printf("message-bench: %d tasks of 28 keys, %ld bytes on the wire\n", kTasks, WireSize());
  std::fflush(stdout);

  Register(benchmark::RegisterBenchmark("pstream_message", BM_PStreamMessage, false), 7);
  Register(benchmark::RegisterBenchmark("pstream_message_debug_traced", BM_PStreamMessage, true), 3);
#ifdef PLOVO_BENCH_HAVE_MSGPACK
  Register(benchmark::RegisterBenchmark("msgpack_message", BM_MsgpackMessage), 7);
  Register(benchmark::RegisterBenchmark("msgpack_message_to_pobject", BM_MsgpackMessageToPObject), 5);
#endif
  plovo_bench::SummaryReporter reporter;
  plovo_bench::RunBenchmarks(argc, argv, reporter);

  auto subject = reporter.MedianSeconds("pstream_message");
  if (!subject) {
    std::printf("summary message: incomplete, no figure\n");
    return 1;
  }
  std::printf("summary message: pstream_message %.0f messages/s", 1.0 / *subject);
  if (auto traced = reporter.MedianSeconds("pstream_message_debug_traced")) {
    std::printf(", with the debug trace formatted %.0f messages/s", 1.0 / *traced);
  }
#ifdef PLOVO_BENCH_HAVE_MSGPACK
  if (auto peer = reporter.MedianSeconds("msgpack_message")) {
    double ratio = *peer / *subject;
    std::printf(", msgpack_message %.0f messages/s, ratio %.2f (target >= 0.5: %s)", 1.0 / *peer, ratio,
                plovo_bench::Verdict(ratio >= 0.5));
    if (auto tree = reporter.MedianSeconds("msgpack_message_to_pobject")) {
      std::printf("; msgpack with the PObject tree built %.0f messages/s", 1.0 / *tree);
    }
    std::printf("\n");
    return 0;
  }
#endif
  std::printf(", no msgpack-c figure (msgpack-c not built in)\n");
  return 0;
}
