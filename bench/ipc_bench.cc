// Standard-output intake and line reading of one child against a plain
// string-and-memchr loop over the same bytes. Each packet is drained before
// the next arrives, as a reader keeping up would, so the unread-output cap
// never drops anything; the line count is checked.
//
// Ratios a script can compute from the bytes_per_second counters:
//   BM_StdoutReadLine/64 : BM_BaselineAppendMemchr/64   (target >= 0.5)
//   time of BM_StdoutReadLine/128 : BM_StdoutReadLine/64 (target 1.8 - 2.3)

#include <benchmark/benchmark.h>

#include <cstring>
#include <memory>
#include <string>

#include "Sorvik/ipc/client.h"
#include "Sorvik/ipc/packet.h"
#include "host/fake_host.h"

namespace {

using sorvik::testing::ChildScript;
using sorvik::testing::FakeHost;

constexpr size_t kLineLength = 80;  // 79 characters and a line feed
constexpr size_t kPayload = ko::ipc::kMaxPacketPayload;
static_assert(kPayload % kLineLength == 0, "every packet carries whole lines");
constexpr size_t kLinesPerPacket = kPayload / kLineLength;

size_t packetsFor(int64_t mebibytes) {
  return static_cast<size_t>(mebibytes) * 1024 * 1024 / ko::ipc::kMaxPacketSize;
}

std::string linePayload() {
  std::string payload;
  for (size_t i = 0; i < kLinesPerPacket; ++i) {
    for (size_t c = 0; c + 1 < kLineLength; ++c) payload.push_back(static_cast<char>('a' + (i + c) % 26));
    payload.push_back('\n');
  }
  return payload;
}

std::string stdoutPacket(uint32_t id, const std::string& payload) {
  std::string packet(ko::ipc::kPacketHeaderSize, '\0');
  ko::ipc::PacketHeader header;
  header.total_length = static_cast<uint32_t>(ko::ipc::kPacketHeaderSize + payload.size());
  header.id = id;
  header.type = static_cast<uint32_t>(ko::ipc::PacketType::StdoutData);
  encodePacketHeader(header, reinterpret_cast<unsigned char*>(&packet[0]));
  return packet + payload;
}

void BM_StdoutReadLine(benchmark::State& state) {
  FakeHost host;
  host.install();
  host.setScript("bench-child", ChildScript::runsUntilTold());
  const size_t packets = packetsFor(state.range(0));
  const std::string payload = linePayload();
  std::string line;
  line.reserve(kLineLength);

  for (auto _ : state) {
    state.PauseTiming();
    std::shared_ptr<ko::ipc::client> child = ko::ipc::spawn({"bench-child"});
    const std::string packet = stdoutPacket(child->id(), payload);
    const auto* bytes = reinterpret_cast<const unsigned char*>(packet.data());
    state.ResumeTiming();

    size_t lines = 0;
    for (size_t p = 0; p < packets; ++p) {
      ko::ipc::receive(bytes, packet.size());
      while (child->read_line(line, 0, 0)) ++lines;
    }
    benchmark::DoNotOptimize(line.data());

    state.PauseTiming();
    if (lines != packets * kLinesPerPacket || line.size() != kLineLength - 1) {
      state.SkipWithError("lines lost or damaged");
    }
    host.exitChild(child->id(), 0);
    child->wait();
    state.ResumeTiming();
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * packets * kPayload));
}
BENCHMARK(BM_StdoutReadLine)->Arg(64)->Arg(128)->Unit(benchmark::kMillisecond);

// The same bytes appended to one string, line feeds found with memchr and
// each line copied out, as a reader needs it.
void BM_BaselineAppendMemchr(benchmark::State& state) {
  const size_t packets = packetsFor(state.range(0));
  const std::string payload = linePayload();
  std::string line;
  line.reserve(kLineLength);
  std::string all;

  for (auto _ : state) {
    state.PauseTiming();
    all.clear();
    all.reserve(packets * kPayload);
    state.ResumeTiming();

    size_t lines = 0;
    size_t start = 0;
    for (size_t p = 0; p < packets; ++p) {
      all.append(payload);
      while (const void* hit = std::memchr(all.data() + start, '\n', all.size() - start)) {
        const size_t pos = static_cast<size_t>(static_cast<const char*>(hit) - all.data());
        line.assign(all, start, pos - start);
        start = pos + 1;
        ++lines;
      }
    }
    benchmark::DoNotOptimize(line.data());
    if (lines != packets * kLinesPerPacket) state.SkipWithError("baseline miscounted");
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * packets * kPayload));
}
BENCHMARK(BM_BaselineAppendMemchr)->Arg(64)->Arg(128)->Unit(benchmark::kMillisecond);

}  // namespace
