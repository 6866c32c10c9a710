// Puts the files of one press of the shutter together: a raw file and another one of the same folder and base name.
//
// A file waits for its partner, and later shots wait behind it, so that the two halves stay next to each other. Belongs
// to one thread.
#pragma once

#include <chrono>
#include <deque>
#include <optional>
#include <string>
#include <vector>

#include "File.h"

namespace gphoto2camera {

class Pairing {
 public:
  using Time = std::chrono::steady_clock::time_point;

  // What the camera's quality setting says: that it stores both, or one of the two, or nothing that can be read.
  void setQuality(const std::optional<std::string>& text);

  // Movies and the like do not belong here.
  void add(File file, Time now);
  // The oldest shot, once nothing is missing or its time is up; empty when there is none.
  std::vector<File> next(Time now);
  bool holds(const File& file) const;  // it waits

 private:
  struct Waiting {
    std::vector<File> files;
    Time until;
  };

  std::chrono::milliseconds _patience{300};
  std::deque<Waiting> _shots;
};

}  // namespace gphoto2camera
