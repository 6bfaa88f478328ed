// kelp's listening socket on Winsock; the same contract as the POSIX
// server (host/kelp_posix_server.h), which declares the class.

#include <winsock2.h>
#include <ws2tcpip.h>

#include <chrono>
#include <string>

#include "host/kelp_posix_server.h"

namespace sorvik::kelp {
namespace {

constexpr size_t kMaxRequest = 8192;
constexpr int kRequestTimeoutMs = 5000;

// Winsock socket handles fit in 32 bits; the shared class keeps an int.
SOCKET toSocket(int fd) { return static_cast<SOCKET>(static_cast<unsigned int>(fd)); }

std::string lastSocketError() { return "error " + std::to_string(::WSAGetLastError()); }

bool startWinsock(std::string* error) {
  static const int started = [] {
    WSADATA data;
    return ::WSAStartup(MAKEWORD(2, 2), &data);
  }();
  if (started != 0) *error = "WSAStartup failed, error " + std::to_string(started);
  return started == 0;
}

int bindLoopback(int port, int* bound, std::string* error) {
  // Not inheritable: the agent's own children must not keep the port.
  const SOCKET s = ::WSASocketA(AF_INET, SOCK_STREAM, IPPROTO_TCP, nullptr, 0, WSA_FLAG_NO_HANDLE_INHERIT);
  if (s == INVALID_SOCKET) {
    *error = "socket: " + lastSocketError();
    return -1;
  }
  // Exclusive, unlike SO_REUSEADDR, which on Windows lets a second socket
  // take a port that is in use.
  const BOOL yes = TRUE;
  ::setsockopt(s, SOL_SOCKET, SO_EXCLUSIVEADDRUSE, reinterpret_cast<const char*>(&yes), sizeof(yes));
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  address.sin_port = htons(static_cast<u_short>(port));
  if (::bind(s, reinterpret_cast<sockaddr*>(&address), sizeof(address)) != 0 || ::listen(s, 16) != 0) {
    *error = "bind/listen on port " + std::to_string(port) + ": " + lastSocketError();
    ::closesocket(s);
    return -1;
  }
  int length = sizeof(address);
  ::getsockname(s, reinterpret_cast<sockaddr*>(&address), &length);
  *bound = ntohs(address.sin_port);
  return static_cast<int>(s);
}

// Reads until the blank line that ends the headers, the size limit, the
// time limit or the end of the stream. True when the request is complete.
bool readRequest(SOCKET s, std::string* text) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(kRequestTimeoutMs);
  char buffer[1024];
  while (text->size() < kMaxRequest) {
    if (text->find("\r\n\r\n") != std::string::npos || text->find("\n\n") != std::string::npos) return true;
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return false;
    WSAPOLLFD p{};
    p.fd = s;
    p.events = POLLRDNORM;
    if (::WSAPoll(&p, 1, static_cast<INT>(left.count())) <= 0) return false;
    const int n = ::recv(s, buffer, sizeof(buffer), 0);
    if (n <= 0) return false;
    text->append(buffer, static_cast<size_t>(n));
  }
  return false;
}

void sendAll(SOCKET s, const std::string& data) {
  size_t sent = 0;
  while (sent < data.size()) {
    const size_t chunk = data.size() - sent > 65536 ? 65536 : data.size() - sent;
    const int n = ::send(s, data.data() + sent, static_cast<int>(chunk), 0);
    if (n <= 0) return;
    sent += static_cast<size_t>(n);
  }
}

}  // namespace

ListingServer::~ListingServer() {
  if (fd_ >= 0) ::closesocket(toSocket(fd_));
}

int ListingServer::listen(int port, std::string* error) {
  if (!startWinsock(error)) return -1;
  int bound = 0;
  if (port != 0) fd_ = bindLoopback(port, &bound, error);
  if (fd_ < 0) fd_ = bindLoopback(0, &bound, error);
  return fd_ < 0 ? -1 : bound;
}

void ListingServer::serve(const std::function<std::string(const std::string&, bool complete)>& handle) {
  while (true) {
    const SOCKET client = ::accept(toSocket(fd_), nullptr, nullptr);
    if (client == INVALID_SOCKET) {
      if (::WSAGetLastError() == WSAECONNRESET || ::WSAGetLastError() == WSAEINTR) continue;
      return;
    }
    const DWORD sendLimitMs = 30000;
    ::setsockopt(client, SOL_SOCKET, SO_SNDTIMEO, reinterpret_cast<const char*>(&sendLimitMs), sizeof(sendLimitMs));
    std::string request;
    const bool complete = readRequest(client, &request);
    sendAll(client, handle(request, complete));
    ::closesocket(client);
  }
}

}  // namespace sorvik::kelp
