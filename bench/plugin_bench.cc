// Cost of a log line the host's threshold suppresses against one it receives.
// The bench host does the least a real host must: answer the query, and copy
// a received line out before the call returns (the text lives only that long).
#include <benchmark/benchmark.h>

#include <cstring>
#include <string>

#include "Sorvik/plugin/host_log.h"
#include "Sorvik/plugin/host_records.h"

namespace {

int32_t threshold = 0;
char received[4096];

int32_t benchCallback(void* raw, uint64_t) {
  const auto* bytes = static_cast<const unsigned char*>(raw);
  if (ko::core::readU32(bytes + 36) == ko::core::kTypeLogLevelQuery) return threshold;
  const uint32_t length = ko::core::readU32(bytes + 8);
  std::memcpy(received, ko::core::readPointer(bytes + 16), length < sizeof received ? length : sizeof received);
  benchmark::ClobberMemory();
  return 0;
}

const std::string kHundredChars(90, 'x');

void BM_HostLogSuppressed(benchmark::State& state) {
  threshold = 50;
  for (auto _ : state) {
    benchmark::DoNotOptimize(
        ko::core::hostLog(ko::core::kModuleId, benchCallback, 25, "Progress %s %d", kHundredChars.c_str(), 12345678));
  }
}
BENCHMARK(BM_HostLogSuppressed);

void BM_HostLogSent100(benchmark::State& state) {
  threshold = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(
        ko::core::hostLog(ko::core::kModuleId, benchCallback, 25, "Progress %s %d", kHundredChars.c_str(), 12345678));
  }
}
BENCHMARK(BM_HostLogSent100);

}  // namespace
