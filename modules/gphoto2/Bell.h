// Wakes one thread that rests. A ring that nobody waits for is kept for the next rest.
#pragma once

#include <chrono>

#include "Mutex.h"

namespace gphoto2camera {

class Bell {
 public:
  void ring() KIT_EXCLUDES(_mutex) {
    const camerakit::Guard guard(_mutex);
    _rung = true;
    _changed.notifyAll();
  }
  void rest(std::chrono::milliseconds atMost) KIT_EXCLUDES(_mutex) {
    const auto until = std::chrono::steady_clock::now() + atMost;
    const camerakit::Guard guard(_mutex);
    while (!_rung && _changed.waitUntil(_mutex, until)) continue;
    _rung = false;
  }

 private:
  camerakit::Mutex _mutex;
  camerakit::Condition _changed;
  bool _rung KIT_GUARDED_BY(_mutex) = false;
};

}  // namespace gphoto2camera
