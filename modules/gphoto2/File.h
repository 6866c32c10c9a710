// A file on a camera's card, and what its name says about it.
#pragma once

#include <cstdint>
#include <string>

namespace gphoto2camera {

struct File {
  std::string folder{};
  std::string name{};
  uint64_t size = 0;
  int64_t time = 0;  // of its last change; 0 where the camera does not say

  std::string path() const { return folder + (folder.ends_with('/') ? "" : "/") + name; }
  std::string base() const;  // the path without the extension: the same of all files of a shot

  enum class Kind { Raw, Picture, Other };
  Kind kind() const;
  uint32_t dataType() const;  // kNkMAIDFileDataType_...; of what has no number there, one that nothing has
};

}  // namespace gphoto2camera
