// The calls of the system that the product makes for a picture's file, on their way past the road. kRefused is a disk,
// memory or process table that is full; every other way has the call half done, or fail with what must not be the end.

#include <fcntl.h>
#include <sys/mman.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <memory>
#include <system_error>
#include <thread>

#include "Road.h"

namespace {

// There is no more memory than that for one block.
constexpr std::size_t kLargestBlock = 256 << 20;

std::optional<Way> wayOf(SystemCall which, bool concerned = true) {
  return concerned && currentRoad() != nullptr ? currentRoad()->systemCall(which) : std::nullopt;
}

}  // namespace

extern "C" {

int __real_open(const char* path, int flags, ...);
std::FILE* __real_fdopen(int descriptor, const char* mode);
std::size_t __real_fwrite(const void* bytes, std::size_t size, std::size_t count, std::FILE* file);
int __real_fclose(std::FILE* file);
int __real_fallocate(int file, int mode, off_t offset, off_t size);
void* __real_mmap(void* address, std::size_t size, int protection, int flags, int descriptor, off_t offset);

int __wrap_open(const char* path, int flags, ...) {
  va_list rest;
  va_start(rest, flags);
  const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(rest, mode_t) : 0;
  va_end(rest);
  const auto way = wayOf(kOpen, (flags & O_EXCL) != 0);
  if (!way) return __real_open(path, flags, mode);
  errno = *way == kRefused ? EACCES : *way == kBusy ? EEXIST : EINTR;
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
  const std::size_t written = *way == kRefused ? 0 : __real_fwrite(bytes, size, count / 2, file);
  errno = *way == kBufferSize ? EINTR : ENOSPC;
  return written;
}

int __wrap_fclose(std::FILE* file) {
  const auto way = wayOf(kFclose);
  const int result = __real_fclose(file);
  if (!way) return result;
  errno = EIO;
  return EOF;
}

int __wrap_fallocate(int file, int mode, off_t offset, off_t size) {
  const auto way = wayOf(kReserve);
  if (!way) return __real_fallocate(file, mode, offset, size);
  errno = *way == kRefused ? ENOSPC : *way == kBusy ? EOPNOTSUPP : EINTR;
  return -1;
}

void* __wrap_mmap(void* address, std::size_t size, int protection, int flags, int descriptor, off_t offset) {
  const bool fails = size >= kLargeBlock && (wayOf(kMemory) || size > kLargestBlock);
  if (!fails) return __real_mmap(address, size, protection, flags, descriptor, offset);
  errno = ENOMEM;
  return MAP_FAILED;
}

// std::thread's start, under the name that the linker knows it by.
void START_THREAD(std::thread* self, std::unique_ptr<std::thread::_State> state, void (*depend)());
void START_THREAD_WRAPPED(std::thread* self, std::unique_ptr<std::thread::_State> state, void (*depend)()) {
  if (wayOf(kThread)) throw std::system_error(EAGAIN, std::generic_category(), "thread");
  START_THREAD(self, std::move(state), depend);
}
}
