// The object model of a camera module, for authors in C++: derive a Camera for each kind of camera that there is, make
// one Model, plug cameras in and out, and let MAIDEntryPoint pass its arguments to entryPoint().
//
// It behaves as camera SDKs do: asynchronous; events, deliveries and completions are queued and come only inside polls
// (kNkMAIDCommand_Async), never from inside another call. Who gets what in a poll:
//   events                 any object's poll delivers those of all objects
//   a capture              completes in polls of its camera and of the module
//   a transfer (Acquire)   goes on, and completes, in polls of its data object and of its item; in those of its camera
//                          and of the module only where TransferOptions::inModulePolls says so
// A poll handles what was there when it began: what one poll brings about comes in the next.
//
// Threads: everything here may be called from any thread, also from inside callbacks, hooks and an author's own
// functions, unless said otherwise. One lock per model, held neither while a callback runs nor while anything of the
// author's does; so no call takes longer than the author's part of it. An author's functions are called on the helper's
// threads, at times on both at once, and must be quick (docs/camera-modules.md says how quick): what talks to a device
// belongs on a thread of the author's. They do not throw, except where it is said what becomes of that.
//
// Results are the header's numbers, kNkMAIDResult_...; sizes are bytes.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Capability.h"
#include "Hooks.h"
#include "MAID.h"
#include "Picture.h"

namespace camerakit {

class Core;
class Model;
struct Action;
struct CameraState;

struct TransferOptions {
  uint32_t deliveryBytes = 1u << 20;
  uint32_t deliveriesPerPoll = 1;
  uint32_t pollsPerDelivery = 1;  // the polls before it bring nothing
  uint64_t bytesPerSecond = 0;    // 0: as fast as the client polls
  bool inModulePolls = false;     // module and camera polls advance the transfer too
};

// A capture that a client has started. Copied freely, used from any thread; may outlive camera and model.
class Exposure {
 public:
  Exposure(std::shared_ptr<Core> core, std::shared_ptr<Action> action);

  // Reports its end, once: later ones are ignored, as is one that nobody waits for any more. The completion comes after
  // the pictures and events that the camera has announced before.
  void end(int32_t result = kNkMAIDResult_NoError) const;
  // Until it has ended, and as long as the camera is there and open.
  bool isAwaited() const;
  const Call& start() const;

 private:
  std::shared_ptr<Core> _core;
  std::shared_ptr<Action> _action;
};

// One camera, from the time it is plugged in until it is unplugged; after that it stays silent for good. Owned by
// whoever holds it: the model does while it is listed, and the client while it has it open.
//
// It announces by itself Name, IsAlive, Children and Capture; everything else is the author's to set. Pictures stay on
// it until a transfer of them has completed without error or they are removed, and each is announced once each time the
// camera is opened. So what lies on a card and is not to be announced is never added.
class Camera {
 public:
  Camera(const Model& model, uint32_t id, std::string name);
  virtual ~Camera();
  Camera(const Camera&) = delete;
  Camera& operator=(const Camera&) = delete;

  uint32_t id() const;
  std::string name() const;

  // Adds a capability or changes its value, built-in ones too. Raises CapChange when it is new or changes its type,
  // CapChangeValueOnly when its value is another one.
  void set(Capability capability);
  // It is not announced any more, whether built in or set. Raises CapChange.
  void remove(uint32_t capability);
  // Takes back the removal of one that is built in. One that was set has to be set again.
  void restore(uint32_t capability);
  // As set here or by a client; nothing for built-in ones that nobody replaced.
  std::optional<Capability> get(uint32_t capability) const;

  // What IsAlive reads as. The camera stays listed and keeps working.
  void setAlive(bool alive);
  void setTransfer(const TransferOptions& options);

  // Pictures that can be transferred from now on, of one press of the shutter; two are a pair. AddChild comes in the
  // next poll in which the camera is open and has an event procedure. Answers the item ids, which count from 1.
  std::vector<uint32_t> add(Shot shot);
  // Oldest first.
  std::vector<uint32_t> items() const;
  // Raises RemoveChild; the item's open objects are gone.
  void removeItem(uint32_t item);

  // Any event, of the camera or of one of its items' open objects (Level::Item or Level::Data). Dropped where the
  // object is not open or has no event procedure.
  void raise(uint32_t event, uint64_t data);
  void raise(uint32_t item, Level level, uint32_t event, uint64_t data);

  // The author's part.

  // A client opens the camera; it may do so more than once. A result refuses, an exception with UnexpectedError.
  virtual int32_t opened() { return kNkMAIDResult_NoError; }
  // Once for every open that succeeded, when the client closes it; not when the camera is unplugged.
  virtual void closed() {}

  // A client fires the shutter. NoError or Pending: it will, and the exposure's end is reported later, or at once. Any
  // other result refuses, an exception with UnexpectedError.
  virtual int32_t fire(const Exposure& exposure);

  // A client sets a capability of value type unsigned that was set here. The new value counts once this answers
  // NoError; anything else, or an exception, refuses it.
  virtual int32_t change(uint32_t capability, uint32_t value);

  // A transfer of the item is over. NoError: the client has every byte, and the item is not on the list any more. Else
  // it stays there, to be transferred again; Aborted where the client or the camera went away in the middle. A piece
  // may still be being read on another thread.
  virtual void transferred(uint32_t item, const Picture& picture, int32_t result);

 private:
  friend class Core;
  friend class Model;

  const std::shared_ptr<Core> _core;
  const std::unique_ptr<CameraState> _state;  // under the core's lock
};

struct Options {
  std::string name = "Camera Module";
  // A close or an unregistration waits so long at most for callbacks of the object that are in progress on other
  // threads. The bound is there for clients whose callbacks wait for the very thread that closes.
  std::chrono::milliseconds closeWait{100};
};

// The model behind the entry point. One at a time in a process (or in one copy of the shared object): the constructor
// installs it, the destructor takes it out again; without one the entry point answers MissingComponent. A loaded module
// never destroys its model, for the process may end inside a call. Where it is destroyed, no call may be in progress,
// and no thread inside a callback that waits for the destroying one.
class Model {
 public:
  // The hooks outlive the model.
  explicit Model(Options options = {}, Hooks* hooks = nullptr);
  ~Model();
  Model(const Model&) = delete;
  Model& operator=(const Model&) = delete;

  // The camera is listed from now on; an open module raises AddChild. A camera of that id is unplugged first.
  void plug(std::shared_ptr<Camera> camera);
  // Not listed any more, RemoveChild; its objects answer ZombieObject, and IsAlive false. Captures under way get no
  // completion; of transfers no further delivery starts. Answers the shots on the camera of which a client has not got
  // every byte, which are to be announced when the camera returns. Unknown ids are ignored.
  std::vector<Shot> unplug(uint32_t id);
  std::shared_ptr<Camera> camera(uint32_t id) const;  // null when there is none
  std::vector<std::shared_ptr<Camera>> cameras() const;

  // Any event of the module; dropped where it is not open or has no event procedure.
  void raise(uint32_t event, uint64_t data);

  size_t openObjects() const;

 private:
  friend class Camera;

  std::shared_ptr<Core> _core;
};

// The entry point itself, the same for every model. Lets no exception out.
int32_t entryPoint(tagNkMAIDObject* object, uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
                   NkMAIDCompletionProc* completion, void* reference);

}  // namespace camerakit
