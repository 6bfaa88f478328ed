#include "host/sorvik_host_cli.h"

#include <cstdio>
#include <cstdlib>

namespace sorvik::host {
namespace {

int missingValue(const std::string& option) {
  std::fprintf(stderr, "sorvik-host: %s needs a value (see --help)\n", option.c_str());
  return kExitUsage;
}

}  // namespace

int parseOptions(int argc, char** argv, const char* usage, Options* options, bool* helpShown) {
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
      std::printf(usage, instructionHelp());
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
    std::fprintf(stderr, "sorvik-host: missing the plug-in library (see --help)\n");
    return kExitUsage;
  }
  return kExitOk;
}

SessionOptions sessionOptionsFor(const Options& options, const std::string& library, const std::string& workingDir,
                                 unsigned long hostPid) {
  SessionOptions session;
  session.libraryPath = library;
  session.logThreshold = options.logLevel;
  session.runner.workingDir = workingDir;
  session.runner.ps1Interpreter = options.ps1Interpreter;
  session.runner.inheritOutput = options.inheritChildOutput;
  session.runner.extraEnvironment.push_back("SORVIK_HOST_PID=" + std::to_string(hostPid));
  return session;
}

int runInstructions(ScriptRunner& runner, Display& display, const std::function<bool(std::string*)>& nextLine,
                    bool interactive, const std::string& where) {
  int lineNumber = 0;
  std::string line;
  for (;;) {
    if (interactive) display.prompt("sorvik> ");
    const bool got = nextLine(&line);
    if (interactive) display.prompt("");
    if (!got) return kExitOk;
    ++lineNumber;
    if (!line.empty() && line.back() == '\r') line.pop_back();
    const size_t first = line.find_first_not_of(" \t");
    if (first == std::string::npos || line[first] == '#') continue;
    if (!interactive) display.say("> " + maskInstruction(line.substr(first)));
    std::string why;
    const StepResult result = runner.execute(line, &why);
    if (result == StepResult::Quit) return kExitOk;
    if (result != StepResult::Failed) continue;
    if (interactive) {
      display.say("error: " + why);
      continue;
    }
    display.say("sorvik-host: script failed at " + where + ":" + std::to_string(lineNumber) + ": " + why);
    return kExitScriptFailed;
  }
}

}  // namespace sorvik::host
