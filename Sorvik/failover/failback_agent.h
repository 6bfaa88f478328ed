#pragma once

// Life cycle of the failback agent program: start (with the token handed over
// on standard input and the listening port learned from its first output
// line), start in spare-reset mode, and stop by process id or by image name.

#include <chrono>
#include <cstdint>
#include <memory>
#include <string>

#include "Sorvik/failover/agent_processes.h"
#include "Sorvik/failover/utc_timestamp.h"
#include "Sorvik/ipc/client.h"

namespace sorvik {

class UpdateService;
struct AgentRequestRecord;

// How long the agent has to print its port, counted from the token hand-over.
inline constexpr std::chrono::nanoseconds kAgentPortLimit = std::chrono::seconds(5);
// Longest single wait for output; also how quickly a close is noticed.
inline constexpr int64_t kAgentPortReadMs = 100;

// Worker thread only. On success service.agentClient holds the agent and
// request.Port the port it listens on; on failure agentClient is empty (and
// request.Port is 0 when the agent started but gave no usable port).
void StartAgent(UpdateService& service, const std::string& drives, AgentRequestRecord& request);
// As StartAgent with another handshake limit (tests).
void StartAgentWithPortLimit(UpdateService& service, const std::string& drives, AgentRequestRecord& request,
                             std::chrono::nanoseconds portLimit);

// Worker thread only. Starts the agent with -delete; no port handshake.
void StartReset(UpdateService& service, const std::string& drives, AgentRequestRecord& request);

// Ends the agent in `handle` by process id when it is running with a known
// id; otherwise every process named like the agent on this machine. Empties
// `handle` only when the agent has already exited. Safe with an empty handle
// from any thread.
void StopAgent(UpdateService& service, std::shared_ptr<ko::ipc::client>& handle, uint32_t exitCode);

// Reads a port the way std::stoi reads an int. Returns "" on success, else
// the failure text logged for the handshake.
std::string parseAgentPort(const std::string& line, int32_t* port);

}  // namespace sorvik
