// Byte buffers. A Data is handed around as std::shared_ptr<const Data>; whoever holds one keeps the bytes.
#pragma once

#include <algorithm>
#include <cstddef>
#include <vector>

namespace platform {

class Data {
 public:
  Data() = default;
  explicit Data(std::vector<char> bytes) : _bytes(std::move(bytes)) {}

  std::size_t length() const { return _bytes.size(); }
  // Contiguous; valid until the buffer changes or goes.
  const char* bytes() const { return _bytes.data(); }

 protected:
  std::vector<char> _bytes;
};

// A growable buffer. One thread at a time.
class MutableData : public Data {
 public:
  MutableData() = default;
  explicit MutableData(std::size_t capacityHint) { _bytes.reserve(capacityHint); }

  void append(const char* bytes, std::size_t count) {
    if (_bytes.capacity() == 0) _bytes.reserve(std::max(count, kFirstCapacity));
    _bytes.insert(_bytes.end(), bytes, bytes + count);
  }
  // Drops `count` bytes, at most length(), from the front; the rest moves there.
  void removeFront(std::size_t count) { _bytes.erase(_bytes.begin(), _bytes.begin() + static_cast<long>(count)); }
  void clear() { _bytes.clear(); }
  // Empties the buffer and gives its memory back.
  void release() { std::vector<char>().swap(_bytes); }
  std::size_t capacity() const { return _bytes.capacity(); }

 private:
  // Takes a usual message whole; growing to that size from nothing would take eight steps.
  static constexpr std::size_t kFirstCapacity = 256;
};

}  // namespace platform
