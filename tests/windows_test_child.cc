// A child program for the Windows process tests.
//   (no arguments)          does nothing until terminated
//   --check-handle N        exits 0 when handle value N is not open here, 1 when it is
//   --echo ARGS...          prints each argument on a line, then copies standard
//                           input to standard output; ends with exit code 7
//   SCRIPT.ps1 ARGS...      a stand-in script interpreter: appends the script
//                           and its arguments to script-runs.txt, then waits
// Whatever waits ends by itself after a minute, so that a failed test
// cannot leave it behind for long.
#include <fcntl.h>
#include <io.h>
#include <windows.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

namespace {

constexpr DWORD kWatchdogMs = 60 * 1000;

bool endsWith(const std::string& text, const std::string& tail) {
  return text.size() >= tail.size() && text.compare(text.size() - tail.size(), tail.size(), tail) == 0;
}

int echo(int argc, char** argv) {
  // Bytes as they come: no line-end translation either way.
  _setmode(_fileno(stdin), _O_BINARY);
  _setmode(_fileno(stdout), _O_BINARY);
  _setmode(_fileno(stderr), _O_BINARY);
  for (int i = 2; i < argc; ++i) std::printf("%s\n", argv[i]);
  std::fflush(stdout);
  char buffer[4096];
  size_t n;
  while ((n = std::fread(buffer, 1, sizeof buffer, stdin)) > 0) {
    std::fwrite(buffer, 1, n, stdout);
    std::fflush(stdout);
  }
  std::fputs("input closed\n", stderr);
  return 7;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc >= 3 && std::strcmp(argv[1], "--check-handle") == 0) {
    const auto value = static_cast<uintptr_t>(std::strtoull(argv[2], nullptr, 10));
    DWORD flags = 0;
    return ::GetHandleInformation(reinterpret_cast<HANDLE>(value), &flags) ? 1 : 0;
  }
  if (argc >= 2 && std::strcmp(argv[1], "--echo") == 0) return echo(argc, argv);
  if (argc >= 2 && endsWith(argv[1], ".ps1")) {
    if (std::FILE* runs = std::fopen("script-runs.txt", "a")) {
      for (int i = 1; i < argc; ++i) std::fprintf(runs, "%s%s", i > 1 ? " " : "", argv[i]);
      std::fputs("\n", runs);
      std::fclose(runs);
    }
  }
  ::Sleep(kWatchdogMs);
  return 3;
}
