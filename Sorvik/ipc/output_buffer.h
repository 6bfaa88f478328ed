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
#include <cstring>
#include <string>

namespace ko::ipc {

class OutputBuffer {
 public:
  static constexpr size_t kDefaultLimit = size_t{1} << 20;
  // Compaction moves the remaining bytes; below this the move is not worth it.
  static constexpr size_t kCompactMinimum = 64 * 1024;

  explicit OutputBuffer(size_t limit = kDefaultLimit) : limit_(limit) {}

  // Appends `length` bytes, without their carriage returns when asked (only
  // the new bytes are scanned). Returns how many old bytes were dropped.
  size_t append(const char* bytes, size_t length, bool dropCarriageReturns);

  // When the unread bytes contain `delimiter`: sets `out` to the bytes before
  // it (less one carriage return right before it when asked), consumes them
  // and the delimiter, returns true. Else leaves `out`.
  // Inline: a reader draining short lines calls it once per line.
  bool takeUntil(char delimiter, std::string* out, bool dropCarriageReturnBefore = false) {
    if (searchedFor_ != delimiter) {
      searchedFor_ = delimiter;
      searched_ = start_;
    }
    const size_t from = searched_ > start_ ? searched_ : start_;
    const void* hit = std::memchr(data_.data() + from, delimiter, data_.size() - from);
    if (hit == nullptr) {
      searched_ = data_.size();
      return false;
    }
    const size_t pos = static_cast<size_t>(static_cast<const char*>(hit) - data_.data());
    size_t length = pos - start_;
    if (dropCarriageReturnBefore && length > 0 && data_[pos - 1] == '\r') --length;
    out->assign(data_.data() + start_, length);
    start_ = pos + 1;
    searched_ = start_;
    if (start_ >= kCompactMinimum || start_ == data_.size()) compactIfWorthwhile();
    return true;
  }

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
