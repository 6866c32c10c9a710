#include <elf.h>
#include <fcntl.h>
#include <link.h>
#include <sys/stat.h>
#include <unistd.h>

#include "Bundle.h"

namespace platform {
namespace {

bool readAt(int descriptor, void* bytes, std::size_t count, std::uint64_t offset) {
  return pread(descriptor, bytes, count, static_cast<off_t>(offset)) == static_cast<ssize_t>(count);
}

bool segmentsAreThere(int descriptor) {
  struct stat status {};
  ElfW(Ehdr) header{};
  if (fstat(descriptor, &status) != 0 || !readAt(descriptor, &header, sizeof header, 0)) return false;
  const auto size = static_cast<std::uint64_t>(status.st_size);
  for (std::uint64_t index = 0; index < header.e_phnum; ++index) {
    ElfW(Phdr) segment{};
    if (header.e_phoff > size) return false;
    if (!readAt(descriptor, &segment, sizeof segment, header.e_phoff + index * sizeof segment)) return false;
    if (segment.p_type != PT_LOAD) continue;
    if (segment.p_offset > size || segment.p_filesz > size - segment.p_offset) return false;
  }
  return true;
}

}  // namespace

// The loader maps a file without asking for its size: bytes that are not there end the process when they are touched.
bool libraryFileIsWhole(const std::string& path) {
  const int descriptor = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (descriptor < 0) return false;
  const bool whole = segmentsAreThere(descriptor);
  close(descriptor);
  return whole;
}

}  // namespace platform
