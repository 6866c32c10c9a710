// What to tell people about a camera that cannot be opened.
#pragma once

#include <string>

#include "Library.h"

namespace gphoto2camera {

// Why, in the library's words, and how that is mended, where it is known.
std::string explain(const Address& address, int result, const std::string& words);

}  // namespace gphoto2camera
