#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "host/kelp_listing.h"
#include "host/kelp_options.h"
#include "tests/support/host_run.h"

extern char** environ;

namespace sorvik::kelp {
namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;
constexpr auto kLimit = std::chrono::seconds(10);

// kelp run as a child with pipes on stdin and stdout; killed if a test
// leaves it running.
class KelpProcess {
 public:
  ~KelpProcess() {
    if (pid_ > 0 && !reaped_) {
      ::kill(pid_, SIGKILL);
      ::waitpid(pid_, nullptr, 0);
    }
    for (int fd : {in_, out_, pidFd_}) {
      if (fd >= 0) ::close(fd);
    }
  }
  bool start(const std::string& program, const std::vector<std::string>& args) {
    int in[2];
    int out[2];
    if (::pipe2(in, O_CLOEXEC) != 0 || ::pipe2(out, O_CLOEXEC) != 0) return false;
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, in[0], 0);
    posix_spawn_file_actions_adddup2(&actions, out[1], 1);
    std::vector<std::string> all = {program};
    all.insert(all.end(), args.begin(), args.end());
    std::vector<char*> argv;
    for (std::string& a : all) argv.push_back(&a[0]);
    argv.push_back(nullptr);
    const int rc = ::posix_spawn(&pid_, program.c_str(), &actions, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    ::close(in[0]);
    ::close(out[1]);
    in_ = in[1];
    out_ = out[0];
    if (rc != 0) return false;
    pidFd_ = static_cast<int>(::syscall(SYS_pidfd_open, pid_, 0));
    return pidFd_ >= 0;
  }
  void writeText(const std::string& text) { ASSERT_EQ(::write(in_, text.data(), text.size()), (ssize_t)text.size()); }
  // The first line of stdout, or "" when none came in time.
  std::string readLine() {
    std::string line;
    const auto deadline = Clock::now() + kLimit;
    char c;
    while (Clock::now() < deadline) {
      pollfd p{out_, POLLIN, 0};
      if (::poll(&p, 1, 100) <= 0) continue;
      if (::read(out_, &c, 1) != 1 || c == '\n') break;
      line += c;
    }
    return line;
  }
  // Exit code, 128+signal, or -1 when it did not end in time.
  int waitExit() {
    pollfd p{pidFd_, POLLIN, 0};
    if (::poll(&p, 1, static_cast<int>(std::chrono::milliseconds(kLimit).count())) != 1) return -1;
    int status = 0;
    ::waitpid(pid_, &status, 0);
    reaped_ = true;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  }
  pid_t pid() const { return pid_; }

 private:
  pid_t pid_ = -1;
  int in_ = -1;
  int out_ = -1;
  int pidFd_ = -1;
  bool reaped_ = false;
};

std::string httpGet(int port, const std::string& headers) {
  const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_port = htons(static_cast<uint16_t>(port));
  a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  std::string response;
  if (::connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof(a)) == 0) {
    const std::string request = "GET /files HTTP/1.0\r\n" + headers + "\r\n";
    ::send(fd, request.data(), request.size(), MSG_NOSIGNAL);
    const auto deadline = Clock::now() + kLimit;
    char buffer[4096];
    while (Clock::now() < deadline) {
      pollfd p{fd, POLLIN, 0};
      if (::poll(&p, 1, 100) <= 0) continue;
      const ssize_t n = ::recv(fd, buffer, sizeof(buffer), 0);
      if (n <= 0) break;
      response.append(buffer, static_cast<size_t>(n));
    }
  }
  ::close(fd);
  return response;
}

void writeFile(const fs::path& path, const std::string& text) { std::ofstream(path) << text; }

std::string utc(int64_t seconds) {
  const std::time_t t = static_cast<std::time_t>(seconds);
  std::tm tm{};
  ::gmtime_r(&t, &tm);
  char text[32];
  std::strftime(text, sizeof(text), "%Y-%m-%dT%H:%M:%SZ", &tm);
  return text;
}

class KelpTest : public ::testing::Test {
 protected:
  void SetUp() override { dir_ = sorvik::testing::makeTempDir("kelp"); }
  void TearDown() override { fs::remove_all(dir_); }
  fs::path dir_;
};

TEST(KelpOptionsTest, ParsesTheCommandLinesThePlugInUses) {
  int64_t t = 0;
  ASSERT_TRUE(parseUtcTimestamp("2023-11-14T22:13:20Z", &t));
  EXPECT_EQ(t, 1700000000);
  EXPECT_FALSE(parseUtcTimestamp("2023-11-14 22:13:20", &t));
  EXPECT_EQ(splitDriveList("C:\\\\,D:\\\\data,,/srv/a"), (std::vector<std::string>{"C:\\", "D:\\data", "/srv/a"}));

  Options o;
  std::string error;
  ASSERT_TRUE(parseOptions({"-x", "-start", "2023-11-14T22:13:20Z", "-end", "2023-11-14T23:13:20Z", "-drives",
                            "/a,/b", "-port", "7066"},
                           &o, &error))
      << error;
  EXPECT_EQ(o.port, 7066);
  EXPECT_FALSE(o.deleteMode);
  ASSERT_TRUE(parseOptions({"-x", "-delete", "-start", "2023-11-14T22:13:20Z", "-end", "2023-11-14T23:13:20Z",
                            "-drives", "/a"},
                           &o, &error));
  EXPECT_TRUE(o.deleteMode);
  EXPECT_FALSE(parseOptions({"-start", "2023-11-14T23:13:20Z", "-end", "2023-11-14T22:13:20Z", "-drives", "/a"}, &o,
                            &error));
  EXPECT_FALSE(parseOptions({"-delete", "-drives", ""}, &o, &error));
  EXPECT_FALSE(parseOptions({"-delete", "-drives", "/a", "-bogus"}, &o, &error));
}

TEST(KelpListingTest, ChecksTheTokenAndTheRequest) {
  HttpRequest r;
  ASSERT_TRUE(parseHttpRequest("GET /files HTTP/1.1\r\nAuthorization: Bearer s3cret\r\n\r\n", &r));
  const auto listing = [] { return std::string("list\n"); };
  EXPECT_EQ(respond(r, "s3cret", listing).substr(0, 15), "HTTP/1.0 200 OK");
  EXPECT_NE(respond(r, "s3cret", listing).find("\r\n\r\nlist\n"), std::string::npos);
  EXPECT_EQ(respond(r, "s3cre", listing).substr(0, 12), "HTTP/1.0 401");
  EXPECT_EQ(respond(r, "", listing).substr(0, 12), "HTTP/1.0 401");
  r.path = "/etc";
  EXPECT_EQ(respond(r, "s3cret", listing).substr(0, 12), "HTTP/1.0 404");
  EXPECT_FALSE(parseHttpRequest("garbage\r\n\r\n", &r));
}

TEST_F(KelpTest, PrintsItsPortFirstAndListsFilesOfThePeriodForTheRightToken) {
  const fs::path drive = dir_ / "drive";
  fs::create_directories(drive / "sub");
  writeFile(drive / "new.txt", "12345");
  writeFile(drive / "sub" / "inner.txt", "x");
  writeFile(drive / "old.txt", "old");
  const timespec times[2] = {{1000000000, 0}, {1000000000, 0}};
  ASSERT_EQ(::utimensat(AT_FDCWD, (drive / "old.txt").c_str(), times, 0), 0);
  fs::create_symlink("/etc", drive / "link");  // not followed

  // Hold a port so that kelp has to fall back to another one.
  const int holder = ::socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof(a);
  ASSERT_EQ(::bind(holder, reinterpret_cast<sockaddr*>(&a), sizeof(a)), 0);
  ASSERT_EQ(::listen(holder, 1), 0);
  ::getsockname(holder, reinterpret_cast<sockaddr*>(&a), &len);
  const int taken = ntohs(a.sin_port);

  // Started through a symlink, as the plug-in's ./kelp usually is.
  fs::create_symlink(KELP_PATH, dir_ / "kelp");
  const int64_t now = static_cast<int64_t>(std::time(nullptr));
  KelpProcess kelp;
  ASSERT_TRUE(kelp.start((dir_ / "kelp").string(), {"-x", "-start", utc(now - 3600), "-end", utc(now + 3600),
                                                    "-drives", drive.string(), "-port", std::to_string(taken)}));
  kelp.writeText("s3cret\n");
  const std::string line = kelp.readLine();
  ::close(holder);
  ASSERT_FALSE(line.empty());
  const int port = std::stoi(line);
  EXPECT_NE(port, taken);
  EXPECT_EQ(fs::read_symlink("/proc/" + std::to_string(kelp.pid()) + "/exe").filename(), "kelp");

  EXPECT_EQ(httpGet(port, "Authorization: Bearer wrong\r\n").substr(0, 12), "HTTP/1.0 401");
  EXPECT_EQ(httpGet(port, "").substr(0, 12), "HTTP/1.0 401");
  const std::string ok = httpGet(port, "Authorization: Bearer s3cret\r\n");
  ASSERT_EQ(ok.substr(0, 15), "HTTP/1.0 200 OK") << ok;
  EXPECT_NE(ok.find("\t5\t" + (drive / "new.txt").string() + "\n"), std::string::npos) << ok;
  EXPECT_NE(ok.find((drive / "sub" / "inner.txt").string()), std::string::npos);
  EXPECT_EQ(ok.find("old.txt"), std::string::npos);
  EXPECT_EQ(ok.find("passwd"), std::string::npos);

  ASSERT_EQ(::kill(kelp.pid(), SIGTERM), 0);
  EXPECT_EQ(kelp.waitExit(), 128 + SIGTERM);
}

TEST_F(KelpTest, DeleteEmptiesOnlyMarkedDrivesAndKeepsTheMarker) {
  const fs::path marked = dir_ / "marked";
  const fs::path unmarked = dir_ / "unmarked";
  const fs::path outside = dir_ / "outside";
  fs::create_directories(marked / "deep" / "er");
  fs::create_directories(unmarked);
  fs::create_directories(outside);
  writeFile(marked / ".kelp-spare", "");
  writeFile(marked / "a.mkv", "video");
  writeFile(marked / "deep" / "er" / "b.mkv", "video");
  writeFile(unmarked / "keep.mkv", "video");
  writeFile(outside / "precious", "data");
  fs::create_symlink(outside, marked / "link");

  // One unmarked directory in the list refuses the whole list.
  KelpProcess refused;
  ASSERT_TRUE(refused.start(KELP_PATH, {"-x", "-delete", "-drives", marked.string() + "," + unmarked.string()}));
  refused.writeText("plinkowarb\n");
  EXPECT_EQ(refused.waitExit(), 3);
  EXPECT_TRUE(fs::exists(unmarked / "keep.mkv"));
  EXPECT_TRUE(fs::exists(marked / "a.mkv"));

  KelpProcess wipe;
  ASSERT_TRUE(wipe.start(KELP_PATH, {"-x", "-delete", "-drives", marked.string()}));
  wipe.writeText("plinkowarb\n");
  EXPECT_EQ(wipe.waitExit(), 0);
  std::vector<std::string> left;
  for (const auto& e : fs::directory_iterator(marked)) left.push_back(e.path().filename().string());
  EXPECT_EQ(left, std::vector<std::string>{".kelp-spare"});
  EXPECT_TRUE(fs::exists(outside / "precious"));
}

}  // namespace
}  // namespace sorvik::kelp
