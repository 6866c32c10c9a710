#include <climits>
#include <cstdlib>
#include <memory>

#include "Bundle.h"

namespace platform {

std::string executablePath() {
  const std::unique_ptr<char, void (*)(void*)> path(realpath("/proc/self/exe", nullptr), std::free);
  return path ? std::string(path.get()) : std::string();
}

}  // namespace platform
