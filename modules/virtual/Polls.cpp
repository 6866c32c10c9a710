// What a poll brings: events, captures, completions.
#include "Core.h"

namespace virtualcamera {
namespace {

constexpr uint64_t kDefaultPictureBytes = 100'000;

bool advances(const Object& polled, const Object& object) {
  if (!object.action) return false;
  if (&polled == &object) return true;
  const bool above =
      polled.target.level == Level::Module || (polled.target.level == Level::Camera && polled.camera == object.camera);
  if (object.target.level == Level::Camera) return above;
  if (polled.target.level == Level::Item) return polled.item == object.item;
  return above && object.camera->transfer.inModulePolls;
}

bool insideCallback(const Object& object) {
  return std::find(object.callbacks.begin(), object.callbacks.end(), std::this_thread::get_id()) !=
         object.callbacks.end();
}

void callCompletion(tagNkMAIDObject* record, const Action& action) {
  action.completion(record, kNkMAIDCommand_CapStart, action.capability, action.dataType, action.data, action.reference,
                    action.result);
}

}  // namespace

int32_t Core::poll(Lock& lock, const ObjectPtr& object) {
  const uint64_t horizon = lastSequence_;
  if (isGone(*object)) {
    if (object->action && object->action->done) complete(lock, object, horizon);
    return kNkMAIDResult_ZombieObject;
  }
  deliverStrays(lock, *object, horizon);
  deliverEvents(lock, *object, horizon);
  advanceActions(lock, object, horizon);
  return kNkMAIDResult_NoError;
}

void Core::deliverEvents(Lock& lock, const Object& polled, uint64_t horizon) {
  const bool transferring = polled.target.level == Level::Item || polled.target.level == Level::Data;
  if (transferring && !options_.eventsInTransferPolls) return;
  Event event{};
  while (const ObjectPtr object = nextEvent(horizon, event)) deliverEvent(lock, object, event);
}

// Takes the oldest event out. An object that is inside a callback gets no other at the same time: its events keep
// their order, whoever polls.
ObjectPtr Core::nextEvent(uint64_t horizon, Event& event) {
  ObjectPtr next;
  for (const auto& [handle, object] : objects_) {
    const Node& node = nodeOf(*object);
    if (node.opened != handle || node.events.empty() || !object->callbacks.empty()) continue;
    const uint64_t sequence = node.events.front().sequence;
    if (sequence > horizon || (next && sequence > event.sequence)) continue;
    next = object;
    event = node.events.front();
  }
  if (next) nodeOf(*next).events.pop_front();
  return next;
}

void Core::deliverEvent(Lock& lock, const ObjectPtr& object, const Event& event) {
  if (object->target.level == Level::Camera && event.event == kNkMAIDEvent_AddChild)
    if (const auto item = object->camera->items.find(static_cast<uint32_t>(event.data));
        item != object->camera->items.end())
      item->second->announced = true;

  const auto deliver = [this, object, event](Lock& held) {
    const tagNkMAIDCallback proc = object->eventProc;
    if (proc.procedure == nullptr || !objects_.contains(object->handle)) return;
    callBack(held, object,
             [&] { reinterpret_cast<NkMAIDEventProc*>(proc.procedure)(proc.reference, event.event, event.data); });
  };
  if (!options_.eventsOnOwnThread) return deliver(lock);
  worker_.post([this, deliver] {
    Lock held(mutex_);
    deliver(held);
  });
}

// Objects may come and go whenever the lock is given up, hence the search from the last handle on.
void Core::advanceActions(Lock& lock, const ObjectPtr& polled, uint64_t horizon) {
  // Of a data object there is nothing else to advance; and these polls are by far the most.
  if (polled->target.level == Level::Data) {
    if (polled->action && objects_.contains(polled->handle)) advance(lock, polled, horizon);
    return;
  }
  for (auto next = objects_.begin(); next != objects_.end();) {
    const ObjectPtr object = next->second;
    if (advances(*polled, *object)) advance(lock, object, horizon);
    next = objects_.upper_bound(object->handle);
  }
}

void Core::advance(Lock& lock, const ObjectPtr& object, uint64_t horizon) {
  const std::shared_ptr<Action> action = object->action;
  if (action->busy) return;
  if (action->done) return complete(lock, object, horizon);
  if (isGone(*object)) return;
  if (action->capability == kNkMAIDCapability_Capture) {
    shutter(lock, object, *action);
  } else {
    transfer(lock, object, action);
  }
}

void Core::shutter(Lock& lock, const ObjectPtr& object, Action& action) {
  CameraState& camera = *object->camera;
  if (++action.polls < camera.capture.polls) return;
  const int32_t result = action.fault.completionResult.value_or(kNkMAIDResult_NoError);
  if (result != kNkMAIDResult_NoError) return endAction(action, result);
  action.busy = true;
  Shot shot = nextShot(lock, camera);
  action.busy = false;
  if (camera.gone) return;
  if (shot.empty()) return endAction(action, kNkMAIDResult_CaptureFailure);
  addItems(camera, std::move(shot));
  if (camera.capture.completeEvent) queueEvent(camera, kNkMAIDEvent_CaptureComplete, 0);
  endAction(action, result);
}

Shot Core::nextShot(Lock& lock, CameraState& camera) {
  const uint32_t number = ++camera.shots;
  if (!camera.roll.empty()) {
    Shot shot = std::move(camera.roll.front());
    camera.roll.pop_front();
    return shot;
  }
  const std::shared_ptr<const ShotMaker> maker = camera.maker;
  if (!maker || !*maker) return {Picture::pattern(kNkMAIDFileDataType_JPEG, kDefaultPictureBytes)};
  lock.unlock();
  Shot shot;
  try {
    shot = (*maker)(number);
  } catch (...) {  // no picture, then
  }
  lock.lock();
  return shot;
}

// A capture's completion comes after the events that it brought about, unless the client polls inside one of them.
bool Core::eventsFirst(const Object& object, const Action& action) {
  const Node& node = nodeOf(object);
  if (isGone(object) || node.opened != object.handle || object.eventProc.procedure == nullptr) return false;
  return !node.events.empty() && node.events.front().sequence < action.sequence && !insideCallback(object);
}

void Core::complete(Lock& lock, const ObjectPtr& object, uint64_t horizon) {
  const std::shared_ptr<Action> action = object->action;
  if (action->busy || action->sequence > horizon || eventsFirst(*object, *action)) return;
  if (action->fault.completionAfterClose || action->latePolls++ < action->fault.completionPolls) return;
  object->action.reset();
  dropTransferred(*object, *action);
  if (action->completion == nullptr || action->fault.noCompletion) return;
  if (action->fault.completionTwice) strays_.push_back({++lastSequence_, object->record, action});

  const auto deliver = [this, object, action](Lock& held) {
    if (!objects_.contains(object->handle)) return;
    callBack(held, object, [&] { callCompletion(object->record, *action); });
  };
  if (!action->fault.ownThread) return deliver(lock);
  worker_.post([this, deliver] {
    Lock held(mutex_);
    deliver(held);
  });
}

// A picture that the client has is not kept on the camera; its open objects live on until they are closed.
void Core::dropTransferred(const Object& object, const Action& action) {
  if (action.capability != kNkMAIDCapability_Acquire || action.result != kNkMAIDResult_NoError) return;
  object.camera->items.erase(object.item->id);
}

void Core::deliverStrays(Lock& lock, const Object& polled, uint64_t horizon) {
  if (polled.target.level != Level::Module) return;
  while (!strays_.empty() && strays_.front().sequence <= horizon) {
    const StrayCompletion stray = strays_.front();
    strays_.erase(strays_.begin());
    lock.unlock();
    callCompletion(stray.record, *stray.action);
    lock.lock();
  }
}

}  // namespace virtualcamera
