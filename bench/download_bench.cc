// A 512 MiB bundle downloaded through the development host and the plug-in,
// against the same curl command run directly on the same file.

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "Sorvik/update/curl_command.h"
#include "tests/support/host_run.h"
#include "tests/support/http_file_server.h"

extern char** environ;

namespace {

namespace fs = std::filesystem;
using sorvik::testing::HttpFileServer;

constexpr int64_t kBundleBytes = 512ll << 20;

struct Fixture {
  std::string root;
  std::unique_ptr<HttpFileServer> server;

  Fixture() {
    root = sorvik::testing::makeTempDir("sorvik-download-bench");
    fs::create_directories(root + "/served");
    fs::create_directories(root + "/work/scripts");
    const int fd = ::open((root + "/served/bundle.bin").c_str(), O_CREAT | O_WRONLY | O_TRUNC, 0644);
    std::vector<char> block(1 << 20);
    for (size_t i = 0; i < block.size(); ++i) block[i] = static_cast<char>(i * 131 + 7);
    for (int64_t done = 0; done < kBundleBytes; done += static_cast<int64_t>(block.size())) {
      if (::write(fd, block.data(), block.size()) != static_cast<ssize_t>(block.size())) std::abort();
    }
    ::close(fd);
    fs::create_symlink(CURL_PATH, root + "/work/curl");
    fs::copy_file(SORVIK_PLUGIN_PATH, root + "/work/libsorvik.so");
    server = std::make_unique<HttpFileServer>(root + "/served");
  }
  ~Fixture() {
    server.reset();
    fs::remove_all(root);
  }
};

Fixture& fixture() {
  static Fixture f;
  return f;
}

// Earlier runs' dirty pages must not throttle the next run's writes.
void settle() { ::sync(); }

double runCurlDirectly(const std::string& url, const std::string& out) {
  std::vector<std::string> args = sorvik::curlArguments(out, "127.0.0.1", "", false);
  args[0] = CURL_PATH;  // the plug-in's "./curl" is a link to it
  args.push_back(url);
  std::vector<char*> argv;
  for (auto& a : args) argv.push_back(a.data());
  argv.push_back(nullptr);

  int in[2];
  if (::pipe(in) != 0) std::abort();
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, in[0], 0);
  posix_spawn_file_actions_addclose(&actions, in[1]);
  posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
  posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
  const auto start = std::chrono::steady_clock::now();
  pid_t pid = 0;
  if (posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), environ) != 0) std::abort();
  posix_spawn_file_actions_destroy(&actions);
  ::close(in[0]);
  const std::string config = sorvik::curlConfigLine("guest", "") + "\n";
  if (::write(in[1], config.data(), config.size()) < 0) std::abort();
  ::close(in[1]);
  int status = 0;
  ::waitpid(pid, &status, 0);
  const double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) std::abort();
  return seconds;
}

void BM_CurlDirect(benchmark::State& state) {
  Fixture& f = fixture();
  for (auto _ : state) {
    settle();
    state.SetIterationTime(runCurlDirectly(f.server->url("bundle.bin"), f.root + "/direct.bin"));
    fs::remove(f.root + "/direct.bin");
  }
  state.SetBytesProcessed(state.iterations() * kBundleBytes);
}
BENCHMARK(BM_CurlDirect)->Iterations(1)->Repetitions(7)->UseManualTime()->Unit(benchmark::kMillisecond);

void BM_DownloadThroughHost(benchmark::State& state) {
  Fixture& f = fixture();
  sorvik::testing::HostRunOptions options;
  options.hostProgram = SORVIK_HOST_PATH;
  options.library = f.root + "/work/libsorvik.so";
  options.workdir = f.root + "/work";
  options.extraArgs = {"-l", "FAILED", "--child-output", "null"};
  options.env = {{"SORVIK_AGENT_IMAGE_NAME", "kelp-download-bench"}};
  // Without an installation script the step ends right after the download.
  options.script = "wait SpareResetStatus\nupdate " + f.server->url("bundle.bin") +
                   "\nwait -t 120 Status=\"-20\"\nquit\n";
  options.limit = std::chrono::seconds(300);
  for (auto _ : state) {
    fs::remove_all(f.root + "/work/downloads");
    settle();
    const auto start = std::chrono::steady_clock::now();
    const auto result = sorvik::testing::runHost(options);
    state.SetIterationTime(std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count());
    if (result.exitCode != 0) {
      state.SkipWithError("host run failed");
      std::fprintf(stderr, "%s\n", result.output.c_str());
      break;
    }
  }
  state.SetBytesProcessed(state.iterations() * kBundleBytes);
}
BENCHMARK(BM_DownloadThroughHost)->Iterations(1)->Repetitions(7)->UseManualTime()->Unit(benchmark::kMillisecond);

}  // namespace
