#include "host/kelp_posix_server.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>

namespace sorvik::kelp {
namespace {

constexpr size_t kMaxRequest = 8192;
constexpr int kRequestTimeoutMs = 5000;

int bindLoopback(int port, int* bound, std::string* error) {
  const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    *error = std::string("socket: ") + std::strerror(errno);
    return -1;
  }
  const int yes = 1;
  ::setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &yes, sizeof(yes));
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  address.sin_port = htons(static_cast<uint16_t>(port));
  if (::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)) != 0 || ::listen(fd, 16) != 0) {
    *error = std::string("bind/listen on port ") + std::to_string(port) + ": " + std::strerror(errno);
    ::close(fd);
    return -1;
  }
  socklen_t length = sizeof(address);
  ::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length);
  *bound = ntohs(address.sin_port);
  return fd;
}

// Reads until the blank line that ends the headers, the size limit, the
// time limit or the end of the stream. True when the request is complete.
bool readRequest(int fd, std::string* text) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(kRequestTimeoutMs);
  char buffer[1024];
  while (text->size() < kMaxRequest) {
    if (text->find("\r\n\r\n") != std::string::npos || text->find("\n\n") != std::string::npos) return true;
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return false;
    pollfd p{fd, POLLIN, 0};
    const int ready = ::poll(&p, 1, static_cast<int>(left.count()));
    if (ready < 0 && errno == EINTR) continue;
    if (ready <= 0) return false;
    const ssize_t n = ::recv(fd, buffer, sizeof(buffer), 0);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    text->append(buffer, static_cast<size_t>(n));
  }
  return false;
}

void sendAll(int fd, const std::string& data) {
  size_t sent = 0;
  while (sent < data.size()) {
    const ssize_t n = ::send(fd, data.data() + sent, data.size() - sent, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;
    sent += static_cast<size_t>(n);
  }
}

}  // namespace

ListingServer::~ListingServer() {
  if (fd_ >= 0) ::close(fd_);
}

int ListingServer::listen(int port, std::string* error) {
  int bound = 0;
  if (port != 0) fd_ = bindLoopback(port, &bound, error);
  if (fd_ < 0) fd_ = bindLoopback(0, &bound, error);
  return fd_ < 0 ? -1 : bound;
}

void ListingServer::serve(const std::function<std::string(const std::string&, bool complete)>& handle) {
  while (true) {
    const int client = ::accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC);
    if (client < 0) {
      if (errno == EINTR || errno == ECONNABORTED) continue;
      return;
    }
    timeval sendLimit{30, 0};
    ::setsockopt(client, SOL_SOCKET, SO_SNDTIMEO, &sendLimit, sizeof(sendLimit));
    std::string request;
    const bool complete = readRequest(client, &request);
    sendAll(client, handle(request, complete));
    ::close(client);
  }
}

}  // namespace sorvik::kelp
