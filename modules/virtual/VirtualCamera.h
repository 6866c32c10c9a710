// The virtual camera: a camera module without hardware, scripted from C++.
//
// A Model is one module with its cameras, on the kit (CameraKit.h), whose rules on polls, threads and locks hold here
// too. What is added: cameras are made by id and name, shoot what a script tells them to, fire their shutter by taking
// prepared or made-up pictures, and fail as a plan of faults says; calls are recorded and hooked.
//
// What the shutter takes is made inside the polls of its camera and of the module.
#pragma once

#include <deque>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "CameraKit.h"
#include "Faults.h"
#include "Pictures.h"

namespace virtualcamera {

using camerakit::Capability;
using camerakit::entryPoint;
using camerakit::Enumeration;
using camerakit::Options;
using camerakit::TransferOptions;

struct CaptureOptions {
  uint32_t polls = 1;                      // the shutter has fired after so many
  bool completeEvent = true;               // kNkMAIDEvent_CaptureComplete before the completion
  int32_t answer = kNkMAIDResult_Pending;  // of the CapStart
};

// Makes what the shutter takes when the roll is empty. Called inside a poll, without a lock, with the number of the
// shot on this camera, from 1. An empty shot, and an exception, are a capture that failed.
using ShotMaker = std::function<Shot(uint32_t number)>;

// The settings a camera has when a script says nothing else.
std::vector<Capability> defaultSettings();

// A camera of a model. Owned by the model; a reference is valid until the camera is removed or the model goes.
class Camera final : public camerakit::Camera {
 public:
  Camera(const camerakit::Model& model, uint32_t id, const std::string& name);

  // Pictures appear on the camera as if its own button had been pressed. Answer the item ids.
  uint32_t shoot(Picture picture);
  std::vector<uint32_t> shoot(Shot shot);
  std::vector<uint32_t> shootPair(Picture raw, Picture jpeg);

  // What Capture takes, oldest first; after that the maker's shots, after that a pattern of 100,000 bytes.
  void load(Shot shot);
  void load(Picture picture);
  void setMaker(ShotMaker maker);
  void setCapture(const CaptureOptions& options);

  // To be called with every poll of the camera and of the module.
  void polled();

 private:
  struct Capture {
    camerakit::Exposure exposure;
    uint32_t polls = 0;
  };

  int32_t fire(const camerakit::Exposure& exposure) override;
  int32_t change(uint32_t capability, uint32_t value) override;
  void transferred(uint32_t item, const Picture& picture, int32_t result) override;
  void expose(const camerakit::Exposure& exposure);
  Shot nextShot();

  camerakit::Mutex _mutex;
  CaptureOptions _options KIT_GUARDED_BY(_mutex);
  std::vector<Capture> _captures KIT_GUARDED_BY(_mutex);
  std::deque<Shot> _roll KIT_GUARDED_BY(_mutex);
  std::shared_ptr<const ShotMaker> _maker KIT_GUARDED_BY(_mutex);
  uint32_t _shots KIT_GUARDED_BY(_mutex) = 0;
};

using CallHook = std::function<void(const Call&)>;

// One at a time in a process (or in one copy of the shared object); see camerakit::Model for its end.
class Model {
 public:
  explicit Model(Options options = {.name = "Virtual Module"});
  ~Model();
  Model(const Model&) = delete;
  Model& operator=(const Model&) = delete;

  // The same function for every model.
  static NkMAIDEntryPoint* entryPoint() { return camerakit::entryPoint; }

  // Plugs a camera in, with default settings. A camera of that id is removed first.
  Camera& addCamera(uint32_t id, const std::string& name);
  // Unplugs it. Unknown ids are ignored. Answers the shots on the camera of which a client has not got every byte.
  std::vector<Shot> removeCamera(uint32_t id) { return _model.unplug(id); }
  Camera* camera(uint32_t id);  // null when there is none
  std::vector<uint32_t> cameras() const;

  // Any event of the module; dropped where it is not open or has no event procedure.
  void raise(uint32_t event, uint64_t data) { _model.raise(event, data); }

  FaultPlan& faults();

  // Hooks run on the calling thread around every call, polls included. An empty one takes the hook out.
  void beforeCall(CallHook hook);
  void afterCall(CallHook hook);

  // While it is on, calls are kept, without polls.
  void record(bool on);
  std::vector<Call> calls() const;
  std::vector<Target> closed() const;  // what was closed, in order, of the calls kept

  size_t openObjects() const { return _model.openObjects(); }

 private:
  class Script;

  std::unique_ptr<Script> _script;  // before the model, which asks it until its end
  camerakit::Model _model;
};

}  // namespace virtualcamera
