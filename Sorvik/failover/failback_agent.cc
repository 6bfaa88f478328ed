#include "Sorvik/failover/failback_agent.h"

#include <cctype>
#include <climits>
#include <cstring>
#include <vector>

#include "Sorvik/platform/platform.h"
#include "Sorvik/plugin/host_log.h"
#include "Sorvik/plugin/module.h"
#include "Sorvik/service/update_service.h"

namespace sorvik {
namespace {

using ko::ipc::ClientState;

constexpr char kAgentProgram[] = "./kelp";

std::string joinArgs(const std::vector<std::string>& args) {
  std::string text;
  for (const std::string& arg : args) {
    if (!text.empty()) text += ' ';
    text += arg;
  }
  return text;
}

// Ports are unsigned in the request record but travel as signed text.
std::string portText(uint32_t port) { return std::to_string(static_cast<int32_t>(port)); }

// Process id of a running agent, else 0. State and value are separate reads:
// the value counts as a pid only if the client was still running after it
// was read, so an exit code is never mistaken for a process id.
int32_t runningPid(const ko::ipc::client& agent) {
  if (agent.state() != ClientState::Running) return 0;
  const int32_t pid = agent.value();
  return agent.state() == ClientState::Running ? pid : 0;
}

// Spawns the agent into service.agentClient; false (handle emptied, reason
// logged) when the host could not start it.
bool spawnAgent(UpdateService& service, const std::vector<std::string>& args) {
  ko::ipc::SpawnOptions options;
  options.args = args;
  options.flags = ko::ipc::kSpawnPiped;
  service.agentClient = ko::ipc::spawn(options);
  if (service.agentClient->state() != ClientState::Failed) return true;
  ko::core::log(ko::core::kLogRejected, "Failed to start failback agent- %s",
                std::strerror(service.agentClient->value()));
  service.agentClient.reset();
  return false;
}

// The token goes to standard input only, never to the log or the command
// line. Sent as plain input without the close bit: the agent expects its
// input to stay open.
void sendToken(const ko::ipc::client& agent, const std::string& token) {
  std::string line = token;
  line += '\n';
  ko::ipc::send(agent.id(), static_cast<uint32_t>(ko::ipc::PacketType::StdinData), 0, line.data(), line.size());
}

// First line of the agent's standard output, or "" when none arrived in
// time, the agent ended, or the plug-in is closing.
std::string readPortLine(UpdateService& service, ko::ipc::client& agent, std::chrono::nanoseconds limit) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  std::string line;
  while (true) {
    const ClientState state = agent.state();
    if (state == ClientState::Failed || state == ClientState::Exited) break;
    if (std::chrono::steady_clock::now() >= deadline) break;
    if (!service.isWorkerRunning()) break;
    line.clear();
    if (agent.read_line(line, 0, kAgentPortReadMs)) return line;
  }
  return "";
}

}  // namespace

std::string parseAgentPort(const std::string& line, int32_t* port) {
  size_t pos = 0;
  while (pos < line.size() && std::isspace(static_cast<unsigned char>(line[pos]))) ++pos;
  bool negative = false;
  if (pos < line.size() && (line[pos] == '+' || line[pos] == '-')) negative = line[pos++] == '-';
  const size_t digitsStart = pos;
  int64_t magnitude = 0;
  bool overflow = false;
  for (; pos < line.size() && std::isdigit(static_cast<unsigned char>(line[pos])); ++pos) {
    if (!overflow) magnitude = magnitude * 10 + (line[pos] - '0');
    if (magnitude > static_cast<int64_t>(INT32_MAX) + 1) overflow = true;
  }
  if (pos == digitsStart) return "invalid stoi argument";
  const int64_t value = negative ? -magnitude : magnitude;
  if (overflow || value > INT32_MAX || value < INT32_MIN) return "stoi argument out of range";
  *port = static_cast<int32_t>(value);
  return "";
}

void StartAgent(UpdateService& service, const std::string& drives, AgentRequestRecord& request) {
  StartAgentWithPortLimit(service, drives, request, kAgentPortLimit);
}

void StartAgentWithPortLimit(UpdateService& service, const std::string& drives, AgentRequestRecord& request,
                             std::chrono::nanoseconds portLimit) {
  using namespace ko::core;
  const std::vector<std::string> args = {kAgentProgram,
                                         "-x",
                                         "-start",
                                         format_utc_timestamp(request.FailoverStart),
                                         "-end",
                                         format_utc_timestamp(request.FailoverEnd),
                                         "-drives",
                                         drives,
                                         "-port",
                                         portText(request.Port)};
  log(kLogProgress, "Starting failback agent: {%s}", joinArgs(args).c_str());
  if (!spawnAgent(service, args)) return;

  ko::ipc::client& agent = *service.agentClient;
  sendToken(agent, request.PasswordToken);
  log(kLogProgress, "Failback agent started, pid=%d. Retrieving port...", runningPid(agent));

  const std::string line = readPortLine(service, agent, portLimit);
  int32_t port = 0;
  std::string error = parseAgentPort(line, &port);
  // A number that cannot be a TCP port would be reported to the host as a
  // ready agent it can never reach.
  if (error.empty() && (port < 1 || port > 65535)) error = "port " + std::to_string(port) + " out of range";
  if (!error.empty()) {
    log(kLogRejected, "Failed to retrieve failback agent's port. Error: %s", error.c_str());
    request.Port = 0;
    // The process may still run; a later stop finds it by name.
    service.agentClient.reset();
    return;
  }
  request.Port = static_cast<uint32_t>(port);
  log(kLogProgress, "Failback agent started successfully, pid=%d, port=%d", runningPid(agent), port);
}

void StartReset(UpdateService& service, const std::string& drives, AgentRequestRecord& request) {
  using namespace ko::core;
  const std::vector<std::string> args = {kAgentProgram,
                                         "-x",
                                         "-delete",
                                         "-start",
                                         format_utc_timestamp(request.FailoverStart),
                                         "-end",
                                         format_utc_timestamp(request.FailoverEnd),
                                         "-drives",
                                         drives};
  log(kLogProgress, "Starting failback agent (reset): {%s}", joinArgs(args).c_str());
  if (!spawnAgent(service, args)) return;
  sendToken(*service.agentClient, request.PasswordToken);
  log(kLogProgress, "Failback agent started, pid=%d.", runningPid(*service.agentClient));
}

void StopAgent(UpdateService& /*service*/, std::shared_ptr<ko::ipc::client>& handle, uint32_t exitCode) {
  using namespace ko::core;
  const int code = static_cast<int>(exitCode);
  if (handle) {
    const ClientState state = handle->state();
    if (state == ClientState::Exited) {
      log(kLogProgress, "Failback agent child proc pipe closed");
      handle.reset();
      return;
    }
    const int32_t pid = runningPid(*handle);
    if (pid != 0) {
      log(kLogProgress, "Terminating failback agent process with code %d, pid=%d", code, pid);
      terminate_process(static_cast<uint32_t>(pid), exitCode);
      return;
    }
  }
  std::vector<uint32_t> ids;
  find_processes_by_name({platform::current().agentImageName()}, ids);
  for (const uint32_t id : ids) {
    if (id == 0) continue;
    log(kLogProgress, "Terminating existing failback agent process with code %d, pid=%u", code, id);
    terminate_process(id, exitCode);
  }
}

}  // namespace sorvik
