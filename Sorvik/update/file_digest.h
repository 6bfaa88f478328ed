#pragma once

// MD5 of a whole file, hashed in place from a memory mapping.

#include <cstddef>
#include <string>

namespace sorvik {

// 32 lower-case hex digits of the MD5 (RFC 1321) of `size` bytes at `data`.
std::string md5Hex(const void* data, size_t size);

struct FileDigest {
  enum class Outcome {
    Ok,
    MappingFailed,  // could not open or map; `error` holds the reason
    NoData,         // the mapping came back without bytes
    Failed,         // anything else (memory exhaustion...); `error` says what
  };
  Outcome outcome = Outcome::Failed;
  std::string hex;    // set when Ok
  std::string error;
};

// Maps the file read-write (it must exist and be writable, as a bundle still
// owned by the update is) and hashes every byte in one pass. The mapping and
// the file are released before this returns.
FileDigest md5OfFile(const std::string& path);

}  // namespace sorvik
