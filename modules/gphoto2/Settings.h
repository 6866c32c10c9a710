// What a camera is set to, by the names that makers gave it: the table of them, and what to tell the host.
//
// The camera's thread reads; nothing is asked that the camera has not listed.
#pragma once

#include <chrono>
#include <optional>
#include <set>
#include <string>

#include "CameraKit.h"
#include "Device.h"

namespace gphoto2camera {

class Settings {
 public:
  using Time = std::chrono::steady_clock::time_point;

  // A camera has been opened.
  void connect(Device& device);
  // One may have changed; or the room on the card has.
  void mark(Time now);
  bool isDue(Time now) const;
  // False, and nothing has changed for the host: there was none to be read, as on a connection that is dead.
  bool read(Device& device, camerakit::Camera& camera);

  // What the camera says of the files that it stores.
  std::optional<std::string> quality(Device& device) const;
  // Lets pictures stay on the card, where they outlive the connection. Says so where it had to.
  void keepOnCard(Device& device, const std::string& name) const;
  void noteSize(uint64_t bytes) { _lastSize = bytes; }

 private:
  std::optional<std::string> first(Device& device, std::initializer_list<const char*> names) const;
  std::optional<std::string> shotsLeft(Device& device) const;

  std::set<std::string> _names{};
  std::optional<Time> _marked{};
  Time _lastRead{};
  uint64_t _lastSize = 0;
};

}  // namespace gphoto2camera
