// Pictures that the camera makes itself when nobody has given it any.
#pragma once

#include <cstdint>
#include <ctime>
#include <string>
#include <vector>

#include "Pictures.h"

namespace virtualcamera {

// The next shot of a camera that has no other: a JPEG, or a RAW and JPEG pair, of now. Throws std::bad_alloc.
Shot ownShot(uint32_t number, const std::string& name, bool pair);

// A JPEG of 960 by 640 dots with number, camera name and local time to be read in it. Throws std::bad_alloc.
std::vector<uint8_t> ownJpeg(uint32_t number, const std::string& name, std::time_t time);

// A made-up raw file: a TIFF container with one uncompressed plane of 16-bit sensor data, other for every number.
std::vector<uint8_t> ownRaw(uint32_t number);

}  // namespace virtualcamera
