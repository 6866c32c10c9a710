#include "MemoryBlock.h"

#include <sys/mman.h>

#include <cstdint>

namespace platform {

namespace {

// The size of the large pages that common processors have.
constexpr std::size_t kLargePage = std::size_t{2} << 20;

// A large block begins where a large page does, so that all but its end can lie in such pages.
std::size_t mappedSize(std::size_t size) { return size < kLargePage ? size : size + kLargePage; }

}  // namespace

MemoryBlock::MemoryBlock(std::size_t size) {
  if (size == 0 || size > SIZE_MAX - kLargePage) return;
  void* const start = mmap(nullptr, mappedSize(size), PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (start == MAP_FAILED) return;
  _mapping = static_cast<char*>(start);
  _size = size;
#ifdef MADV_HUGEPAGE
  // Taking the memory in small pages costs more than filling it.
  if (size >= kLargePage) madvise(data(), size, MADV_HUGEPAGE);
#endif
}

MemoryBlock::~MemoryBlock() {
  if (_mapping != nullptr) munmap(_mapping, mappedSize(_size));
}

char* MemoryBlock::data() const {
  if (_size < kLargePage) return _mapping;
  return _mapping + (kLargePage - reinterpret_cast<std::uintptr_t>(_mapping) % kLargePage) % kLargePage;
}

}  // namespace platform
