// The state behind a Model, and the commands on it. Internal.
//
// Functions whose first parameter is a Lock are called with the model's lock held and return with it held; those that
// call back give it up in between, so what they were told before may have changed. An object that was closed
// meanwhile is not in objects_ any more.
#pragma once

#include <algorithm>
#include <condition_variable>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <set>

#include "VirtualCamera.h"
#include "Worker.h"

namespace virtualcamera {

using Lock = std::unique_lock<std::mutex>;
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
  Picture picture;
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
  CaptureOptions capture;
  std::deque<Shot> roll;
  std::shared_ptr<const ShotMaker> maker;
  std::map<uint32_t, std::shared_ptr<ItemState>> items;
  uint32_t lastItem = 0;
  uint32_t shots = 0;
};

// A started capture or transfer.
struct Action {
  uint32_t capability = 0;
  uint32_t dataType = 0;
  uint64_t data = 0;
  NkMAIDCompletionProc* completion = nullptr;
  void* reference = nullptr;
  Fault fault;

  Clock::time_point started = Clock::now();
  uint32_t polls = 0;  // since the start, or since the last delivery
  uint64_t offset = 0;
  uint32_t deliveries = 0;
  bool busy = false;  // a poll is at it, or the module's own thread
  std::vector<uint8_t> scratch;

  bool done = false;      // only the completion is missing
  uint64_t sequence = 0;  // where the completion stands among the events
  uint32_t latePolls = 0;
  int32_t result = kNkMAIDResult_NoError;
};

struct Object {
  uint64_t handle = 0;
  Target target;
  tagNkMAIDObject* record = nullptr;
  uint64_t parent = 0;
  std::shared_ptr<CameraState> camera;  // null for the module
  std::shared_ptr<ItemState> item;      // null for module and cameras
  bool orphaned = false;                // its parent was closed before it
  tagNkMAIDCallback eventProc{};
  tagNkMAIDCallback dataProc{};
  std::vector<std::thread::id> callbacks;  // threads inside a callback of this object
  std::shared_ptr<Action> action;
};
using ObjectPtr = std::shared_ptr<Object>;

// A completion that comes apart from its action: a second time, or after the close.
struct StrayCompletion {
  uint64_t sequence;
  tagNkMAIDObject* record;
  std::shared_ptr<Action> action;
};

struct Arguments {
  uint32_t command;
  uint32_t parameter;
  uint32_t dataType;
  uint64_t data;
  NkMAIDCompletionProc* completion;
  void* reference;
};

class Core {
 public:
  explicit Core(Options options) : options_(std::move(options)) {}

  int32_t entry(tagNkMAIDObject* record, const Arguments& arguments);

  // Used by Model and Camera, which take the lock themselves.
  void queueEvent(Node& node, uint32_t event, uint64_t data);
  std::vector<uint32_t> addItems(CameraState& camera, Shot shot);
  void removeItem(CameraState& camera, uint32_t id);
  std::vector<Shot> removeCamera(uint32_t id);

  mutable std::mutex mutex_;
  Options options_;
  FaultPlan faults_;
  Node module_;
  std::set<uint32_t> moduleWithout_;
  std::map<uint32_t, std::pair<std::shared_ptr<CameraState>, std::unique_ptr<Camera>>> cameras_;
  std::map<uint64_t, ObjectPtr> objects_;
  std::shared_ptr<const CallHook> before_;
  std::shared_ptr<const CallHook> after_;
  bool recording_ = false;
  std::vector<Call> calls_;
  uint64_t failingCall_ = 0;
  uint64_t countedCalls_ = 0;
  int32_t failingResult_ = 0;
  Counting counting_;

 private:
  // EntryPoint.cpp
  Call describe(Lock&, tagNkMAIDObject* record, const Arguments& arguments) const;
  bool failsNow(Lock&, const Call& call);
  int32_t run(tagNkMAIDObject* record, const Arguments& arguments, const Fault* fault);
  int32_t dispatch(Lock&, const ObjectPtr& object, const Arguments& arguments, const Fault* fault);

  // Objects.cpp
  ObjectPtr find(const tagNkMAIDObject* record) const;
  static bool isGone(const Object& object);
  Node& nodeOf(const Object& object);
  int32_t open(Lock&, tagNkMAIDObject* parent, const Arguments& arguments);
  int32_t place(const ObjectPtr& parent, uint32_t id, Object& object);
  int32_t close(Lock&, const ObjectPtr& object);
  int32_t setCallback(Lock&, const ObjectPtr& object, const Arguments& arguments);
  void announceItems(CameraState& camera);
  int32_t enumChildren(Lock&, const Object& object);
  void abandon(Object& object);
  void endUnplugged(Object& object);
  static std::vector<Shot> shotsOn(const CameraState& camera);
  void waitForCallbacks(Lock&, const Object& object);
  void endAction(Action& action, int32_t result);

  // Capabilities.cpp
  std::vector<Capability> capabilities(const Object& object) const;
  std::optional<Capability> capability(const Object& object, uint32_t id, const Fault* fault) const;
  std::vector<uint32_t> children(const Object& object) const;
  int32_t capInfo(const Object& object, const Arguments& arguments) const;
  int32_t capGet(const Object& object, const Arguments& arguments, const Fault* fault) const;
  int32_t capGetArray(const Object& object, const Arguments& arguments, const Fault* fault) const;
  int32_t capSet(Lock&, const ObjectPtr& object, const Arguments& arguments);
  int32_t capStart(Lock&, const ObjectPtr& object, const Arguments& arguments, const Fault* fault);

  // Polls.cpp
  int32_t poll(Lock&, const ObjectPtr& object);
  void deliverEvents(Lock&, const Object& polled, uint64_t horizon);
  ObjectPtr nextEvent(uint64_t horizon, Event& event);
  void deliverEvent(Lock&, const ObjectPtr& object, const Event& event);
  void advanceActions(Lock&, const ObjectPtr& polled, uint64_t horizon);
  void advance(Lock&, const ObjectPtr& object, uint64_t horizon);
  void shutter(Lock&, const ObjectPtr& object, Action& action);
  Shot nextShot(Lock&, CameraState& camera);
  void complete(Lock&, const ObjectPtr& object, uint64_t horizon);
  void deliverStrays(Lock&, const Object& polled, uint64_t horizon);
  void dropTransferred(const Object& object, const Action& action);
  bool eventsFirst(const Object& object, const Action& action);
  template <typename Function>
  auto callBack(Lock&, const ObjectPtr& object, Function function);

  // Transfers.cpp
  void transfer(Lock&, const ObjectPtr& object, const std::shared_ptr<Action>& action);
  bool deliveryDue(const Object& object, Action& action) const;
  void deliverPiece(Lock&, const ObjectPtr& object, const std::shared_ptr<Action>& action);
  int32_t showPiece(Lock&, const ObjectPtr& object, const std::shared_ptr<Action>& action, tagNkMAIDFileInfo info);
  static bool isSent(const Object& object);
  void finishDelivery(const ObjectPtr& object, Action& action, uint32_t length, int32_t result);

  std::condition_variable callbackEnded_;
  std::vector<StrayCompletion> strays_;
  uint64_t lastHandle_ = 0;
  uint64_t lastSequence_ = 0;
  Worker worker_;  // last: its thread ends before anything it works on goes
};

// Puts a core behind the entry point; takes it away if it is the one there.
void install(Core* core);
void uninstall(Core* core);

// Calls back without the lock. The object counts as being inside a callback on this thread meanwhile.
template <typename Function>
auto Core::callBack(Lock& lock, const ObjectPtr& object, Function function) {
  struct Inside {
    Lock& lock;
    Core& core;
    Object& object;
    ~Inside() {
      lock.lock();
      object.callbacks.erase(std::find(object.callbacks.begin(), object.callbacks.end(), std::this_thread::get_id()));
      core.callbackEnded_.notify_all();
    }
  };
  object->callbacks.push_back(std::this_thread::get_id());
  lock.unlock();
  const Inside inside{lock, *this, *object};
  return function();
}

}  // namespace virtualcamera
