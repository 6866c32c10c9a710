// Preloaded into a helper, lets one system call fail: TETHER_FAIL="KIND N ERROR" is the N-th call of its kind. Of files
// only the helper's pictures count, but none with the extension .tif. A line on the standard error tells of it.
#include <dlfcn.h>
#include <fcntl.h>
#include <pthread.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <string_view>

namespace {

constexpr std::size_t kLeastBuffer = std::size_t{64} << 10;

template <typename Function>
Function* real(const char* name) {
  return reinterpret_cast<Function*>(dlsym(RTLD_NEXT, name));
}

bool fails(std::string_view kind) {
  static std::array<char, 16> wanted{};
  static int number = 0;
  static int error = 0;
  static const bool read = [] {
    const char* const plan = std::getenv("TETHER_FAIL");
    return plan != nullptr && std::sscanf(plan, "%15s %d %d", wanted.data(), &number, &error) == 3;
  }();
  static std::atomic<int> calls{0};
  if (!read || kind != wanted.data() || ++calls != number) return false;
  dprintf(STDERR_FILENO, "injected\n");
  errno = error;
  return true;
}

bool isPicture(std::string_view path) {
  const char* const folder = std::getenv("TMPDIR");
  return folder != nullptr && path.substr(0, path.rfind('/')) == folder && !path.ends_with(".tif");
}

std::array<std::atomic<bool>, 256> pictures{};

bool isPicture(int file) {
  return file >= 0 && static_cast<std::size_t>(file) < pictures.size() && pictures[static_cast<std::size_t>(file)];
}

ino_t inodeOf(int file) {
  struct stat status {};
  return fstat(file, &status) == 0 ? status.st_ino : 0;
}

// The pipe to the host, which stands elsewhere later.
const ino_t output = inodeOf(STDOUT_FILENO);

}  // namespace

extern "C" {

int open(const char* path, int flags, ...) {
  va_list rest;
  va_start(rest, flags);
  const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(rest, mode_t) : 0;
  va_end(rest);
  const bool picture = (flags & O_CREAT) != 0 && isPicture(std::string_view(path));
  if (picture && fails("open")) return -1;
  const int file = real<decltype(open)>("open")(path, flags, mode);
  if (file >= 0 && static_cast<std::size_t>(file) < pictures.size()) pictures[static_cast<std::size_t>(file)] = picture;
  return file;
}

// The library writes past any other symbol: what it would answer when its write() fails is answered here.
size_t fwrite(const void* bytes, size_t size, size_t count, FILE* stream) {
  const auto write = real<decltype(fwrite)>("fwrite");
  if (!isPicture(fileno(stream))) return write(bytes, size, count, stream);
  if (fails("write")) return 0;
  const bool half = fails("half");
  const int error = errno;
  const size_t written = write(bytes, size, half ? count / 2 : count, stream);
  if (half) errno = error;
  return written;
}

ssize_t write(int file, const void* bytes, size_t count) {
  const bool toHost = inodeOf(file) == output;
  if (toHost && fails("output")) return -1;
  if (toHost && count > 1 && fails("halfoutput")) count /= 2;
  return real<decltype(write)>("write")(file, bytes, count);
}

void* mmap(void* address, size_t size, int protection, int flags, int file, off_t offset) noexcept {
  if ((flags & MAP_ANONYMOUS) != 0 && size >= kLeastBuffer && fails("memory")) return MAP_FAILED;
  return real<decltype(mmap)>("mmap")(address, size, protection, flags, file, offset);
}

int fallocate(int file, int mode, off_t offset, off_t size) {
  if (isPicture(file) && fails("room")) return -1;
  return real<decltype(fallocate)>("fallocate")(file, mode, offset, size);
}

int pipe(int* ends) noexcept { return fails("pipe") ? -1 : real<decltype(pipe)>("pipe")(ends); }

int pthread_create(pthread_t* thread, const pthread_attr_t* attributes, void* (*body)(void*), void* argument) noexcept {
  if (fails("thread")) return errno;
  return real<decltype(pthread_create)>("pthread_create")(thread, attributes, body, argument);
}

}  // extern "C"
