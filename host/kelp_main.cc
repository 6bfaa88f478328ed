// kelp: the reference failback agent. Reads its token from the first line of
// standard input, then either serves a token-checked listing of the files
// changed during the failover period, or (-delete) empties marked spare
// drives.

#include <csignal>
#include <cstdio>
#include <iostream>
#include <string>
#include <vector>

#include "host/kelp_listing.h"
#include "host/kelp_options.h"
#include "host/kelp_posix_server.h"
#include "host/kelp_wipe.h"

namespace {

constexpr int kExitUsage = 2;

const char kUsage[] =
    "Usage: kelp [-x] -start UTC -end UTC -drives LIST [-port N]\n"
    "       kelp [-x] -delete -drives LIST [-start UTC -end UTC]\n"
    "The token is read from the first line of standard input.\n"
    "UTC times are written YYYY-MM-DDTHH:MM:SSZ; LIST separates directories with commas.\n"
    "Listing mode prints the port it listens on (127.0.0.1) as the first line of\n"
    "standard output and answers GET /files with 'Authorization: Bearer TOKEN'.\n"
    "-delete empties each directory that holds a .kelp-spare marker file (the\n"
    "marker stays) and refuses the whole list when one directory has none.\n";

int serveListing(const sorvik::kelp::Options& options, const std::string& token) {
  sorvik::kelp::ListingServer server;
  std::string error;
  const int port = server.listen(options.port, &error);
  if (port < 0) {
    std::fprintf(stderr, "kelp: cannot listen: %s\n", error.c_str());
    return 1;
  }
  // The plug-in takes the first line of standard output as the port.
  std::printf("%d\n", port);
  std::fflush(stdout);
  std::fprintf(stderr, "kelp: listening on 127.0.0.1:%d\n", port);
  server.serve([&](const std::string& request, bool complete) {
    sorvik::kelp::HttpRequest parsed;
    if (!complete || !sorvik::kelp::parseHttpRequest(request, &parsed)) {
      return sorvik::kelp::errorResponse(400, "Bad Request");
    }
    return sorvik::kelp::respond(parsed, token, [&] {
      return sorvik::kelp::formatListing(sorvik::kelp::collectFiles(options.drives, options.start, options.end));
    });
  });
  return 1;
}

}  // namespace

int main(int argc, char** argv) {
  std::signal(SIGPIPE, SIG_IGN);
  const std::vector<std::string> args(argv + 1, argv + argc);
  for (const std::string& a : args) {
    if (a == "-h" || a == "-help" || a == "--help") {
      std::fputs(kUsage, stdout);
      return 0;
    }
  }
  sorvik::kelp::Options options;
  std::string error;
  if (!sorvik::kelp::parseOptions(args, &options, &error)) {
    std::fprintf(stderr, "kelp: %s\n%s", error.c_str(), kUsage);
    return kExitUsage;
  }
  std::string token;
  const bool gotToken = static_cast<bool>(std::getline(std::cin, token));
  if (!token.empty() && token.back() == '\r') token.pop_back();
  if (options.deleteMode) {
    std::string report;
    const sorvik::kelp::WipeResult result = sorvik::kelp::wipeDrives(options.drives, &report);
    std::fputs(report.c_str(), stderr);
    if (result == sorvik::kelp::WipeResult::Done) {
      std::fprintf(stderr, "kelp: emptied %zu drive(s)\n", options.drives.size());
    }
    return static_cast<int>(result);
  }
  if (!gotToken || token.empty()) {
    std::fprintf(stderr, "kelp: no token on standard input\n");
    return kExitUsage;
  }
  return serveListing(options, token);
}
