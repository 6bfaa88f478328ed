#pragma once

// The unread output of one stream of a child. Bounded: beyond `limit`
// unread bytes the oldest are dropped, so a child whose output nobody reads
// cannot exhaust memory. Taking a piece costs time proportional to the piece:
// the read position is an offset, the consumed prefix is compacted away only
// once it outweighs what remains, and a delimiter search resumes where the
// previous unsuccessful one stopped.
//
// Not thread-safe; the owning client's mutex guards it.

#include <cstddef>
#include <string>

namespace ko::ipc {

class OutputBuffer {
 public:
  static constexpr size_t kDefaultLimit = size_t{1} << 20;

  explicit OutputBuffer(size_t limit = kDefaultLimit) : limit_(limit) {}

  // Appends `length` bytes, without their carriage returns when asked (only
  // the new bytes are scanned). Returns how many old bytes were dropped.
  size_t append(const char* bytes, size_t length, bool dropCarriageReturns);

  // When the unread bytes contain `delimiter`: sets `out` to the bytes before
  // it, consumes them and the delimiter, returns true. Else leaves `out`.
  bool takeUntil(char delimiter, std::string* out);

  // Moves every unread byte into `out`.
  void takeAll(std::string* out);

  size_t size() const { return data_.size() - start_; }
  bool empty() const { return size() == 0; }

 private:
  void compactIfWorthwhile();

  std::string data_;
  size_t start_ = 0;          // first unread byte
  size_t searched_ = 0;       // [start_, searched_) holds no searchedFor_
  char searchedFor_ = '\0';
  const size_t limit_;
};

}  // namespace ko::ipc
