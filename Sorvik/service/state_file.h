#pragma once

// Reading and writing the small XML files that carry the plug-in's state
// across restarts. A save goes to "<path>.pending" first and is then renamed
// over the file, so a crash leaves either the old or the new document; a load
// promotes a complete pending file left behind by such a crash.

#include <set>
#include <string>

#include <tinyxml.h>

#include "Sorvik/platform/mutex.h"

namespace sorvik {

// The set of file paths some thread is loading or saving right now, so that
// two threads never work on the same file at once. Process-wide; it has its
// own mutex and is never taken while stateMutex is held.
class FileInUseRegistry {
 public:
  static FileInUseRegistry& instance();

  // Returns once `path` was absent and has been entered (busy retry).
  void acquire(const std::string& path);
  void release(const std::string& path);

 private:
  Mutex mu_;
  std::set<std::string> paths_ GUARDED_BY(mu_);
};

// Holds a path in FileInUseRegistry for the lifetime of the object.
class FileInUse {
 public:
  explicit FileInUse(const std::string& path);
  ~FileInUse();
  FileInUse(const FileInUse&) = delete;
  FileInUse& operator=(const FileInUse&) = delete;

 private:
  const std::string path_;
};

// Parses the file at `path` into `doc`. False (with the document's error set)
// when the file cannot be opened, does not parse, or nests deeper than the
// host documents may.
bool parseDocumentFile(TiXmlDocument& doc, const std::string& path);

// Loads `path` into `doc`; a pending file that parses and has a root element
// is renamed over `path` first and is what gets loaded.
bool loadDocument(TiXmlDocument& doc, const std::string& path);

// Writes `doc` pretty-printed to `path` atomically and durably. On failure the
// document carries TinyXML's "cannot open file" error and `errorText`, when
// given, receives what went wrong ("create error 13", "Failed to rename ...").
bool saveDocument(TiXmlDocument& doc, const std::string& path, std::string* errorText = nullptr);

}  // namespace sorvik
