#include "tests/support/http_file_server.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/sendfile.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>

namespace sorvik::testing {
namespace {

int listenOnLoopback(uint16_t* port) {
  const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof addr;
  if (::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 || ::listen(fd, 64) != 0 ||
      ::getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
    ::close(fd);
    return -1;
  }
  *port = ntohs(addr.sin_port);
  return fd;
}

bool sendAll(int fd, const std::string& text) {
  size_t done = 0;
  while (done < text.size()) {
    const ssize_t n = ::send(fd, text.data() + done, text.size() - done, MSG_NOSIGNAL);
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

}  // namespace

HttpFileServer::HttpFileServer(std::string root) : root_(std::move(root)) {
  listenFd_ = listenOnLoopback(&port_);
  if (listenFd_ >= 0) acceptor_ = std::thread([this] { acceptLoop(); });
}

HttpFileServer::~HttpFileServer() {
  stopping_ = true;
  if (listenFd_ >= 0) ::shutdown(listenFd_, SHUT_RDWR);
  if (acceptor_.joinable()) acceptor_.join();
  if (listenFd_ >= 0) ::close(listenFd_);
  std::vector<std::thread> workers;
  {
    MutexLock lock(&mu_);
    workers.swap(workers_);
  }
  for (auto& t : workers) t.join();
}

std::string HttpFileServer::url(const std::string& name) const {
  return "http://127.0.0.1:" + std::to_string(port_) + "/" + name;
}

void HttpFileServer::acceptLoop() {
  while (!stopping_) {
    pollfd p{listenFd_, POLLIN, 0};
    if (::poll(&p, 1, 100) <= 0) continue;
    const int fd = ::accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) continue;
    MutexLock lock(&mu_);
    workers_.emplace_back([this, fd] { serve(fd); });
  }
}

void HttpFileServer::serve(int fd) {
  std::string request;
  char buf[4096];
  while (request.find("\r\n\r\n") == std::string::npos && request.size() < 65536) {
    pollfd p{fd, POLLIN, 0};
    if (::poll(&p, 1, 5000) <= 0) break;
    const ssize_t n = ::recv(fd, buf, sizeof buf, 0);
    if (n <= 0) break;
    request.append(buf, static_cast<size_t>(n));
  }
  ++requests_;
  std::string path;
  if (request.compare(0, 5, "GET /") == 0) {
    const size_t end = request.find(' ', 5);
    if (end != std::string::npos) path = request.substr(5, end - 5);
  }
  const bool safe = !path.empty() && path.find("..") == std::string::npos && path.find('/') == std::string::npos;
  const int file = safe ? ::open((root_ + "/" + path).c_str(), O_RDONLY | O_CLOEXEC) : -1;
  struct stat st {};
  if (file < 0 || ::fstat(file, &st) != 0 || !S_ISREG(st.st_mode)) {
    if (file >= 0) ::close(file);
    sendAll(fd, "HTTP/1.0 404 Not Found\r\nContent-Length: 9\r\nConnection: close\r\n\r\nnot found");
    ::close(fd);
    return;
  }
  if (sendAll(fd, "HTTP/1.0 200 OK\r\nContent-Type: application/octet-stream\r\nContent-Length: " +
                      std::to_string(st.st_size) + "\r\nConnection: close\r\n\r\n")) {
    off_t offset = 0;
    while (offset < st.st_size) {
      const ssize_t n = ::sendfile(fd, file, &offset, static_cast<size_t>(st.st_size - offset));
      if (n <= 0) break;
    }
  }
  ::close(file);
  ::shutdown(fd, SHUT_WR);
  ::close(fd);
}

uint16_t unusedLocalPort() {
  uint16_t port = 0;
  const int fd = listenOnLoopback(&port);
  if (fd >= 0) ::close(fd);
  return port;
}

}  // namespace sorvik::testing
