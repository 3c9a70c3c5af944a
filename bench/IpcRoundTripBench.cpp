// Request/reply round trips over zerith_ipc (a real SocketConnection pair:
// the caller's callAndWait() -> frame -> the answering connection's queue -> an
// exported object that replies with the same arguments -> frame -> the
// caller's reply handler) beside a bare Unix-socket echo of frames of the
// same size (write length + bytes, read them back), in the same run.
//
// Reported per size: round trips per second (items_per_second) and the
// p50/p99 latency in microseconds. Frame sizes are the encoded call frames
// of a payload of 64 B, 1 KiB and 16 KiB. BM_FrameEncodeDecode gives the
// codec's share (a round trip encodes and decodes two frames).

#include <benchmark/benchmark.h>
#include <plist/plist.h>
#include <sys/socket.h>

#include <algorithm>
#include <condition_variable>
#include <mutex>
#include <thread>
#include <vector>

#include "bench/BenchSocket.h"
#include "bench/pipeline/BenchEvent.h"
#include "ipc/Frame.h"
#include "ipc/SocketConnection.h"

using namespace zerith;
using namespace zerith::ipc;

namespace {

using Clock = std::chrono::steady_clock;

Dictionary argsOfSize(std::size_t payload) { return Dictionary{{"payload", Value(Data(payload, 0x42))}}; }

void reportLatencies(benchmark::State& state, std::vector<double>& micros, std::size_t frameBytes) {
  if (micros.empty()) {
    return;
  }
  std::sort(micros.begin(), micros.end());
  state.counters["p50_us"] = micros[micros.size() / 2];
  state.counters["p99_us"] = micros[std::min(micros.size() - 1, micros.size() * 99 / 100)];
  state.counters["frame_bytes"] = static_cast<double>(frameBytes);
  state.SetItemsProcessed(static_cast<std::int64_t>(micros.size()));
}

class Echo : public ExportedObject {
 public:
  void handleMessage(const Message& message, std::shared_ptr<Reply> reply) override { reply->send(message.args); }
  bool answersWithoutWaiting(const Message&) const override { return true; }
};

void BM_IpcRoundTrip(benchmark::State& state) {
  int fds[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) {
    state.SkipWithError("socketpair failed");
    return;
  }
  const PeerCredentials peer = *readPeerCredentials(fds[0]);
  auto caller = SocketConnection::adopt(file::UniqueFd(fds[0]), peer, Dictionary());
  auto answerer = SocketConnection::adopt(file::UniqueFd(fds[1]), peer, Dictionary());
  answerer->setExportedObject(std::make_shared<Echo>());
  caller->resume();
  answerer->resume();

  const Dictionary args = argsOfSize(static_cast<std::size_t>(state.range(0)));
  const std::size_t frameBytes = encodeCall("echo", 1, args).size();
  std::vector<double> micros;
  micros.reserve(1 << 16);

  for (auto _ : state) {
    const auto start = Clock::now();
    // As a client's synchronous call does.
    const auto reply = caller->callAndWait("echo", args, std::chrono::seconds(10));
    if (!reply.args) {
      state.SkipWithError("call failed");
      break;
    }
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  reportLatencies(state, micros, frameBytes);
  caller->invalidate();
  answerer->invalidate();
}

bool writeAll(int fd, const std::uint8_t* p, std::size_t n) {
  while (n > 0) {
    const ssize_t w = ::send(fd, p, n, MSG_NOSIGNAL);
    if (w <= 0) {
      return false;
    }
    p += w;
    n -= static_cast<std::size_t>(w);
  }
  return true;
}

bool readAll(int fd, std::uint8_t* p, std::size_t n) {
  while (n > 0) {
    const ssize_t r = ::recv(fd, p, n, 0);
    if (r <= 0) {
      return false;
    }
    p += r;
    n -= static_cast<std::size_t>(r);
  }
  return true;
}

// Reads one length-prefixed frame into `buffer`; false at the end.
bool readFrame(int fd, std::vector<std::uint8_t>& buffer) {
  std::uint8_t header[4];
  if (!readAll(fd, header, 4)) {
    return false;
  }
  const std::size_t n = (std::size_t{header[0]} << 24) | (std::size_t{header[1]} << 16) | (std::size_t{header[2]} << 8) | header[3];
  buffer.resize(4 + n);
  std::copy(header, header + 4, buffer.begin());
  return readAll(fd, buffer.data() + 4, n);
}

void BM_BareUnixEcho(benchmark::State& state) {
  file::UniqueFd near;
  file::UniqueFd far;
  if (!bench::socketPair(state, near, far)) {
    return;
  }
  std::thread echo([fd = far.get()] {
    std::vector<std::uint8_t> buffer;
    while (readFrame(fd, buffer) && writeAll(fd, buffer.data(), buffer.size())) {
    }
  });
  // The very frame the IPC benchmark sends, so both move the same bytes.
  const Data frame = encodeCall("echo", 1, argsOfSize(static_cast<std::size_t>(state.range(0))));
  std::vector<std::uint8_t> back;
  std::vector<double> micros;
  micros.reserve(1 << 16);
  for (auto _ : state) {
    const auto start = Clock::now();
    if (!writeAll(near.get(), frame.data(), frame.size()) || !readFrame(near.get(), back)) {
      state.SkipWithError("echo failed");
      break;
    }
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  reportLatencies(state, micros, frame.size());
  ::shutdown(near.get(), SHUT_RDWR);
  echo.join();
}

// The codec's share of a round trip: one call frame encoded and decoded
// (structural check, libplist, conversion to Value), on one thread.
void BM_FrameEncodeDecode(benchmark::State& state) {
  const Dictionary args = argsOfSize(static_cast<std::size_t>(state.range(0)));
  for (auto _ : state) {
    const Data frame = encodeCall("echo", 1, args);
    auto message = decodeMessage(plist::Bytes(frame.data() + kFrameHeaderBytes, frame.size() - kFrameHeaderBytes));
    benchmark::DoNotOptimize(message);
  }
  state.SetItemsProcessed(state.iterations());
}

// The call frame of one event as the client framework sends it: the
// end-to-end benchmark's ten-key event.
Data eventCallFrame() {
  const Dictionary message{{"category", Value(static_cast<long long>(bench::kEventCategory))},
                           {"type", Value(static_cast<long long>(bench::kEventType))},
                           {"payload", bench::eventPayload(12345)}};
  return encodeCall("sendMessageWithDictionary:reply:", 77, Dictionary{{"message", Value(message)}});
}

// libplist alone: the event's frame body parsed into libplist's tree and
// freed, without the structural check or the value tree (the share of a
// frame's decode that the library itself takes).
void BM_ReferenceLibplistParseOfAnEvent(benchmark::State& state) {
  const Data frame = eventCallFrame();
  const char* body = reinterpret_cast<const char*>(frame.data() + kFrameHeaderBytes);
  const auto length = static_cast<std::uint32_t>(frame.size() - kFrameHeaderBytes);
  for (auto _ : state) {
    plist_t tree = nullptr;
    plist_from_bin(body, length, &tree);
    benchmark::DoNotOptimize(tree);
    plist_free(tree);
  }
  state.SetItemsProcessed(state.iterations());
}

// The daemon's side of the same frame: decoded only (structural check,
// libplist, value tree).
void BM_FrameDecodeOfAnEvent(benchmark::State& state) {
  const Data frame = eventCallFrame();
  for (auto _ : state) {
    auto message = decodeMessage(plist::Bytes(frame.data() + kFrameHeaderBytes, frame.size() - kFrameHeaderBytes));
    benchmark::DoNotOptimize(message);
  }
  state.SetItemsProcessed(state.iterations());
}

// The reply of an accepted event (no arguments): as the daemon writes it,
// beside the same reply written by libplist (the reference).
void BM_EmptyReply(benchmark::State& state) {
  std::uint64_t call = 1;
  for (auto _ : state) {
    const Data frame = encodeReply(++call, Dictionary{});
    benchmark::DoNotOptimize(frame.data());
  }
  state.SetItemsProcessed(state.iterations());
}

void BM_EmptyReplyByLibplist(benchmark::State& state) {
  std::uint64_t call = 1;
  for (auto _ : state) {
    const Data frame =
        encodeFrame(Value(Dictionary{{"reply", Value(static_cast<long long>(++call))}, {"args", Dictionary{}}}));
    benchmark::DoNotOptimize(frame.data());
  }
  state.SetItemsProcessed(state.iterations());
}

}  // namespace

BENCHMARK(BM_EmptyReply)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_EmptyReplyByLibplist)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_FrameDecodeOfAnEvent)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_ReferenceLibplistParseOfAnEvent)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_FrameEncodeDecode)->Arg(64)->Arg(1024)->Arg(16384)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_IpcRoundTrip)->Arg(64)->Arg(1024)->Arg(16384)->UseRealTime()->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_BareUnixEcho)->Arg(64)->Arg(1024)->Arg(16384)->UseRealTime()->Unit(benchmark::kMicrosecond);

BENCHMARK_MAIN();
