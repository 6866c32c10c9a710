// Looks for cameras on a thread of its own: at the USB ports every two seconds, and at the ports on networks that
// TETHER_CAMERAS lists, separated by spaces. A worker for each.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "Bell.h"
#include "CameraKit.h"
#include "Mutex.h"
#include "Roster.h"
#include "Worker.h"

namespace gphoto2camera {

// Lives as long as the process. start and stop may be called again and again, by one thread at a time.
class Finder {
 public:
  explicit Finder(camerakit::Model& model) : _model(model) {}

  void start() KIT_EXCLUDES(_mutex);
  // Waits for the cameras' threads, for a second at most.
  void stop() KIT_EXCLUDES(_mutex);

 private:
  void run(int round) KIT_EXCLUDES(_mutex);
  bool isOver(int round) const KIT_EXCLUDES(_mutex);
  void look(std::vector<std::string>& ports, int round) KIT_EXCLUDES(_mutex);
  void add(const Address& address) KIT_REQUIRES(_mutex);

  camerakit::Model& _model;
  Roster _roster{};
  Bell _bell{};
  mutable camerakit::Mutex _mutex{};
  int _round KIT_GUARDED_BY(_mutex) = 0;  // counts starts and stops: a thread of an earlier one ends
  std::vector<std::shared_ptr<Worker>> _workers KIT_GUARDED_BY(_mutex){};
};

}  // namespace gphoto2camera
