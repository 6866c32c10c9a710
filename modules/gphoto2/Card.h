// What lies on a camera's cards when it is connected.
#pragma once

#include <vector>

#include "Device.h"
#include "File.h"
#include "Memory.h"

namespace gphoto2camera {

// Brings the memory up to date. Of a camera that it does not know, nothing is new: what is in the newest folders is
// noted. Else `added` are the files that came since it was last here. Listing is what makes the first event quick, too.
// The library's result; where it is not GP_OK the rest was not looked at.
int look(Device& device, Memory& memory, std::vector<File>& added);

}  // namespace gphoto2camera
