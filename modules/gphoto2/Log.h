// The module's lines for whoever looks into trouble.
#pragma once

#include <string>

namespace gphoto2camera {

// One line to standard error, about a camera or, with an empty name, about all. Dropped where it would have to wait.
// Any thread.
void log(const std::string& camera, const std::string& text);

}  // namespace gphoto2camera
