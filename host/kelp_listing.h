#pragma once

// What kelp serves: the files on the drives that were modified within the
// failover period, behind a token check, over a minimal HTTP/1.0 exchange.
//
//   GET /files HTTP/1.0
//   Authorization: Bearer <token>
//
// answers 200 with one line per file: modification time (UTC), size in
// bytes and path, separated by tabs. A missing or wrong token gives 401.

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <vector>

namespace sorvik::kelp {

struct FileEntry {
  std::string path;
  int64_t modified = 0;  // seconds since 1970 UTC
  uint64_t size = 0;
};

// Regular files below the drives (symbolic links are not followed) with a
// modification time within [start, end]. Unreadable parts are skipped.
std::vector<FileEntry> collectFiles(const std::vector<std::string>& drives, int64_t start, int64_t end);
std::string formatListing(const std::vector<FileEntry>& files);

struct HttpRequest {
  std::string method;
  std::string path;
  std::map<std::string, std::string> headers;  // names in lower case
};

// Parses the request line and headers (up to the blank line); false when
// they are malformed.
bool parseHttpRequest(const std::string& text, HttpRequest* request);

// Compares in time independent of where the texts differ.
bool tokenMatches(const std::string& expected, const std::string& given);

// The complete response for one request.
std::string respond(const HttpRequest& request, const std::string& token,
                    const std::function<std::string()>& listing);
std::string errorResponse(int status, const std::string& reason);

}  // namespace sorvik::kelp
