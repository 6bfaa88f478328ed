// Update pipeline speed: the bundle checksum against the system's md5sum on
// the same 1 GiB file (page cache warm), and the location grammar on long
// inputs (time must grow linearly with length).

#include <benchmark/benchmark.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <boost/filesystem.hpp>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "Sorvik/platform/mutex.h"
#include "Sorvik/service/update_service.h"
#include "Sorvik/update/checksum.h"
#include "Sorvik/update/file_digest.h"
#include "Sorvik/update/location.h"
#include "host/fake_host.h"

namespace {

namespace fs = boost::filesystem;

constexpr int64_t kBundleBytes = int64_t{1} << 30;

// A 1 GiB bundle in a private directory, which is also the working directory
// of the service (it keeps "update.xml" there). Removed at exit.
class BundleFixture {
 public:
  static BundleFixture& get() {
    static BundleFixture fixture;
    return fixture;
  }
  const std::string& path() const { return path_; }
  const std::string& digest() const { return digest_; }
  sorvik::UpdateService& service() { return *service_; }

  ~BundleFixture() {
    service_.reset();
    host_.reset();
    boost::system::error_code ignored;
    fs::current_path(oldDir_, ignored);
    fs::remove_all(dir_, ignored);
  }

 private:
  BundleFixture() {
    char pattern[] = "/tmp/sorvik-update-bench-XXXXXX";
    if (::mkdtemp(pattern) == nullptr) std::abort();
    dir_ = pattern;
    oldDir_ = fs::current_path();
    fs::current_path(dir_);
    path_ = (dir_ / "bundle.zip").string();
    std::vector<char> block(1 << 20);
    uint32_t x = 12345;
    for (char& c : block) c = static_cast<char>((x = x * 1103515245u + 12345u) >> 24);
    std::ofstream out(path_, std::ios::binary);
    for (int64_t written = 0; written < kBundleBytes; written += block.size()) {
      block[0] = static_cast<char>(written >> 20);  // no two blocks alike
      out.write(block.data(), static_cast<std::streamsize>(block.size()));
    }
    out.close();
    host_ = std::make_unique<sorvik::testing::FakeHost>();
    host_->setThreshold(100);  // keep the log channel out of the measurement
    host_->install();
    service_ = std::make_unique<sorvik::UpdateService>(nullptr);
    digest_ = sorvik::md5OfFile(path_).hex;  // also warms the page cache
  }

  fs::path dir_;
  fs::path oldDir_;
  std::string path_;
  std::string digest_;
  std::unique_ptr<sorvik::testing::FakeHost> host_;
  std::unique_ptr<sorvik::UpdateService> service_;
};

struct Cost {
  double wall = 0;
  double cpu = 0;
};

double cpuSeconds(int who) {
  rusage usage{};
  ::getrusage(who, &usage);
  return static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) +
         static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
}

template <typename Work>
Cost measure(int who, Work&& work, bool* ok) {
  const double cpuBefore = cpuSeconds(who);
  const auto start = std::chrono::steady_clock::now();
  *ok = work();
  return {std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count(),
          cpuSeconds(who) - cpuBefore};
}

// Runs md5sum and the checksum step alternately on the same warm file, so
// both see the same machine load; the shared machine makes wall times noisy,
// so the ratios use the best wall time of each and the summed CPU time
// (md5sum's from its reaped child usage).
void BM_ChecksumVersusMd5sum(benchmark::State& state) {
  BundleFixture& fixture = BundleFixture::get();
  const std::string command = "md5sum '" + fixture.path() + "'";
  Cost best[2] = {{1e9, 0}, {1e9, 0}};
  double cpu[2] = {0, 0};
  for (auto _ : state) {
    bool ok = false;
    const Cost tool = measure(RUSAGE_CHILDREN, [&] {
      FILE* pipe = ::popen(command.c_str(), "r");
      char line[128] = {};
      const bool read = pipe != nullptr && std::fgets(line, sizeof line, pipe) != nullptr;
      const bool exited = pipe != nullptr && ::pclose(pipe) == 0;
      return read && exited && fixture.digest().compare(0, 32, line, 32) == 0;
    }, &ok);
    if (!ok) {
      state.SkipWithError("md5sum failed or disagreed");
      return;
    }
    const Cost ours = measure(RUSAGE_THREAD, [&] {
      return sorvik::VerifyBundleChecksum(fixture.service(), fixture.path(), fixture.digest());
    }, &ok);
    if (!ok) {
      state.SkipWithError("checksum refused");
      return;
    }
    state.SetIterationTime(ours.wall);
    best[0].wall = std::min(best[0].wall, tool.wall);
    best[1].wall = std::min(best[1].wall, ours.wall);
    cpu[0] += tool.cpu;
    cpu[1] += ours.cpu;
  }
  state.SetBytesProcessed(state.iterations() * kBundleBytes);
  // Above 1: faster than md5sum.
  state.counters["md5sum_MBps_best"] = static_cast<double>(kBundleBytes) / best[0].wall / 1e6;
  state.counters["ours_MBps_best"] = static_cast<double>(kBundleBytes) / best[1].wall / 1e6;
  state.counters["ratio_wall_best"] = best[0].wall / best[1].wall;
  state.counters["ratio_cpu"] = cpu[0] / cpu[1];
}

void BM_ParseLongLocation(benchmark::State& state) {
  // Worst shape for a backtracking matcher: every '@' is a candidate end of
  // the credentials and none is followed by a host and path.
  const std::string text = "http://u:" + std::string(static_cast<size_t>(state.range(0)), '@');
  sorvik::BundleLocation parsed;
  for (auto _ : state) {
    benchmark::DoNotOptimize(sorvik::parseLocation(text, &parsed));
  }
  state.SetBytesProcessed(state.iterations() * state.range(0));
  state.SetComplexityN(state.range(0));
}

}  // namespace

BENCHMARK(BM_ChecksumVersusMd5sum)->Unit(benchmark::kMillisecond)->UseManualTime()->Iterations(5);
BENCHMARK(BM_ParseLongLocation)->RangeMultiplier(4)->Range(1 << 12, 1 << 20)->Complexity(benchmark::oN);
