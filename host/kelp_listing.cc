#include "host/kelp_listing.h"

#include <sys/stat.h>

#include <algorithm>
#include <cctype>
#include <ctime>
#include <filesystem>

namespace sorvik::kelp {
namespace fs = std::filesystem;

namespace {

std::string utcText(int64_t seconds) {
  const std::time_t t = static_cast<std::time_t>(seconds);
  std::tm utc{};
  ::gmtime_r(&t, &utc);
  char text[32];
  std::strftime(text, sizeof(text), "%Y-%m-%dT%H:%M:%SZ", &utc);
  return text;
}

std::string lower(std::string text) {
  std::transform(text.begin(), text.end(), text.begin(), [](unsigned char c) { return std::tolower(c); });
  return text;
}

std::string trim(const std::string& text) {
  const size_t begin = text.find_first_not_of(" \t\r");
  if (begin == std::string::npos) return std::string();
  const size_t end = text.find_last_not_of(" \t\r");
  return text.substr(begin, end - begin + 1);
}

}  // namespace

std::vector<FileEntry> collectFiles(const std::vector<std::string>& drives, int64_t start, int64_t end) {
  std::vector<FileEntry> files;
  for (const std::string& drive : drives) {
    std::error_code ec;
    fs::recursive_directory_iterator it(drive, fs::directory_options::skip_permission_denied, ec);
    for (; !ec && it != fs::recursive_directory_iterator(); it.increment(ec)) {
      struct stat info;
      if (::lstat(it->path().c_str(), &info) != 0 || !S_ISREG(info.st_mode)) continue;
      const int64_t modified = static_cast<int64_t>(info.st_mtime);
      if (modified < start || modified > end) continue;
      files.push_back(FileEntry{it->path().string(), modified, static_cast<uint64_t>(info.st_size)});
    }
  }
  std::sort(files.begin(), files.end(), [](const FileEntry& a, const FileEntry& b) { return a.path < b.path; });
  return files;
}

std::string formatListing(const std::vector<FileEntry>& files) {
  std::string text;
  for (const FileEntry& f : files) text += utcText(f.modified) + "\t" + std::to_string(f.size) + "\t" + f.path + "\n";
  return text;
}

bool parseHttpRequest(const std::string& text, HttpRequest* request) {
  const size_t lineEnd = text.find('\n');
  if (lineEnd == std::string::npos) return false;
  const std::string line = trim(text.substr(0, lineEnd));
  const size_t sp1 = line.find(' ');
  const size_t sp2 = sp1 == std::string::npos ? std::string::npos : line.find(' ', sp1 + 1);
  if (sp1 == std::string::npos || sp2 == std::string::npos) return false;
  HttpRequest result;
  result.method = line.substr(0, sp1);
  result.path = line.substr(sp1 + 1, sp2 - sp1 - 1);
  if (line.compare(sp2 + 1, 5, "HTTP/") != 0 || result.path.empty()) return false;
  size_t pos = lineEnd + 1;
  while (pos < text.size()) {
    size_t next = text.find('\n', pos);
    if (next == std::string::npos) next = text.size();
    const std::string header = trim(text.substr(pos, next - pos));
    pos = next + 1;
    if (header.empty()) break;
    const size_t colon = header.find(':');
    if (colon == std::string::npos) return false;
    result.headers[lower(trim(header.substr(0, colon)))] = trim(header.substr(colon + 1));
  }
  *request = std::move(result);
  return true;
}

bool tokenMatches(const std::string& expected, const std::string& given) {
  unsigned char diff = expected.size() == given.size() ? 0 : 1;
  for (size_t i = 0; i < given.size(); ++i) {
    diff |= static_cast<unsigned char>(given[i] ^ expected[i % (expected.empty() ? 1 : expected.size())]);
  }
  return diff == 0 && !expected.empty();
}

std::string errorResponse(int status, const std::string& reason) {
  const std::string body = reason + "\n";
  return "HTTP/1.0 " + std::to_string(status) + " " + reason +
         "\r\nContent-Type: text/plain\r\nConnection: close\r\nContent-Length: " + std::to_string(body.size()) +
         "\r\n\r\n" + body;
}

std::string respond(const HttpRequest& request, const std::string& token,
                    const std::function<std::string()>& listing) {
  if (request.method != "GET") return errorResponse(405, "Method Not Allowed");
  if (request.path != "/files") return errorResponse(404, "Not Found");
  const auto auth = request.headers.find("authorization");
  const std::string prefix = "Bearer ";
  const std::string given = auth != request.headers.end() && auth->second.compare(0, prefix.size(), prefix) == 0
                                ? auth->second.substr(prefix.size())
                                : std::string();
  if (!tokenMatches(token, given)) {
    return errorResponse(401, "Unauthorized");
  }
  const std::string body = listing();
  return "HTTP/1.0 200 OK\r\nContent-Type: text/plain\r\nConnection: close\r\nContent-Length: " +
         std::to_string(body.size()) + "\r\n\r\n" + body;
}

}  // namespace sorvik::kelp
