// sorvik-host.exe: the development host on Windows. It loads sorvik.dll,
// drives it as the recording server does, runs its child processes, and
// takes instructions from the prompt or a script, like its POSIX twin
// (host/sorvik_host_main.cc), whose session, script and display it shares.

#include <windows.h>

#include <fcntl.h>
#include <io.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iostream>
#include <string>
#include <thread>

#include "host/sorvik_host_cli.h"
#include "host/sorvik_host_display.h"
#include "host/sorvik_host_events.h"
#include "host/sorvik_host_script.h"
#include "host/sorvik_host_session.h"

namespace sorvik::host {
namespace {

const char kUsage[] = R"(Usage: sorvik-host.exe [OPTIONS] PLUGIN_DLL

Loads PLUGIN_DLL (the plug-in, sorvik.dll), changes into the working
directory, calls Load and Open, runs IOCTL code 1 on a worker thread of its
own and runs the child processes the plug-in asks for. Log lines, documents
and host notices are shown with a UTC time stamp. Instructions come from the
prompt (standard input) or from a script file.

Options:
  -C, --workdir DIR          working directory of the plug-in and its children
                             (default: the current directory)
  -l, --log-level LEVEL      log threshold answered to the plug-in's level query:
                             DETAIL(0), PROGRESS(25), FAILED(50), REJECTED(75),
                             INTERNAL(100) or a number (default 25)
  -s, --script FILE          read instructions from FILE instead of standard input
  -w, --wait-timeout SECONDS default time limit of the wait instruction (default 30)
      --ps1-interpreter PATH program that runs *.ps1 children (default powershell.exe,
                             which is given -NoProfile -NonInteractive
                             -ExecutionPolicy Bypass -File)
      --child-output MODE    where children started without pipes write:
                             inherit (the host's console, default) or null
  -h, --help                 this text

Instructions are read line by line until quit or the end of input. Reading a
script, the first failing instruction ends the host with exit code 1; at the
prompt it is only reported.

%s

Children: ./kelp, ./curl and scripts\update.ps1 are taken relative to the
working directory (".exe" is added when the name has no extension); a bare
name is looked up there and then as Windows does. A child inherits its three
standard handles and nothing else.

Children get SORVIK_HOST_PID, the host's process id, in their environment.
Setting the event "Local\sorvik-host-restart-<SORVIK_HOST_PID>" restarts the
plug-in (Close, Unload, reload, Load, Open) while the children keep running;
in PowerShell:
  [Threading.EventWaitHandle]::OpenExisting("Local\sorvik-host-restart-$env:SORVIK_HOST_PID").Set()
Ctrl+C, Ctrl+Break and closing the console close the plug-in and end the host.

Exit codes: 0 done; 1 an instruction of a script failed; 2 bad command line;
3 the plug-in or the working directory could not be loaded.
)";

std::string absolute(const std::string& path) {
  char full[MAX_PATH * 4];
  const DWORD n = ::GetFullPathNameA(path.c_str(), sizeof full, full, nullptr);
  return n > 0 && n < sizeof full ? std::string(full, n) : path;
}

std::string lastErrorText() { return "error " + std::to_string(::GetLastError()); }

// Set by the console control handler; the events it wakes are process-wide
// because the handler is a plain function.
HANDLE g_stopEvent = nullptr;

BOOL WINAPI onConsoleControl(DWORD type) {
  switch (type) {
    case CTRL_C_EVENT:
    case CTRL_BREAK_EVENT:
    case CTRL_CLOSE_EVENT:
      ::SetEvent(g_stopEvent);
      return TRUE;
    default:
      return FALSE;
  }
}

int run(const Options& options) {
  // Relative to where the host was started, not to the working directory.
  const std::string library = absolute(options.library);
  std::ifstream scriptFile;
  if (!options.script.empty()) {
    scriptFile.open(options.script, std::ios::binary);
    if (!scriptFile) {
      std::fprintf(stderr, "sorvik-host: cannot open script %s\n", options.script.c_str());
      return kExitUsage;
    }
  }
  if (!options.workdir.empty() && !::SetCurrentDirectoryA(options.workdir.c_str())) {
    std::fprintf(stderr, "sorvik-host: cannot enter %s: %s\n", options.workdir.c_str(), lastErrorText().c_str());
    return kExitStartFailed;
  }
  const std::string restartName = "Local\\sorvik-host-restart-" + std::to_string(::GetCurrentProcessId());
  g_stopEvent = ::CreateEventA(nullptr, TRUE, FALSE, nullptr);
  HANDLE restartEvent = ::CreateEventA(nullptr, FALSE, FALSE, restartName.c_str());
  if (g_stopEvent == nullptr || restartEvent == nullptr || !::SetConsoleCtrlHandler(onConsoleControl, TRUE)) {
    std::fprintf(stderr, "sorvik-host: cannot set up control events: %s\n", lastErrorText().c_str());
    return kExitStartFailed;
  }

  Display display(stdout, _isatty(_fileno(stdout)) != 0);
  EventLog events;
  const SessionOptions sessionOptions = sessionOptionsFor(options, library, absolute("."), ::GetCurrentProcessId());
  HostSession session(sessionOptions, [&](Event event) {
    display.show(event);
    events.add(std::move(event));
  });
  std::string error;
  if (!session.start(&error)) {
    std::fprintf(stderr, "sorvik-host: cannot load %s: %s\n", library.c_str(), error.c_str());
    return kExitStartFailed;
  }

  std::atomic<bool> stopping{false};
  HANDLE controlDone = ::CreateEventA(nullptr, TRUE, FALSE, nullptr);
  std::thread control([&] {
    const HANDLE waits[3] = {g_stopEvent, restartEvent, controlDone};
    for (;;) {
      const DWORD which = ::WaitForMultipleObjects(3, waits, FALSE, INFINITE);
      if (which == WAIT_OBJECT_0 + 1) {
        std::string why;
        if (!session.restart(&why)) display.say("sorvik-host: restart failed: " + why);
        continue;
      }
      if (which == WAIT_OBJECT_0) {
        display.say("sorvik-host: interrupted, closing the plug-in");
        stopping.store(true);
        events.interrupt();
        // Ends a console read in progress.
        ::CancelIoEx(::GetStdHandle(STD_INPUT_HANDLE), nullptr);
      }
      return;
    }
  });

  const bool interactive = options.script.empty() && _isatty(_fileno(stdin)) != 0;
  if (interactive) display.say("sorvik-host ready; type help for the instructions.");
  ScriptRunner runner(&session, &events, &display, waitLimit(options));
  std::istream& input = options.script.empty() ? std::cin : scriptFile;
  const int exitCode = runInstructions(
      runner, display,
      [&](std::string* line) { return !stopping.load() && std::getline(input, *line) && !stopping.load(); },
      interactive, options.script.empty() ? "stdin" : options.script);
  ::SetEvent(controlDone);
  control.join();
  session.shutdown();
  ::CloseHandle(controlDone);
  ::CloseHandle(restartEvent);
  return exitCode;
}

}  // namespace
}  // namespace sorvik::host

int main(int argc, char** argv) {
  sorvik::host::Options options;
  options.ps1Interpreter = "powershell.exe";
  bool helpShown = false;
  const int rc = sorvik::host::parseOptions(argc, argv, sorvik::host::kUsage, &options, &helpShown);
  if (rc != 0 || helpShown) return rc;
  return sorvik::host::run(options);
}
