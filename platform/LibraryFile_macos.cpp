#include "Bundle.h"

namespace platform {

// The loader looks for itself.
bool libraryFileIsWhole(const std::string&) { return true; }

}  // namespace platform
