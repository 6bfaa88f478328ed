#include "Sorvik/service/state_file.h"

#include <cstdio>
#include <memory>
#include <system_error>
#include <thread>

#include "Sorvik/platform/platform.h"
#include "Sorvik/plugin/xml_envelope.h"

namespace sorvik {
namespace {

// The same limit the host documents get: TinyXML's parser recurses per level.
constexpr int kMaxFileDepth = 100;

struct FileCloser {
  void operator()(FILE* f) const { std::fclose(f); }
};

bool readWholeFile(const std::string& path, std::string* bytes) {
  std::unique_ptr<FILE, FileCloser> file(std::fopen(path.c_str(), "rb"));
  if (!file) return false;
  char buffer[4096];
  size_t n = 0;
  while ((n = std::fread(buffer, 1, sizeof(buffer), file.get())) > 0) bytes->append(buffer, n);
  return std::ferror(file.get()) == 0;
}

void markUnopenable(TiXmlDocument& doc) {
  doc.ClearError();
  doc.SetError(TiXmlBase::TIXML_ERROR_OPENING_FILE, nullptr, nullptr, TIXML_ENCODING_UNKNOWN);
}

std::string pendingPathOf(const std::string& path) { return path + ".pending"; }

}  // namespace

FileInUseRegistry& FileInUseRegistry::instance() {
  // Destroyed with the library, so that a host's reload does not leak it.
  static FileInUseRegistry registry;
  return registry;
}

void FileInUseRegistry::acquire(const std::string& path) {
  for (;;) {
    {
      MutexLock lock(&mu_);
      if (paths_.insert(path).second) return;
    }
    std::this_thread::yield();
  }
}

void FileInUseRegistry::release(const std::string& path) {
  MutexLock lock(&mu_);
  paths_.erase(path);
}

FileInUse::FileInUse(const std::string& path) : path_(path) { FileInUseRegistry::instance().acquire(path_); }

FileInUse::~FileInUse() { FileInUseRegistry::instance().release(path_); }

bool parseDocumentFile(TiXmlDocument& doc, const std::string& path) {
  // Read first rather than TiXmlDocument::LoadFile: the nesting check must
  // see the text before the parser does.
  doc.Clear();
  std::string bytes;
  if (!readWholeFile(path, &bytes)) {
    markUnopenable(doc);
    return false;
  }
  if (ko::core::nestsDeeperThan(bytes.data(), bytes.size(), kMaxFileDepth)) {
    doc.ClearError();
    doc.SetError(TiXmlBase::TIXML_ERROR, nullptr, nullptr, TIXML_ENCODING_UNKNOWN);
    return false;
  }
  doc.Parse(bytes.c_str(), nullptr, TIXML_DEFAULT_ENCODING);
  return !doc.Error();
}

bool loadDocument(TiXmlDocument& doc, const std::string& path) {
  FileInUse hold(path);
  const std::string pending = pendingPathOf(path);
  // A pending file holding only the declaration was cut short; it must not
  // replace a good file.
  if (parseDocumentFile(doc, pending) && doc.RootElement() != nullptr) {
    platform::current().replaceFile(pending, path);
    return true;
  }
  return parseDocumentFile(doc, path);
}

bool saveDocument(TiXmlDocument& doc, const std::string& path, std::string* errorText) {
  const std::string text = ko::core::printPretty(doc);
  FileInUse hold(path);
  const std::string pending = pendingPathOf(path);
  platform::Platform& os = platform::current();

  std::string error = os.writeFileThrough(pending, text);
  if (!error.empty()) {
    os.removeFile(pending);
  } else if (const int err = os.replaceFile(pending, path); err != 0) {
    error = "Failed to rename .xml.pending to .xml file " + std::to_string(err) + " - " +
            std::generic_category().message(err);
  }
  if (error.empty()) return true;
  markUnopenable(doc);
  if (errorText != nullptr) *errorText = error;
  return false;
}

}  // namespace sorvik
