// A whole failback session with the plug-in DLL in the Windows host: the
// host's session and process runner load sorvik.dll, run the decommission
// script and kelp.exe for real, and the test checks what the host and the
// processes saw, and what "update.xml" holds afterwards.

#include <winsock2.h>
#include <windows.h>

#include <gtest/gtest.h>

#include <chrono>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include <tinyxml.h>

#include "Sorvik/platform/mutex.h"
#include "Sorvik/platform/platform.h"
#include "host/sorvik_host_documents.h"
#include "host/sorvik_host_events.h"
#include "host/sorvik_host_session.h"
#include "tests/windows_test_process.h"

namespace sorvik::host {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr char kToken[] = "s3cret-Token";

fs::path besideThisExecutable(const std::string& name) {
  char self[MAX_PATH];
  return fs::path(std::string(self, ::GetModuleFileNameA(nullptr, self, sizeof self))).parent_path() / name;
}

std::string readFile(const fs::path& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream out;
  out << in.rdbuf();
  return out.str();
}

// The HTTP answer of the agent listening on `port`, or "" when it cannot
// be reached.
std::string askAgent(int port, const std::string& token) {
  WSADATA data;
  if (::WSAStartup(MAKEWORD(2, 2), &data) != 0) return "";
  std::string answer;
  SOCKET s = ::socket(AF_INET, SOCK_STREAM, IPPROTO_TCP);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  address.sin_port = htons(static_cast<u_short>(port));
  const DWORD limitMs = 10000;
  ::setsockopt(s, SOL_SOCKET, SO_RCVTIMEO, reinterpret_cast<const char*>(&limitMs), sizeof limitMs);
  if (::connect(s, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0) {
    const std::string request = "GET /files HTTP/1.0\r\nAuthorization: Bearer " + token + "\r\n\r\n";
    ::send(s, request.data(), static_cast<int>(request.size()), 0);
    char buffer[4096];
    int n;
    while ((n = ::recv(s, buffer, sizeof buffer, 0)) > 0) answer.append(buffer, n);
  }
  ::closesocket(s);
  ::WSACleanup();
  return answer;
}

class WindowsFailbackSessionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    // This test stops agents by their real name (it runs alone).
    ::_putenv_s("SORVIK_AGENT_IMAGE_NAME", "");
    dir_ = fs::temp_directory_path() / ("sorvik-failback-" + std::to_string(::GetCurrentProcessId()));
    fs::remove_all(dir_);
    fs::create_directories(dir_ / "scripts");
    fs::create_directories(dir_ / "drive1");
    fs::create_directories(dir_ / "other");
    std::ofstream(dir_ / "scripts" / "failover.ps1") << "# replaced by the stand-in interpreter\n";
    std::ofstream(dir_ / "drive1" / "recording.dat") << "frames";
    fs::copy_file(besideThisExecutable("kelp.exe"), dir_ / "kelp.exe");
    // The decommission script's interpreter under a name of this run only,
    // so that it can be found and ended afterwards.
    scriptHost_ = "script-host-" + std::to_string(::GetCurrentProcessId()) + ".exe";
    fs::copy_file(besideThisExecutable(SORVIK_TEST_CHILD), dir_ / scriptHost_);
    fs::copy_file(besideThisExecutable(SORVIK_TEST_CHILD), dir_ / "other" / "kelp.exe");
    // A server commissioned earlier: the state file of its last run.
    std::ofstream(dir_ / "update.xml", std::ios::binary)
        << "<?xml ?>\n<Qora Delta=\"0\">\n    <Update ID=\"3670016\" HasFailover=\"1\" FailoverState=\"104\" "
           "HasFailback=\"1\" DownloadDir=\"\" Timeout=\"600\" />\n</Qora>\n";
    previous_ = fs::current_path();
    fs::current_path(dir_);
  }

  void TearDown() override {
    std::vector<uint32_t> ids;
    platform::native().findProcessesByName({scriptHost_}, &ids);
    for (uint32_t id : ids) platform::native().terminateProcess(id, 9);
    fs::current_path(previous_);
    std::error_code ignored;
    for (int attempt = 0; attempt < 50 && fs::exists(dir_); ++attempt) fs::remove_all(dir_, ignored);
  }

  SessionOptions options() const {
    SessionOptions o;
    o.libraryPath = besideThisExecutable("sorvik.dll").string();
    o.runner.workingDir = dir_.string();
    o.runner.ps1Interpreter = (dir_ / scriptHost_).string();
    o.runner.inheritOutput = false;
    o.logThreshold = 0;
    return o;
  }

  void record(Event event) {
    {
      MutexLock lock(&mu_);
      all_.push_back(event.text);
    }
    events_.add(std::move(event));
  }

  // The text of the next event matching `expression`, or "" after 20 s.
  std::string waitFor(const std::string& expression) {
    EventPattern pattern;
    std::string error;
    EXPECT_TRUE(EventPattern::regex(expression, &pattern, &error)) << error;
    Event matched;
    if (events_.waitFor(pattern, std::chrono::steady_clock::now() + 20s, &matched) != WaitResult::Matched) {
      std::string history;
      for (const std::string& line : everything()) history += "  " + line + "\n";
      ADD_FAILURE() << "no event matched " << expression << "; events so far:\n" << history;
      return "";
    }
    return matched.text;
  }

  std::vector<std::string> everything() {
    MutexLock lock(&mu_);
    return all_;
  }

  fs::path dir_, previous_;
  std::string scriptHost_;
  EventLog events_;
  Mutex mu_;
  std::vector<std::string> all_ GUARDED_BY(mu_);
};

int numberAfter(const std::string& text, const std::string& label) {
  std::smatch m;
  if (!std::regex_search(text, m, std::regex(label + "(\\d+)"))) return -1;
  return std::stoi(m[1]);
}

TEST_F(WindowsFailbackSessionTest, DecommissionToSpareThenAgentStartAndStopsByIdAndByName) {
  HostSession session(options(), [this](Event e) { record(std::move(e)); });
  std::string error;
  ASSERT_TRUE(session.start(&error)) << error;
  ASSERT_NE(waitFor("FailoverState=\"104\""), "") << "worker did not start from the saved state";
  ASSERT_NE(waitFor("FailbackStatus"), "");

  // COMMISSIONED to RESERVE_SPARE: the host runs the decommission script, which would
  // restart the server; here the test restarts the plug-in.
  const std::string drives = storageDrivesDocument({(dir_ / "drive1").string()});
  ASSERT_TRUE(session.sendConfiguration(drives));
  ASSERT_TRUE(session.sendConfiguration(failoverStateDocument(105)));
  ASSERT_NE(waitFor("^Failover started\\.$"), "");
  ASSERT_TRUE(session.restart(&error)) << error;
  ASSERT_NE(waitFor("FailoverState=\"105\""), "") << "the restarted plug-in is not a reserve spare";
  // Commands are ignored until the restarted worker has left the pending
  // decommission behind; its last start-up report says it has.
  ASSERT_NE(waitFor("SpareResetStatus"), "");
  ASSERT_TRUE(session.sendConfiguration(drives));

  // Start: kelp.exe gets the token on its input and answers on its port.
  const int64_t now = std::time(nullptr);
  ASSERT_TRUE(session.sendCommand(agentStartDocument(now - 3600, now, kToken, "")));
  const std::string started = waitFor("Failback agent started successfully");
  const int pid = numberAfter(started, "pid=");
  const int port = numberAfter(started, "port=");
  ASSERT_GT(pid, 0) << started;
  ASSERT_GT(port, 0) << started;
  ASSERT_NE(waitFor("FailbackStatus=\"202\".*Port=\"" + std::to_string(port) + "\""), "");
  EXPECT_NE(askAgent(port, kToken).find(" 200 "), std::string::npos) << "kelp.exe did not accept the token";

  // Stop by process id: the agent ends with exit code 15, which is what the
  // runner reads and hands to the plug-in as the Exited packet's value.
  HANDLE agent = ::OpenProcess(SYNCHRONIZE | PROCESS_QUERY_LIMITED_INFORMATION, FALSE, static_cast<DWORD>(pid));
  ASSERT_NE(agent, nullptr);
  ASSERT_TRUE(session.sendCommand(agentStopDocument()));
  ASSERT_NE(waitFor("Terminating failback agent process with code 15, pid=" + std::to_string(pid)), "");
  ASSERT_NE(waitFor("Failback agent exited\\. Emit status: FAILBACK_NONE"), "");
  DWORD agentExit = 0;
  EXPECT_EQ(::WaitForSingleObject(agent, 10000), WAIT_OBJECT_0);
  EXPECT_TRUE(::GetExitCodeProcess(agent, &agentExit));
  EXPECT_EQ(agentExit, 15u);
  ::CloseHandle(agent);

  // Stop by name: Close ends every kelp.exe, also one the plug-in never started.
  sorvik::testing::OwnedProcess stranger(dir_ / "other" / "kelp.exe");
  ASSERT_TRUE(stranger.ok());
  session.shutdown();
  EXPECT_EQ(stranger.exitCode(), 15);
  bool logged = false;
  for (const std::string& line : everything()) {
    logged = logged || line == "Terminating existing failback agent process with code 15, pid=" +
                                   std::to_string(stranger.pid());
    EXPECT_EQ(line.find(kToken), std::string::npos) << "the token leaked: " << line;
  }
  EXPECT_TRUE(logged);

  // The script ran through the interpreter, and the saved state reads back.
  EXPECT_NE(readFile(dir_ / "script-runs.txt").find("scripts\\failover.ps1"), std::string::npos);
  EXPECT_FALSE(fs::exists(dir_ / "update.xml.pending"));
  TiXmlDocument saved;
  ASSERT_TRUE(saved.LoadFile((dir_ / "update.xml").string().c_str()));
  const TiXmlElement* update = saved.RootElement()->FirstChildElement("Update");
  ASSERT_NE(update, nullptr);
  EXPECT_STREQ(update->Attribute("ID"), "3670016");
  EXPECT_STREQ(update->Attribute("FailoverState"), "105");
  EXPECT_EQ(readFile(dir_ / "update.xml").rfind("</Qora>\n"), readFile(dir_ / "update.xml").size() - 8);
}

}  // namespace
}  // namespace sorvik::host
