// The virtual camera: a camera module without hardware, scripted from C++.
//
// A Model is one module with its cameras, behind an entry point like that of any camera SDK. It is asynchronous as
// those are: events, deliveries and completions are queued and come only inside polls (kNkMAIDCommand_Async), never
// from inside another call. Who gets what in a poll:
//   events                 any object's poll delivers those of all objects (but see Options::eventsInTransferPolls)
//   a capture              goes on, and completes, in polls of its camera and of the module
//   a transfer (Acquire)   goes on, and completes, in polls of its data object and of its item; in those of its camera
//                          and of the module only where TransferOptions::inModulePolls says so
// A poll handles what was there when it began: what one poll brings about comes in the next.
//
// Pictures stay on the camera until a transfer of them has completed without error or a script removes them. A camera
// announces every picture on it once each time it is opened: what lies on its card and is not to be announced is not
// among them.
//
// Everything here may be called from any thread, also from inside callbacks and hooks, unless said otherwise. One lock
// per model, held neither while a callback runs nor while a hook or a picture's source does.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "Capability.h"
#include "Faults.h"
#include "MAID.h"
#include "Picture.h"

namespace virtualcamera {

class Core;
struct CameraState;

struct TransferOptions {
  uint32_t deliveryBytes = 1u << 20;
  uint32_t deliveriesPerPoll = 1;
  uint32_t pollsPerDelivery = 1;  // the polls before it bring nothing
  uint64_t bytesPerSecond = 0;    // 0: as fast as the client polls
  bool inModulePolls = false;     // module and camera polls advance the transfer too
};

struct CaptureOptions {
  uint32_t polls = 1;                      // the shutter has fired after so many
  bool completeEvent = true;               // kNkMAIDEvent_CaptureComplete before the completion
  int32_t answer = kNkMAIDResult_Pending;  // of the CapStart
};

// Makes what the shutter takes when the roll is empty. Called inside a poll, without a lock, with the number of the
// shot on this camera, from 1. An empty shot, and an exception, are a capture that failed.
using ShotMaker = std::function<Shot(uint32_t number)>;

// A camera of a model. Owned by the model; the reference is valid until the camera is removed or the model goes.
class Camera {
 public:
  Camera(Core& core, std::shared_ptr<CameraState> state);
  ~Camera();
  Camera(const Camera&) = delete;
  Camera& operator=(const Camera&) = delete;

  uint32_t id() const;
  std::string name() const;

  // Pictures appear on the camera as if its own button had been pressed; AddChild comes in the next poll in which
  // the camera is open and has an event procedure. Answer the item ids, which count from 1 per camera.
  uint32_t shoot(Picture picture);
  std::vector<uint32_t> shootPair(Picture raw, Picture jpeg);
  std::vector<uint32_t> shoot(Shot shot);  // two pictures are a pair

  // What Capture takes, oldest first; after that the maker's shots, after that a pattern of 100,000 bytes.
  void load(Shot shot);
  void load(Picture picture);
  void setMaker(ShotMaker maker);

  // Pictures still on the camera, oldest first. Removing one raises RemoveChild; its open objects are gone.
  std::vector<uint32_t> items() const;
  void removeItem(uint32_t item);

  // Adds a capability or replaces it, built-in ones (Name, IsAlive, Children, ...) too. An open camera raises
  // CapChange when it is new or changes its type, else CapChangeValueOnly.
  void set(Capability capability);
  // The camera does not announce the capability any more, whether built in or set.
  void remove(uint32_t capability);
  // Takes back the removal of one that is built in. One that was set has to be set again.
  void restore(uint32_t capability);
  // The value as set by script or client; nothing for built-in ones that nobody replaced.
  std::optional<Capability> get(uint32_t capability) const;

  // What IsAlive reads as. The camera stays listed and keeps working.
  void setAlive(bool alive);
  void setTransfer(const TransferOptions& options);
  void setCapture(const CaptureOptions& options);

  // Any event, of the camera or of one of its items' open objects (Level::Item or Level::Data). Dropped where the
  // object is not open or has no event procedure.
  void raise(uint32_t event, uint64_t data);
  void raise(uint32_t item, Level level, uint32_t event, uint64_t data);

 private:
  Core& core_;
  std::shared_ptr<CameraState> state_;
};

// One call of the entry point, as hooks and records see it.
struct Call {
  Target target;
  uint32_t command = 0;
  uint32_t parameter = 0;
  uint32_t dataType = 0;
  int32_t result = 0;  // not yet known to a hook before the call
  std::thread::id thread;
};
using CallHook = std::function<void(const Call&)>;

struct Options {
  std::string name = "Virtual Module";
  bool eventsInTransferPolls = true;  // polls of items and data objects deliver events too
  bool eventsOnOwnThread = false;     // events come on a thread of the module, queued by the poll that would bring them
  // What a transfer or capture under way completes with when its camera is removed or its item goes: nothing (no
  // completion comes), or this result, inside the next poll of its object, which answers ZombieObject all the same.
  std::optional<int32_t> unplugResult{};
  // A close or an unregistration waits so long at most for callbacks of the object that are in progress on other
  // threads. The bound is there for clients whose callbacks wait for the very thread that closes.
  std::chrono::milliseconds closeWait{100};
};

// Which calls failCall counts beside the others.
struct Counting {
  bool opens = true;
  bool closes = true;
  bool polls = true;
};

// The model behind the entry point. One at a time in a process (or in one copy of the shared object): the constructor
// installs it, the destructor takes it out again; without one the entry point answers MissingComponent. No call may
// be in progress, and none of its threads inside a callback that waits for the destroying thread, when it goes.
class Model {
 public:
  explicit Model(Options options = {});
  ~Model();
  Model(const Model&) = delete;
  Model& operator=(const Model&) = delete;

  // The same function for every model.
  static NkMAIDEntryPoint* entryPoint();

  // Plugs a camera in, with default settings; an open module raises AddChild. A camera of that id is removed first.
  Camera& addCamera(uint32_t id, const std::string& name);
  // Unplugs it: not listed any more, RemoveChild, its objects answer ZombieObject (and IsAlive false). Of a transfer
  // under way no further delivery starts; see Options::unplugResult. Unknown ids are ignored. Answers the shots on the
  // camera of which a client has not got every byte.
  std::vector<Shot> removeCamera(uint32_t id);
  Camera* camera(uint32_t id);  // null when there is none; valid like addCamera's
  std::vector<uint32_t> cameras() const;

  // Any event of the module; dropped where it is not open or has no event procedure.
  void raise(uint32_t event, uint64_t data);
  // The module does not announce the capability.
  void remove(uint32_t capability);

  FaultPlan& faults();

  // The k-th call from now, counted from 1, answers the result without being done. 0 ends it.
  void failCall(uint64_t k, int32_t result, Counting counting = {});
  // Calls counted since the last failCall, the failed one included. Lets a test find how many there are to fail.
  uint64_t countedCalls() const;

  // Hooks run on the calling thread around every call, polls included. An empty one takes the hook out.
  void beforeCall(CallHook hook);
  void afterCall(CallHook hook);

  // While it is on, calls are kept, without polls.
  void record(bool on);
  std::vector<Call> calls() const;
  std::vector<Target> closed() const;  // what was closed, in order, of the calls kept

  size_t openObjects() const;

 private:
  std::unique_ptr<Core> core_;
};

// The entry point itself, for those that link the model instead of loading it.
int32_t entryPoint(tagNkMAIDObject* object, uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
                   NkMAIDCompletionProc* completion, void* reference);

}  // namespace virtualcamera
