// A large block of memory straight from the system, given back whole when it is destroyed: the heap would keep some of
// it for the life of the process.
#pragma once

#include <cstddef>
#include <utility>

namespace platform {

class MemoryBlock {
 public:
  MemoryBlock() = default;
  // So many zero bytes. Empty when there is no memory for them.
  explicit MemoryBlock(std::size_t size);
  MemoryBlock(MemoryBlock&& other) noexcept
      : _mapping(std::exchange(other._mapping, nullptr)), _size(std::exchange(other._size, 0)) {}
  MemoryBlock& operator=(MemoryBlock&& other) noexcept {
    MemoryBlock taken(std::move(other));
    std::swap(_mapping, taken._mapping);
    std::swap(_size, taken._size);
    return *this;
  }
  ~MemoryBlock();

  // Null when the block is empty.
  char* data() const;
  std::size_t size() const { return _size; }

 private:
  char* _mapping = nullptr;
  std::size_t _size = 0;
};

}  // namespace platform
