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
#include "host/sorvik_host_cli.h"
#include "host/sorvik_host_display.h"
#include "host/sorvik_host_events.h"
#include "host/sorvik_host_script.h"
#include "host/sorvik_host_session.h"

namespace sorvik::host {
namespace {

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
  const SessionOptions sessionOptions = sessionOptionsFor(options, library, absolute("."), static_cast<unsigned long>(::getpid()));
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
  ScriptRunner runner(&session, &events, &display, waitLimit(options));
  LineReader reader(scriptFd, stopInput.fd());
  const int exitCode = runInstructions(
      runner, display,
      [&](std::string* line) { return reader.next(line) == ReadResult::Line; }, interactive,
      options.script.empty() ? "stdin" : options.script);
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
  options.ps1Interpreter = "/bin/sh";
  bool helpShown = false;
  const int rc = sorvik::host::parseOptions(argc, argv, sorvik::host::kUsage, &options, &helpShown);
  if (rc != 0 || helpShown) return rc;
  return sorvik::host::run(options);
}
