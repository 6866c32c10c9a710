// Which camera is which: a camera keeps its id, and what is remembered of its pictures, as long as the process lives.
// Any thread.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Library.h"
#include "Memory.h"
#include "Mutex.h"

namespace gphoto2camera {

struct Place {
  uint32_t id = 0;
  std::shared_ptr<Memory> memory{};
};

class Roster {
 public:
  // The camera has come: known by model and serial number, else by its port on networks; on USB it is the only absent
  // one of its model. Nothing when there have been 255 others that are all there.
  std::optional<Place> enter(const std::string& model, const std::string& serial, const Address& address)
      KIT_EXCLUDES(_mutex);
  void leave(uint32_t id) KIT_EXCLUDES(_mutex);

 private:
  struct Entry {
    std::string model, serial, port;
    Place place{};
    bool present = false;
  };

  Entry* find(const std::string& model, const std::string& serial, const Address& address) KIT_REQUIRES(_mutex);

  camerakit::Mutex _mutex{};
  std::vector<std::unique_ptr<Entry>> _entries KIT_GUARDED_BY(_mutex){};
};

}  // namespace gphoto2camera
