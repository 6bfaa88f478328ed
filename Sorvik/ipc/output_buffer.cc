#include "Sorvik/ipc/output_buffer.h"

#include <algorithm>
#include <cstring>

namespace ko::ipc {

size_t OutputBuffer::append(const char* bytes, size_t length, bool dropCarriageReturns) {
  if (length == 0) return 0;
  if (!dropCarriageReturns) {
    data_.append(bytes, length);
  } else {
    const char* p = bytes;
    const char* const end = bytes + length;
    while (p < end) {
      const void* cr = std::memchr(p, '\r', static_cast<size_t>(end - p));
      const char* stop = cr != nullptr ? static_cast<const char*>(cr) : end;
      data_.append(p, static_cast<size_t>(stop - p));
      p = stop + 1;
    }
  }
  size_t dropped = 0;
  if (size() > limit_) {
    dropped = size() - limit_;
    start_ += dropped;
    searched_ = std::max(searched_, start_);
  }
  compactIfWorthwhile();
  return dropped;
}

void OutputBuffer::takeAll(std::string* out) {
  if (start_ == 0) {
    out->swap(data_);
    data_.clear();
  } else {
    out->assign(data_, start_, std::string::npos);
    data_.clear();
  }
  start_ = 0;
  searched_ = 0;
}

void OutputBuffer::compactIfWorthwhile() {
  if (start_ == data_.size()) {
    data_.clear();  // keeps the capacity for the next append
    start_ = 0;
    searched_ = 0;
    return;
  }
  // Moving the rest costs at most what was consumed since the last move.
  if (start_ >= kCompactMinimum && start_ >= data_.size() - start_) {
    data_.erase(0, start_);
    searched_ -= start_;
    start_ = 0;
  }
}

}  // namespace ko::ipc
