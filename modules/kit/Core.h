// The state behind a Model, and the commands on it. Internal.
//
// Functions that require the mutex return with it held; those that call back or run something of the author's give it
// up in between, so what they were told before may have changed. An object that was closed meanwhile is not in _objects
// any more.
#pragma once

#include <algorithm>
#include <deque>
#include <map>
#include <memory>
#include <set>

#include "CameraKit.h"
#include "Mutex.h"

namespace camerakit {

using Clock = std::chrono::steady_clock;

struct Event {
  uint64_t sequence;
  uint32_t event;
  uint64_t data;
};

// Something that can be opened. When it is opened twice, the latest opening gets the events.
struct Node {
  std::deque<Event> events;
  uint64_t opened = 0;  // handle of the open object, 0 for none
  bool gone = false;
};

struct ItemState : Node {
  uint32_t id = 0;
  Picture picture;         // never changes
  uint32_t pair = 0;       // the first item's id, of both; 0 for none
  bool announced = false;  // AddChild has been delivered to the present opening of the camera
  Node data;
};

struct CameraState : Node {
  uint32_t id = 0;
  std::string name;
  bool alive = true;
  std::vector<Capability> settings;
  std::set<uint32_t> withoutCapabilities;
  TransferOptions transfer;
  std::map<uint32_t, std::shared_ptr<ItemState>> items;
  uint32_t lastItem = 0;
};

// A started capture or transfer.
struct Action {
  Call start;  // never changes

  Clock::time_point begun = Clock::now();
  uint32_t polls = 0;  // since the start, or since the last delivery
  uint64_t offset = 0;
  uint32_t deliveries = 0;
  bool busy = false;  // a poll is at it, or a thread that a hook took it to
  std::vector<uint8_t> scratch;

  bool done = false;      // only the completion is missing, or none will come
  uint64_t sequence = 0;  // where the completion stands among the events
  int32_t result = kNkMAIDResult_NoError;
};
using ActionPtr = std::shared_ptr<Action>;

struct Object {
  uint64_t handle = 0;
  Target target;
  tagNkMAIDObject* record = nullptr;
  uint64_t parent = 0;
  std::shared_ptr<Camera> camera;   // null for the module
  CameraState* state = nullptr;     // the camera's
  std::shared_ptr<ItemState> item;  // null for module and cameras
  bool orphaned = false;            // its parent was closed before it
  tagNkMAIDCallback eventProc{};
  tagNkMAIDCallback dataProc{};
  std::vector<std::thread::id> callbacks;  // threads inside a callback of this object
  ActionPtr action;
};
using ObjectPtr = std::shared_ptr<Object>;

// An action whose object went before it had completed.
struct Abandoned {
  ObjectPtr object;
  ActionPtr action;
  bool sent;  // the client has every byte all the same
};

class Core : public std::enable_shared_from_this<Core> {
 public:
  Core(Options options, Hooks* hooks);

  int32_t enter(Call& call) KIT_EXCLUDES(_mutex);

 private:
  friend class Camera;
  friend class Exposure;
  friend class Model;

  // EntryPoint.cpp
  void describe(Call& call) KIT_EXCLUDES(_mutex);
  int32_t run(const Call& call) KIT_EXCLUDES(_mutex);
  int32_t dispatch(const ObjectPtr& object, const Call& call) KIT_REQUIRES(_mutex);

  // Objects.cpp
  ObjectPtr find(const tagNkMAIDObject* record) const KIT_REQUIRES(_mutex);
  bool isOpen(const Object& object) const KIT_REQUIRES(_mutex) { return _objects.contains(object.handle); }
  static bool isGone(const Object& object);
  Node& nodeOf(const Object& object) KIT_REQUIRES(_mutex);
  int32_t open(const Call& call) KIT_REQUIRES(_mutex);
  int32_t place(const ObjectPtr& parent, uint32_t id, Object& object) KIT_REQUIRES(_mutex);
  int32_t connect(const ObjectPtr& parent, const Object& object) KIT_REQUIRES(_mutex);
  int32_t close(const ObjectPtr& object) KIT_REQUIRES(_mutex);
  int32_t setCallback(const ObjectPtr& object, const Call& call) KIT_REQUIRES(_mutex);
  void waitForCallbacks(const Object& object) KIT_REQUIRES(_mutex);
  void announceItems(CameraState& camera) KIT_REQUIRES(_mutex);
  int32_t enumChildren(const Object& object) KIT_REQUIRES(_mutex);
  void queueEvent(Node& node, uint32_t event, uint64_t data) KIT_REQUIRES(_mutex);

  // Items.cpp
  std::vector<uint32_t> add(CameraState& camera, Shot shot) KIT_REQUIRES(_mutex);
  void removeItem(CameraState& camera, uint32_t id) KIT_EXCLUDES(_mutex);
  std::vector<Shot> unplug(uint32_t id) KIT_EXCLUDES(_mutex);
  static void abandon(const ObjectPtr& object, std::vector<Abandoned>& abandoned, bool sent);
  void tell(const std::vector<Abandoned>& abandoned) KIT_EXCLUDES(_mutex);
  void letGo() KIT_EXCLUDES(_mutex);

  // Capabilities.cpp
  std::vector<Capability> capabilities(const Object& object) const KIT_REQUIRES(_mutex);
  std::optional<Capability> capability(const Object& object, uint32_t id) const KIT_REQUIRES(_mutex);
  std::vector<uint32_t> children(const Object& object) const KIT_REQUIRES(_mutex);
  int32_t capInfo(const Object& object, const Call& call) const KIT_REQUIRES(_mutex);
  int32_t capRead(const Object& object, const Call& call) KIT_REQUIRES(_mutex);
  int32_t capSet(const ObjectPtr& object, const Call& call) KIT_REQUIRES(_mutex);
  int32_t capStart(const ObjectPtr& object, const Call& call) KIT_REQUIRES(_mutex);
  int32_t fire(const ObjectPtr& object, const ActionPtr& action) KIT_REQUIRES(_mutex);

  // Polls.cpp
  int32_t poll(const ObjectPtr& object) KIT_REQUIRES(_mutex);
  void deliverEvents(uint64_t horizon) KIT_REQUIRES(_mutex);
  ObjectPtr nextEvent(uint64_t horizon, Event& event) KIT_REQUIRES(_mutex);
  void deliverEvent(const ObjectPtr& object, const Event& event) KIT_REQUIRES(_mutex);
  void advanceActions(const ObjectPtr& polled, uint64_t horizon) KIT_REQUIRES(_mutex);
  void advance(const ObjectPtr& object, uint64_t horizon) KIT_REQUIRES(_mutex);
  bool eventsFirst(const Object& object, const Action& action) KIT_REQUIRES(_mutex);
  void endAction(Action& action, int32_t result) KIT_REQUIRES(_mutex);
  void complete(const ObjectPtr& object, uint64_t horizon) KIT_REQUIRES(_mutex);
  void callCompletion(const ObjectPtr& object, const Action& action) KIT_EXCLUDES(_mutex);
  template <typename Function>
  auto callBack(const ObjectPtr& object, Function function) KIT_REQUIRES(_mutex);

  // Transfers.cpp
  void transfer(const ObjectPtr& object, const ActionPtr& action) KIT_REQUIRES(_mutex);
  void deliverPiece(const ObjectPtr& object, const ActionPtr& action) KIT_REQUIRES(_mutex);
  void step(const ObjectPtr& object, Action& action, const tagNkMAIDFileInfo& info) KIT_EXCLUDES(_mutex);
  std::optional<int32_t> show(const ObjectPtr& object, const Action& action, const tagNkMAIDFileInfo& info,
                              const uint8_t* bytes) KIT_REQUIRES(_mutex);
  static bool isSent(const Object& object);

  mutable Mutex _mutex;
  Condition _callbackEnded;
  const Options _options;
  Hooks& _hooks;
  Node _module KIT_GUARDED_BY(_mutex);
  std::map<uint32_t, std::shared_ptr<Camera>> _cameras KIT_GUARDED_BY(_mutex);
  std::vector<std::shared_ptr<Camera>> _unplugged KIT_GUARDED_BY(_mutex);  // until nobody else holds them
  std::map<uint64_t, ObjectPtr> _objects KIT_GUARDED_BY(_mutex);
  uint64_t _lastHandle KIT_GUARDED_BY(_mutex) = 0;
  uint64_t _lastSequence KIT_GUARDED_BY(_mutex) = 0;
};

// Puts a core behind the entry point; takes it away if it is the one there.
void install(Core* core);
void uninstall(Core* core);

// Calls back without the lock. The object counts as being inside a callback on this thread meanwhile.
template <typename Function>
auto Core::callBack(const ObjectPtr& object, Function function) {
  struct Inside {
    Object& object;
    Condition& ended;
    ~Inside() {
      object.callbacks.erase(std::find(object.callbacks.begin(), object.callbacks.end(), std::this_thread::get_id()));
      ended.notifyAll();
    }
  };
  object->callbacks.push_back(std::this_thread::get_id());
  const Inside inside{*object, _callbackEnded};
  const Release release(_mutex);
  return function();
}

}  // namespace camerakit
