#pragma once

// An in-process stand-in for the host server, for tests. It receives
// everything the plug-in sends through the host callback (log lines, level
// queries, XML documents, child-process packets), records it, and plays the
// host's process runner from a thread of its own, answering start requests
// the way a test scripted them.
//
// Typical use:
//   sorvik::testing::FakeHost host;
//   host.install();                     // callback + ipc transport
//   host.setScript("./curl", ChildScript::exits(0, "", "100\r"));
//   auto child = ko::ipc::spawn({"./curl", "-f"});
//   EXPECT_TRUE(host.waitForLog("Download", std::chrono::seconds(5)));
//
// Only one FakeHost may be alive at a time; the static callback forwards to it.

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "Sorvik/ipc/packet.h"
#include "Sorvik/platform/mutex.h"
#include "Sorvik/plugin/host_records.h"

namespace sorvik::testing {

using Timeout = std::chrono::milliseconds;

struct LogRecord {
  int32_t level = 0;
  std::string text;
};

struct DocumentRecord {
  uint32_t target = 0;  // 256 announcement/state, 4 status documents
  std::string text;
};

// One child-process packet exactly as the plug-in sent it.
struct PacketRecord {
  ko::ipc::PacketHeader header;
  std::string payload;
};

// One decoded start request.
struct StartRecord {
  uint32_t id = 0;
  uint32_t flags = 0;
  std::vector<std::string> args;
  std::string text_a;  // only meaningful with flag bit 3
  std::string text_b;  // only meaningful with flag bit 4
};

// Output a scripted child writes; stream 0 is stdout, 1 is stderr (the same
// numbering as ko::ipc::client::read_line).
struct OutputChunk {
  int stream = 0;
  std::string bytes;
};

class FakeHost;

// What the child has received on standard input when a StdinData packet
// arrives; handed to ChildScript::onStdin on the runner thread.
struct StdinEvent {
  uint32_t id = 0;
  std::string chunk;  // payload of this packet
  std::string all;    // everything received so far, this chunk included
  bool closed = false;
};

// How the fake runner answers one start request.
struct ChildScript {
  enum class Answer { Start, FailStart, NeverAnswer };
  // When a started child delivers `output` and `exitCode`.
  enum class Finish { Immediately, OnStdinClose, WhenTestSays };

  Answer answer = Answer::Start;
  int32_t startError = 2;  // errno sent with StartFailed
  uint32_t pid = 0;        // 0: the runner picks a fresh one
  std::vector<OutputChunk> output;
  Finish finish = Finish::Immediately;
  int32_t exitCode = 0;
  // Optional; runs on the runner thread after each StdinData packet and may
  // call sendOutput/exitChild (those are queued behind it).
  std::function<void(FakeHost& host, const StdinEvent& event)> onStdin;

  // Started, then `out` on stdout, `err` on stderr, then Exited(code).
  static ChildScript exits(int32_t code, std::string out = {}, std::string err = {});
  // Like exits(), but output and exit follow only once stdin is closed.
  static ChildScript exitsOnStdinClose(int32_t code, std::string out = {}, std::string err = {});
  // StartFailed with `errorNumber`.
  static ChildScript failsToStart(int32_t errorNumber);
  // Started, then nothing until the test calls sendOutput/exitChild.
  static ChildScript runsUntilTold();
  // The start request is accepted but never answered (shutdown tests).
  static ChildScript neverAnswers();
};

// Thread-safe: every record, script and the runner's queue are guarded by
// `mu_`; the runner thread calls the sink and stdin handlers with no lock
// held, so a delivery may re-enter the callback.
class FakeHost {
 public:
  // Where the runner's packets go; by default ko::ipc::receive.
  using Sink = std::function<void(const unsigned char* packet, size_t length)>;
  using IoctlEntry = int32_t (*)(void* ioctlRecord);

  FakeHost();
  // Uninstalls: stops the runner, clears the callback and resets the ipc
  // registry with ko::ipc::shutdown(false).
  ~FakeHost();
  FakeHost(const FakeHost&) = delete;
  FakeHost& operator=(const FakeHost&) = delete;

  // Usable as ko::core::HostCallback; forwards to the live FakeHost (returns
  // 0 when there is none).
  static int32_t callback(void* message, uint64_t reserved);

  // Sets the callback with ko::core::setHostCallback and installs the ipc
  // transport (id base = module id) wrapping packets in a HostMessage
  // (target 8192, type 0) that goes through the same callback.
  void install();

  // A LoadParmsIn record carrying `callback` at offset 16, for tests that
  // call a dlopen'ed Load.
  static std::vector<unsigned char> loadParmsIn();
  // A sink that hands each packet to a plug-in's IOCTL with code 4.
  static Sink ioctlSink(IoctlEntry ioctl);
  void setSink(Sink sink);

  // Answer to every log-level query (default 0: every line is sent).
  void setThreshold(int32_t threshold);
  // Result returned for child-process packets (default 0 = accepted);
  // anything else makes the plug-in's send fail. Refused packets are still
  // recorded but not acted on.
  void setPacketResult(int32_t result);

  // Scripts, matched on args[0]. Unscripted programs get the default script,
  // which is failsToStart(2) (ENOENT) unless set otherwise.
  void setScript(const std::string& program, ChildScript script);
  void setDefaultScript(ChildScript script);

  // Queued on the runner thread, in order with everything else it delivers.
  void sendOutput(uint32_t id, int stream, const std::string& bytes);
  void exitChild(uint32_t id, int32_t code);
  void startChild(uint32_t id, uint32_t pid);          // answer a NeverAnswer start late
  void failChild(uint32_t id, int32_t errorNumber);    // likewise, as StartFailed
  // Any packet at all (raw, for malformed-input tests); delivered as given.
  void deliverRaw(std::string packet);

  // Snapshots; safe from any thread.
  std::vector<LogRecord> logs() const;
  std::vector<DocumentRecord> documents() const;
  std::vector<PacketRecord> packets() const;
  std::vector<StartRecord> starts() const;
  std::string stdinOf(uint32_t id) const;
  bool stdinClosed(uint32_t id) const;
  bool hasLog(const std::string& substring) const;
  void clearRecords();

  // Waits with a deadline; true as soon as the condition holds.
  bool waitForLog(const std::string& substring, Timeout timeout) const;
  bool waitForDocument(const std::string& substring, Timeout timeout) const;
  // Start request whose args[0] is `program`; fills `out` when given.
  bool waitForStart(const std::string& program, Timeout timeout, StartRecord* out = nullptr) const;
  // `predicate` runs without the fake's lock held (it may call the accessors
  // above); it is re-tested on every host event and at least every 10 ms.
  bool waitUntil(const std::function<bool()>& predicate, Timeout timeout) const;
  // True once the runner has delivered everything queued so far.
  bool waitIdle(Timeout timeout) const;

 private:
  struct ChildRecord {
    std::string stdinBytes;
    bool stdinClosed = false;
    ChildScript script;
  };

  int32_t handleMessage(const ko::core::HostMessage& message);
  int32_t handlePacket(const unsigned char* bytes, size_t length);
  void handleStart(const ko::ipc::PacketHeader& header, const std::string& payload) REQUIRES(mu_);
  void handleStdin(const ko::ipc::PacketHeader& header, const std::string& payload) REQUIRES(mu_);
  void queueFinish(uint32_t id, const ChildScript& script) REQUIRES(mu_);
  void queuePacket(uint32_t type, uint32_t id, uint32_t value, const std::string& payload) REQUIRES(mu_);
  void queueDelivery(std::string packet) REQUIRES(mu_);
  void queueTask(std::function<void()> task) REQUIRES(mu_);
  void runnerLoop();
  void noteChange() REQUIRES(mu_);
  // `changed_` is bound to `mu_`, which the analysis cannot see through.
  void waitChange() const REQUIRES(mu_) NO_THREAD_SAFETY_ANALYSIS { changed_.wait(); }
  bool waitChangeUntil(CondVar::Clock::time_point deadline) const REQUIRES(mu_) NO_THREAD_SAFETY_ANALYSIS {
    return changed_.waitUntil(deadline);
  }

  mutable Mutex mu_;
  mutable CondVar changed_{&mu_};
  uint64_t generation_ GUARDED_BY(mu_) = 0;
  int32_t threshold_ GUARDED_BY(mu_) = 0;
  int32_t packetResult_ GUARDED_BY(mu_) = 0;
  Sink sink_ GUARDED_BY(mu_);
  std::vector<LogRecord> logs_ GUARDED_BY(mu_);
  std::vector<DocumentRecord> documents_ GUARDED_BY(mu_);
  std::vector<PacketRecord> packets_ GUARDED_BY(mu_);
  std::vector<StartRecord> starts_ GUARDED_BY(mu_);
  std::map<std::string, ChildScript> scripts_ GUARDED_BY(mu_);
  ChildScript defaultScript_ GUARDED_BY(mu_);
  std::map<uint32_t, ChildRecord> children_ GUARDED_BY(mu_);
  uint32_t nextPid_ GUARDED_BY(mu_) = 5000;
  std::deque<std::function<void()>> tasks_ GUARDED_BY(mu_);
  bool runnerBusy_ GUARDED_BY(mu_) = false;
  bool stopping_ GUARDED_BY(mu_) = false;
  std::thread runner_;
};

}  // namespace sorvik::testing
