// The shutter, between the helper's main thread, which stands still until a capture has completed, and the camera's
// thread, which may be held up by the camera.
#pragma once

#include <chrono>
#include <deque>
#include <optional>
#include <vector>

#include "Bell.h"
#include "CameraKit.h"
#include "Mutex.h"

namespace gphoto2camera {

class Shutter {
 public:
  explicit Shutter(std::shared_ptr<Bell> bell) : _bell(std::move(bell)) {}

  // The helper's side. poll waits for a moment for the end of what was ordered, and ends it after a second, however it
  // will turn out.
  void fire(const camerakit::Exposure& exposure) KIT_EXCLUDES(_mutex) {
    const camerakit::Guard guard(_mutex);
    _ordered.push_back({exposure, Clock::now() + kPatience});
    ++_awaited;
    _bell->ring();
  }
  void poll() KIT_EXCLUDES(_mutex) {
    const Clock::time_point until = Clock::now() + kMoment;
    const camerakit::Guard guard(_mutex);
    while (_awaited > 0 && _ended.waitUntil(_mutex, until)) continue;
    const Clock::time_point now = Clock::now();
    for (Order& order : _ordered) late(order, now);
    if (_current) late(*_current, now);
  }

  // The camera's side: one order after the other.
  bool take() KIT_EXCLUDES(_mutex) {
    const camerakit::Guard guard(_mutex);
    if (_ordered.empty()) return false;
    _current = _ordered.front();
    _ordered.pop_front();
    return true;
  }
  void end(int32_t result) KIT_EXCLUDES(_mutex) {
    const camerakit::Guard guard(_mutex);
    if (_current && _current->isAwaited) finish(*_current, result);
    _current.reset();
  }

 private:
  using Clock = std::chrono::steady_clock;
  static constexpr std::chrono::seconds kPatience{1};
  static constexpr std::chrono::milliseconds kMoment{5};

  struct Order {
    camerakit::Exposure exposure;
    Clock::time_point until;
    bool isAwaited = true;
  };

  void late(Order& order, Clock::time_point now) KIT_REQUIRES(_mutex) {
    if (order.isAwaited && now >= order.until) finish(order, kNkMAIDResult_NoError);
  }
  void finish(Order& order, int32_t result) KIT_REQUIRES(_mutex) {
    order.exposure.end(result);
    order.isAwaited = false;
    --_awaited;
    _ended.notifyAll();
  }

  const std::shared_ptr<Bell> _bell;
  camerakit::Mutex _mutex{};
  camerakit::Condition _ended{};
  std::deque<Order> _ordered KIT_GUARDED_BY(_mutex){};
  std::optional<Order> _current KIT_GUARDED_BY(_mutex){};
  int _awaited KIT_GUARDED_BY(_mutex) = 0;
};

}  // namespace gphoto2camera
