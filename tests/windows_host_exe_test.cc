// sorvik-host.exe as a program: the restart event that the sample scripts
// set restarts the plug-in, and the script then ends the host with 0.

#include <windows.h>

#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <string>

namespace {

namespace fs = std::filesystem;

fs::path besideThisExecutable(const std::string& name) {
  char self[MAX_PATH];
  return fs::path(std::string(self, ::GetModuleFileNameA(nullptr, self, sizeof self))).parent_path() / name;
}

TEST(WindowsHostExeTest, RestartEventRestartsThePlugin) {
  const fs::path dir = fs::temp_directory_path() / ("sorvik-host-exe-" + std::to_string(::GetCurrentProcessId()));
  fs::remove_all(dir);
  fs::create_directories(dir);
  std::ofstream(dir / "script.txt") << "wait FailbackStatus\nwait -t 20 plug-in restarted\nwait FailbackStatus\nquit\n";

  std::string cmd = "\"" + besideThisExecutable("sorvik-host.exe").string() + "\" --child-output null -s \"" +
                    (dir / "script.txt").string() + "\" -C \"" + dir.string() + "\" \"" +
                    besideThisExecutable("sorvik.dll").string() + "\"";
  STARTUPINFOA si{};
  si.cb = sizeof si;
  PROCESS_INFORMATION pi{};
  ASSERT_TRUE(::CreateProcessA(nullptr, cmd.data(), nullptr, nullptr, FALSE, 0, nullptr, nullptr, &si, &pi));
  ::CloseHandle(pi.hThread);

  // The host creates its event once it runs; until then, wait on the host
  // itself in short steps (it must not end first).
  const std::string name = "Local\\sorvik-host-restart-" + std::to_string(pi.dwProcessId);
  HANDLE restart = nullptr;
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (restart == nullptr && std::chrono::steady_clock::now() < deadline &&
         ::WaitForSingleObject(pi.hProcess, 20) == WAIT_TIMEOUT) {
    restart = ::OpenEventA(EVENT_MODIFY_STATE, FALSE, name.c_str());
  }
  ASSERT_NE(restart, nullptr) << "no event " << name;
  EXPECT_TRUE(::SetEvent(restart));
  ::CloseHandle(restart);

  DWORD code = 99;
  EXPECT_EQ(::WaitForSingleObject(pi.hProcess, 30000), WAIT_OBJECT_0);
  ::GetExitCodeProcess(pi.hProcess, &code);
  EXPECT_EQ(code, 0u) << "the script's wait for the restart failed";
  ::TerminateProcess(pi.hProcess, 9);
  ::CloseHandle(pi.hProcess);
  std::error_code ignored;
  fs::remove_all(dir, ignored);
}

}  // namespace
