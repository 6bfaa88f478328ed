// sorvik-host: loads the plug-in, drives it as the recording server does,
// runs its child processes, and takes instructions from a prompt or script.

#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>

#include "host/posix_console.h"
#include "host/sorvik_host_display.h"
#include "host/sorvik_host_events.h"
#include "host/sorvik_host_script.h"
#include "host/sorvik_host_session.h"

namespace sorvik::host {
namespace {

constexpr int kExitOk = 0;
constexpr int kExitScriptFailed = 1;
constexpr int kExitUsage = 2;
constexpr int kExitStartFailed = 3;

const char kUsage[] = R"(Usage: sorvik-host [OPTIONS] PLUGIN_LIBRARY

Loads PLUGIN_LIBRARY (a path to the plug-in's shared library), changes into
the working directory, calls Load and Open, runs IOCTL code 1 on a worker
thread of its own and runs the child processes the plug-in asks for. Log
lines, documents and host notices are shown with a UTC time stamp.
Instructions come from the prompt (stdin) or from a script file.

Options:
  -C, --workdir DIR          working directory of the plug-in and its children
                             (default: the current directory)
  -l, --log-level LEVEL      log threshold answered to the plug-in's level query:
                             DETAIL(0), PROGRESS(25), FAILED(50), REJECTED(75),
                             INTERNAL(100) or a number (default 25)
  -s, --script FILE          read instructions from FILE instead of stdin
  -w, --wait-timeout SECONDS default time limit of the wait instruction (default 30)
      --ps1-interpreter PATH program that runs *.ps1 children (default /bin/sh)
      --child-output MODE    where children started without pipes write:
                             inherit (the host's stdout/stderr, default) or null
  -h, --help                 this text

Instructions are read line by line until quit or the end of input. Reading a
script (a file, or stdin that is not a terminal), the first failing
instruction ends the host with exit code 1; at the prompt it is only reported.

%s

Children: a program path with a slash (./curl, ./kelp, scripts/update.ps1)
is taken relative to the working directory; a bare name is looked up there
and then in PATH. *.ps1 programs run through the --ps1-interpreter. Children
started with pipes (flag value 2) exchange stdin/stdout/stderr with the
plug-in; others get /dev/null as stdin.

Children get SORVIK_HOST_PID, the host's process id, in their environment:
`kill -HUP $SORVIK_HOST_PID` restarts the plug-in (Close, Unload, reload,
Load, Open) while the children keep running. SIGINT and SIGTERM close the
plug-in and end the host.

Exit codes: 0 done; 1 an instruction of a script failed (a wait timed out, a
bad instruction); 2 bad command line; 3 the plug-in or the working directory
could not be loaded. A child ended by signal N is reported to the plug-in
with exit code 128+N.
)";

struct Options {
  std::string library;
  std::string workdir;
  std::string script;
  int32_t logLevel = 25;
  double waitSeconds = 30;
  std::string ps1Interpreter = "/bin/sh";
  bool inheritChildOutput = true;
};

void printUsage(std::FILE* out) { std::fprintf(out, kUsage, instructionHelp()); }

int missingValue(const std::string& option) {
  std::fprintf(stderr, "sorvik-host: %s needs a value (see --help)\n", option.c_str());
  return kExitUsage;
}

// 0 to run, otherwise the exit code (help shown, or an error printed).
int parseOptions(int argc, char** argv, Options* options, bool* helpShown) {
  *helpShown = false;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    auto value = [&](std::string* out) {
      if (i + 1 >= argc) return false;
      *out = argv[++i];
      return true;
    };
    std::string text;
    if (arg == "-h" || arg == "--help") {
      printUsage(stdout);
      *helpShown = true;
      return kExitOk;
    } else if (arg == "-C" || arg == "--workdir") {
      if (!value(&options->workdir)) return missingValue(arg);
    } else if (arg == "-s" || arg == "--script") {
      if (!value(&options->script)) return missingValue(arg);
    } else if (arg == "-l" || arg == "--log-level") {
      if (!value(&text)) return missingValue(arg);
      if (!parseLogLevel(text, &options->logLevel)) {
        std::fprintf(stderr, "sorvik-host: bad log level '%s'\n", text.c_str());
        return kExitUsage;
      }
    } else if (arg == "-w" || arg == "--wait-timeout") {
      if (!value(&text)) return missingValue(arg);
      char* end = nullptr;
      options->waitSeconds = std::strtod(text.c_str(), &end);
      if (text.empty() || *end != '\0' || !(options->waitSeconds >= 0)) {
        std::fprintf(stderr, "sorvik-host: bad wait timeout '%s'\n", text.c_str());
        return kExitUsage;
      }
    } else if (arg == "--ps1-interpreter") {
      if (!value(&options->ps1Interpreter)) return missingValue(arg);
    } else if (arg == "--child-output") {
      if (!value(&text)) return missingValue(arg);
      if (text != "inherit" && text != "null") {
        std::fprintf(stderr, "sorvik-host: --child-output takes inherit or null\n");
        return kExitUsage;
      }
      options->inheritChildOutput = text == "inherit";
    } else if (!arg.empty() && arg[0] == '-') {
      std::fprintf(stderr, "sorvik-host: unknown option %s (see --help)\n", arg.c_str());
      return kExitUsage;
    } else if (options->library.empty()) {
      options->library = arg;
    } else {
      std::fprintf(stderr, "sorvik-host: more than one plug-in library given\n");
      return kExitUsage;
    }
  }
  if (options->library.empty()) {
    std::fprintf(stderr, "sorvik-host: missing PLUGIN_LIBRARY (see --help)\n");
    return kExitUsage;
  }
  return kExitOk;
}

std::string absolute(const std::string& path) {
  char resolved[PATH_MAX];
  if (::realpath(path.c_str(), resolved) != nullptr) return resolved;
  return path;
}

int run(const Options& options) {
  // The library path is relative to where the host was started, not to the
  // working directory.
  const std::string library = options.library.find('/') == std::string::npos ? options.library
                                                                                : absolute(options.library);
  int scriptFd = 0;
  if (!options.script.empty()) {
    scriptFd = ::open(options.script.c_str(), O_RDONLY | O_CLOEXEC);
    if (scriptFd < 0) {
      std::fprintf(stderr, "sorvik-host: cannot open script %s: %s\n", options.script.c_str(), std::strerror(errno));
      return kExitUsage;
    }
  }
  if (!options.workdir.empty() && ::chdir(options.workdir.c_str()) != 0) {
    std::fprintf(stderr, "sorvik-host: cannot enter %s: %s\n", options.workdir.c_str(), std::strerror(errno));
    return kExitStartFailed;
  }
  std::string error;
  if (!SignalPipe::install(&error)) {
    std::fprintf(stderr, "sorvik-host: %s\n", error.c_str());
    return kExitStartFailed;
  }

  Display display(stdout, isTerminal(1));
  EventLog events;
  SessionOptions sessionOptions;
  sessionOptions.libraryPath = library;
  sessionOptions.logThreshold = options.logLevel;
  sessionOptions.runner.workingDir = absolute(".");
  sessionOptions.runner.ps1Interpreter = options.ps1Interpreter;
  sessionOptions.runner.inheritOutput = options.inheritChildOutput;
  sessionOptions.runner.extraEnvironment.push_back("SORVIK_HOST_PID=" + std::to_string(::getpid()));
  HostSession session(sessionOptions, [&](Event event) {
    display.show(event);
    events.add(std::move(event));
  });
  if (!session.start(&error)) {
    std::fprintf(stderr, "sorvik-host: cannot load %s: %s\n", library.c_str(), error.c_str());
    return kExitStartFailed;
  }

  StopPipe stopControl;
  StopPipe stopInput;
  std::thread control([&] {
    while (true) {
      const int signo = SignalPipe::next(stopControl.fd());
      if (signo == 0) return;
      if (signo == SIGHUP) {
        std::string why;
        if (!session.restart(&why)) display.say("sorvik-host: restart failed: " + why);
        continue;
      }
      display.say(std::string("sorvik-host: ") + ::strsignal(signo) + ", closing the plug-in");
      events.interrupt();
      stopInput.raise();
      return;
    }
  });

  const bool interactive = options.script.empty() && isTerminal(0);
  if (interactive) display.say("sorvik-host ready; type help for the instructions.");
  ScriptRunner runner(&session, &events, &display,
                      std::chrono::milliseconds(static_cast<int64_t>(options.waitSeconds * 1000)));
  LineReader reader(scriptFd, stopInput.fd());
  int exitCode = kExitOk;
  int lineNumber = 0;
  std::string line;
  while (true) {
    if (interactive) display.prompt("sorvik> ");
    const ReadResult read = reader.next(&line);
    if (interactive) display.prompt("");
    if (read != ReadResult::Line) break;
    ++lineNumber;
    const size_t first = line.find_first_not_of(" \t\r");
    if (first == std::string::npos || line[first] == '#') continue;
    if (!interactive) display.say("> " + maskInstruction(line.substr(first)));
    std::string why;
    const StepResult result = runner.execute(line, &why);
    if (result == StepResult::Quit) break;
    if (result == StepResult::Failed) {
      if (interactive) {
        display.say("error: " + why);
        continue;
      }
      const std::string where = options.script.empty() ? "stdin" : options.script;
      display.say("sorvik-host: script failed at " + where + ":" + std::to_string(lineNumber) + ": " + why);
      exitCode = kExitScriptFailed;
      break;
    }
  }
  stopControl.raise();
  control.join();
  session.shutdown();
  if (scriptFd > 0) ::close(scriptFd);
  return exitCode;
}

}  // namespace
}  // namespace sorvik::host

int main(int argc, char** argv) {
  sorvik::host::Options options;
  bool helpShown = false;
  const int rc = sorvik::host::parseOptions(argc, argv, &options, &helpShown);
  if (rc != 0 || helpShown) return rc;
  return sorvik::host::run(options);
}
