// Byte buffers. A Data is handed around as std::shared_ptr<const Data>; whoever holds one keeps the bytes.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <new>
#include <utility>
#include <vector>

namespace platform {

class Data {
 public:
  Data() = default;
  explicit Data(std::vector<char> bytes) : _owned(std::move(bytes)), _start(_owned.data()), _length(_owned.size()) {}
  Data(const Data&) = delete;
  Data& operator=(const Data&) = delete;

  std::size_t length() const { return _length; }
  // Contiguous; valid until the buffer changes or goes.
  const char* bytes() const { return _start; }

 private:
  std::vector<char> _owned;

 protected:
  char* _start = nullptr;
  std::size_t _length = 0;
};

// A growable buffer. One thread at a time.
class MutableData : public Data {
 public:
  MutableData() = default;
  explicit MutableData(std::size_t capacityHint) {
    if (capacityHint > 0) reserve(capacityHint);
  }
  MutableData(const MutableData&) = delete;
  MutableData& operator=(const MutableData&) = delete;
  ~MutableData() { std::free(_start); }

  // Makes the buffer that much longer; returns where the new bytes are to be put.
  char* extend(std::size_t count) {
    if (count > _capacity - _length) reserve(std::max({_length + count, 2 * _capacity, kFirstCapacity}));
    return _start + std::exchange(_length, _length + count);
  }
  void append(const char* bytes, std::size_t count) {
    if (count > 0) std::memcpy(extend(count), bytes, count);
  }
  // Puts other bytes in the place of those at `offset`; all of them are inside the buffer.
  void replace(std::size_t offset, const char* bytes, std::size_t count) { std::memcpy(_start + offset, bytes, count); }
  // Drops `count` bytes, at most length(), from the front; the rest moves there.
  void removeFront(std::size_t count) {
    _length -= count;
    std::memmove(_start, _start + count, _length);
  }
  void clear() { _length = 0; }
  // Empties the buffer and gives its memory back.
  void release() {
    std::free(std::exchange(_start, nullptr));
    _length = _capacity = 0;
  }
  std::size_t capacity() const { return _capacity; }

 private:
  // Takes a usual message whole.
  static constexpr std::size_t kFirstCapacity = 256;

  // realloc() moves a large block without copying it.
  void reserve(std::size_t capacity) {
    void* const larger = std::realloc(_start, capacity);
    if (larger == nullptr) throw std::bad_alloc();
    _start = static_cast<char*>(larger);
    _capacity = capacity;
  }

  std::size_t _capacity = 0;
};

}  // namespace platform
