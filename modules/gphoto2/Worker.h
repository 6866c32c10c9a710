// The thread of one camera: finds out who it is, plugs it in, and makes every call on it, until it is told to stop.
// What cannot be opened is tried again, less and less often; what was lost is first looked for, and only then
// unplugged.
//
// Made and stopped by the finder. The thread keeps its worker until it ends, which a silent camera may put off.
#pragma once

#include <atomic>
#include <chrono>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Device.h"
#include "Pairing.h"
#include "Reader.h"
#include "RealCamera.h"
#include "Roster.h"
#include "Settings.h"
#include "Shutter.h"

namespace gphoto2camera {

class Worker : public std::enable_shared_from_this<Worker> {
 public:
  Worker(camerakit::Model& model, Roster& roster, Address address);

  const Address& address() const { return _device.address(); }

  // Any thread.
  void start();
  void stop();
  bool hasEnded() const { return _hasEnded; }

 private:
  using Clock = std::chrono::steady_clock;
  using Time = Clock::time_point;

  // Worker.cpp: the connection
  void run();
  bool connect();
  int open(std::vector<File>& added);
  bool identify();
  void failed(int result);
  void lost(const std::string& why);
  void waitForNextAttempt();
  void unplug();
  // WorkerSteps.cpp: while it is there
  void step();
  bool lookForEvents(int milliseconds);
  bool isThere();
  void shoot();
  bool arrive(File file);
  void announce(const std::vector<File>& shot);
  void catchUp(const std::vector<File>& added);
  bool readSettings();

  camerakit::Model& _model;
  Roster& _roster;
  Device _device;
  const std::shared_ptr<Bell> _bell = std::make_shared<Bell>();
  const std::shared_ptr<Shutter> _shutter = std::make_shared<Shutter>(_bell);
  std::atomic<bool> _stopping{false};
  std::atomic<bool> _hasEnded{false};

  // The thread's own.
  std::string _name;  // the camera's, or before that is known its port
  std::string _serial{};
  std::optional<Place> _place{};
  std::shared_ptr<RealCamera> _camera{};  // while it is plugged in
  Reader _reader;
  Pairing _pairing{};
  Settings _settings{};
  std::map<std::string, uint32_t> _items{};  // the last of each path that was announced
  bool _isDeaf = false;                      // it has no events
  int _attempts = 0;                         // since it was open
  int _lastFailure = 0;
  std::optional<Time> _lostAt{};
  Time _nextAttempt{}, _openedAt{};
  Time _lastLook{}, _lastHeard{};
};

}  // namespace gphoto2camera
