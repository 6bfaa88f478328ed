#pragma once

// kelp's listening socket and its serving loop (POSIX sockets).

#include <functional>
#include <string>

namespace sorvik::kelp {

// Thread-compatible: one server, used from one thread.
class ListingServer {
 public:
  ListingServer() = default;
  ~ListingServer();
  ListingServer(const ListingServer&) = delete;
  ListingServer& operator=(const ListingServer&) = delete;

  // Listens on 127.0.0.1:`port`; when that port is taken (or 0), on a free
  // one. Returns the port or -1 with `error` set.
  int listen(int port, std::string* error);

  // Answers connections one after the other until the process ends. Each
  // request gets `handle(requestText)`; a client that does not finish its
  // request within a few seconds is dropped.
  void serve(const std::function<std::string(const std::string&, bool complete)>& handle);

 private:
  int fd_ = -1;
};

}  // namespace sorvik::kelp
