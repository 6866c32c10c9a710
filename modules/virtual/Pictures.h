// Pictures that a virtual camera takes: besides those in memory, files and ones made up on the fly.
#pragma once

#include <cstdint>
#include <string>

#include "Picture.h"

namespace virtualcamera {

using camerakit::Picture;
using camerakit::PictureSource;
using camerakit::Shot;

// A file, opened at its first delivery and read in delivery-sized pieces. Its size is taken now. One that has another
// size then, is no regular file, or changes during the transfer ends it with kNkMAIDResult_DataTransFailure.
Picture filePicture(uint32_t fileDataType, const std::string& path);
// Whether a file is still what it was when the picture was made. Other pictures always are.
bool isThere(const Picture& picture);
// Nothing more will be read for now: a file need not stay open.
void rest(const Picture& picture);

// That many bytes of a pattern, stored nowhere: byte i is the remainder of i by 251.
Picture patternPicture(uint32_t fileDataType, uint64_t size);

}  // namespace virtualcamera
