#pragma once

// A small HTTP/1.0 file server on 127.0.0.1 for end-to-end tests and
// benchmarks: GET /<name> answers with the file <root>/<name> (200) or 404.
// One thread per connection; the server stops and joins them on destruction.

#include <atomic>
#include <cstdint>
#include <string>
#include <thread>
#include <vector>

#include "Sorvik/platform/mutex.h"

namespace sorvik::testing {

class HttpFileServer {
 public:
  // Listens on an ephemeral port; check ok().
  explicit HttpFileServer(std::string root);
  ~HttpFileServer();
  HttpFileServer(const HttpFileServer&) = delete;
  HttpFileServer& operator=(const HttpFileServer&) = delete;

  bool ok() const { return listenFd_ >= 0; }
  uint16_t port() const { return port_; }
  std::string url(const std::string& name) const;
  // Requests answered so far (any status).
  int requests() const { return requests_.load(); }

 private:
  void acceptLoop();
  void serve(int fd);

  const std::string root_;
  int listenFd_ = -1;
  uint16_t port_ = 0;
  std::atomic<bool> stopping_{false};
  std::atomic<int> requests_{0};
  std::thread acceptor_;
  Mutex mu_;
  std::vector<std::thread> workers_ GUARDED_BY(mu_);
};

// A port on 127.0.0.1 that nothing listens on (bound, then released).
uint16_t unusedLocalPort();

}  // namespace sorvik::testing
