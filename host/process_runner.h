#pragma once

// The host's process runner: it turns the plug-in's child-process packets
// (start requests, standard-input bytes) into real processes and reports
// their start, output and end back as packets.
//
// The plug-in sends packets from inside the host callback while it holds its
// own locks, so `submit` only queues; every answer is produced and delivered
// by the runner's own thread.

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "Sorvik/ipc/packet.h"

namespace sorvik::host {

struct RunnerOptions {
  // Directory that relative program paths resolve against and that children
  // start in. Empty: the host's current directory.
  std::string workingDir;
  // Interpreter for programs ending in ".ps1"; the script path and its
  // arguments follow it on the command line.
  std::string ps1Interpreter = "/bin/sh";
  // Where the output of children without pipes (flag bit 1 clear) goes:
  // true: the host's own stdout and stderr; false: /dev/null.
  bool inheritOutput = true;
  // "NAME=value" entries added to every child's environment.
  std::vector<std::string> extraEnvironment;
  // How long a full-size StdinData packet carrying the close bit waits for
  // a following chunk before standard input is closed.
  int closeGraceMs = 200;
};

// Receives one packet (header and payload) for the plug-in's IOCTL code 4.
using PacketDelivery = std::function<void(const unsigned char* packet, size_t length)>;
// Receives a line of the runner's own diagnostics (refused packets,
// detached children ending).
using RunnerNotice = std::function<void(const std::string& text)>;

// What a StartRequest asks for, decoded from its payload.
struct StartPayload {
  std::string textA;  // present with flag bit 3
  std::string textB;  // present with flag bit 4
  std::vector<std::string> args;
};
// False when the payload lacks a text its flags announce or has no program.
bool decodeStartPayload(const unsigned char* data, size_t length, uint32_t flags, StartPayload* out);

// What a StdinData packet asks of the child's input once its bytes are
// written. Every chunk of a long send repeats the close bit, so a full-size
// chunk may be followed by more: its close waits for a short quiet period.
enum class StdinClose { Keep, WhenDrained, AfterQuietPeriod };
StdinClose stdinCloseFor(uint32_t value, size_t packetLength);

// Decodes one packet the plug-in sent and hands a start request or standard
// input to its handler; anything else is reported through `notice`.
struct PluginPacketHandlers {
  std::function<void(const ko::ipc::PacketHeader& header, const unsigned char* payload, size_t length)> start;
  std::function<void(const ko::ipc::PacketHeader& header, size_t packetLength, const unsigned char* payload,
                     size_t length)>
      stdinData;
};
void dispatchPluginPacket(const std::string& bytes, const RunnerNotice& notice, const PluginPacketHandlers& handlers);

// The exit code the runner reports for a child ended by `signal`.
inline int32_t exitCodeForSignal(int signal) { return 128 + signal; }

// Thread-safe: `submit`, `detachAll` and `stop` may be called from any
// thread; all process and pipe work happens on the runner's own thread.
class ProcessRunner {
 public:
  virtual ~ProcessRunner() = default;

  // Starts the runner thread. Deliveries are made from that thread only.
  virtual bool start(std::string* error) = 0;

  // Queues one packet from the plug-in (copied). Never blocks on a child.
  virtual void submit(const unsigned char* packet, size_t length) = 0;

  // Returns once every packet submitted before the call is handled and its
  // answer (such as Started) delivered.
  virtual void flush() = 0;

  // Forgets every child's id once all packets submitted before the call are
  // handled: the children keep running, their output is read and dropped,
  // and their end is only noticed. Returns when done. Used across a plug-in
  // restart, whose new instance reuses the ids.
  virtual void detachAll() = 0;

  // Ends the runner thread and closes every pipe. Children keep running.
  virtual void stop() = 0;

  // Children currently tracked, attached or not.
  virtual size_t childCount() = 0;
};

std::unique_ptr<ProcessRunner> newProcessRunner(RunnerOptions options, PacketDelivery deliver, RunnerNotice notice);

}  // namespace sorvik::host
