#include <mach-o/dyld.h>

#include <cstdlib>
#include <memory>

#include "Bundle.h"

namespace platform {

std::string executablePath() {
  std::uint32_t size = 0;
  _NSGetExecutablePath(nullptr, &size);
  std::string raw(size, '\0');
  if (_NSGetExecutablePath(raw.data(), &size) != 0) return {};
  const std::unique_ptr<char, void (*)(void*)> path(realpath(raw.c_str(), nullptr), std::free);
  return path ? std::string(path.get()) : std::string();
}

}  // namespace platform
