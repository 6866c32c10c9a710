// The calls of the system that the product makes for a picture's file, on their way through the lying module. A way
// other than kRefused has the call half done, or fail with what must not be the end.

#include <fcntl.h>
#include <stdlib.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <memory>
#include <system_error>
#include <thread>

#include "LyingModule.h"

namespace {

// There is no more memory than that for one block.
constexpr std::size_t kLargestBlock = 256 << 20;

std::optional<Way> wayOf(SystemCall which, bool concerned = true) {
  return concerned && lyingModule() != nullptr ? lyingModule()->systemCall(which) : std::nullopt;
}

bool noMemory(std::size_t size) {
  if (size < kLargeBlock) return false;
  errno = ENOMEM;
  return wayOf(kMemory) || size > kLargestBlock;
}

}  // namespace

extern "C" {

int __real_open(const char* path, int flags, ...);
std::FILE* __real_fdopen(int descriptor, const char* mode);
std::size_t __real_fwrite(const void* bytes, std::size_t size, std::size_t count, std::FILE* file);
ssize_t __real_write(int descriptor, const void* bytes, std::size_t count);
int __real_fclose(std::FILE* file);
void* __real_calloc(std::size_t count, std::size_t size);
void* __real_malloc(std::size_t size);
void* __real_mmap(void* address, std::size_t size, int protection, int flags, int descriptor, off_t offset);

int __wrap_open(const char* path, int flags, ...) {
  va_list rest;
  va_start(rest, flags);
  const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(rest, mode_t) : 0;
  va_end(rest);
  const auto way = wayOf(kOpen, (flags & O_EXCL) != 0);
  if (!way) return __real_open(path, flags, mode);
  errno = *way == kRefused ? EACCES : EEXIST;
  return -1;
}

std::FILE* __wrap_fdopen(int descriptor, const char* mode) {
  if (!wayOf(kFdopen)) return __real_fdopen(descriptor, mode);
  errno = ENOMEM;
  return nullptr;
}

std::size_t __wrap_fwrite(const void* bytes, std::size_t size, std::size_t count, std::FILE* file) {
  const auto way = wayOf(kFwrite, size * count >= kLargeBlock);
  if (!way) return __real_fwrite(bytes, size, count, file);
  errno = ENOSPC;
  return *way == kRefused ? 0 : __real_fwrite(bytes, size, count / 2, file);
}

ssize_t __wrap_write(int descriptor, const void* bytes, std::size_t count) {
  const auto way = wayOf(kWrite, count >= kLargeBlock);
  if (!way) return __real_write(descriptor, bytes, count);
  errno = ENOSPC;
  return *way == kRefused ? -1 : __real_write(descriptor, bytes, count / 2);
}

int __wrap_fclose(std::FILE* file) {
  const auto way = wayOf(kFclose);
  const int result = __real_fclose(file);
  if (!way) return result;
  errno = EIO;
  return EOF;
}

void* __wrap_calloc(std::size_t count, std::size_t size) {
  return noMemory(count * size) ? nullptr : __real_calloc(count, size);
}

void* __wrap_malloc(std::size_t size) { return noMemory(size) ? nullptr : __real_malloc(size); }

void* __wrap_mmap(void* address, std::size_t size, int protection, int flags, int descriptor, off_t offset) {
  return noMemory(size) ? MAP_FAILED : __real_mmap(address, size, protection, flags, descriptor, offset);
}

// std::thread's start, under the name that the linker knows it by.
void START_THREAD(std::thread* self, std::unique_ptr<std::thread::_State> state, void (*depend)());
void START_THREAD_WRAPPED(std::thread* self, std::unique_ptr<std::thread::_State> state, void (*depend)()) {
  if (wayOf(kThread)) throw std::system_error(EAGAIN, std::generic_category(), "thread");
  START_THREAD(self, std::move(state), depend);
}
}
