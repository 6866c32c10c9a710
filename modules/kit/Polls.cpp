// What a poll brings: events, deliveries, completions.
#include "Core.h"

namespace camerakit {
namespace {

bool advances(const Object& polled, const Object& object) {
  if (!object.action) return false;
  if (&polled == &object) return true;
  const bool above =
      polled.target.level == Level::Module || (polled.target.level == Level::Camera && polled.camera == object.camera);
  if (object.target.level == Level::Camera) return above;
  if (polled.target.level == Level::Item) return polled.item == object.item;
  return above && object.state->transfer.inModulePolls;
}

bool insideCallback(const Object& object) {
  return std::find(object.callbacks.begin(), object.callbacks.end(), std::this_thread::get_id()) !=
         object.callbacks.end();
}

}  // namespace

int32_t Core::poll(const ObjectPtr& object) {
  const uint64_t horizon = _lastSequence;
  if (isGone(*object)) return kNkMAIDResult_ZombieObject;
  deliverEvents(horizon);
  advanceActions(object, horizon);
  return kNkMAIDResult_NoError;
}

void Core::deliverEvents(uint64_t horizon) {
  Event event{};
  while (const ObjectPtr object = nextEvent(horizon, event)) deliverEvent(object, event);
}

// Takes the oldest event out. An object that is inside a callback gets no other at the same time: its events keep
// their order, whoever polls.
ObjectPtr Core::nextEvent(uint64_t horizon, Event& event) {
  ObjectPtr next;
  for (const auto& [handle, object] : _objects) {
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

void Core::deliverEvent(const ObjectPtr& object, const Event& event) {
  if (object->target.level == Level::Camera && event.event == kNkMAIDEvent_AddChild)
    if (const auto item = object->state->items.find(static_cast<uint32_t>(event.data));
        item != object->state->items.end())
      item->second->announced = true;

  const tagNkMAIDCallback proc = object->eventProc;
  if (proc.procedure == nullptr) return;
  callBack(object,
           [&] { reinterpret_cast<NkMAIDEventProc*>(proc.procedure)(proc.reference, event.event, event.data); });
}

// Objects may come and go whenever the lock is given up, hence the search from the last handle on.
void Core::advanceActions(const ObjectPtr& polled, uint64_t horizon) {
  // Of a data object there is nothing else to advance; and these polls are by far the most.
  if (polled->target.level == Level::Data) {
    if (polled->action && isOpen(*polled)) advance(polled, horizon);
    return;
  }
  for (auto next = _objects.begin(); next != _objects.end();) {
    const ObjectPtr object = next->second;
    if (advances(*polled, *object)) advance(object, horizon);
    next = _objects.upper_bound(object->handle);
  }
}

void Core::advance(const ObjectPtr& object, uint64_t horizon) {
  const ActionPtr action = object->action;
  if (action->busy) return;
  if (action->done) return complete(object, horizon);
  if (object->target.level == Level::Data && !isGone(*object)) transfer(object, action);
}

void Core::endAction(Action& action, int32_t result) {
  if (action.done) return;
  action.done = true;
  action.result = result;
  action.sequence = ++_lastSequence;
}

// A capture's completion comes after the events that it brought about, unless the client polls inside one of them.
bool Core::eventsFirst(const Object& object, const Action& action) {
  const Node& node = nodeOf(object);
  if (isGone(object) || node.opened != object.handle || object.eventProc.procedure == nullptr) return false;
  return !node.events.empty() && node.events.front().sequence < action.sequence && !insideCallback(object);
}

// A picture that the client has is not kept on the camera; its open objects live on until they are closed.
void Core::complete(const ObjectPtr& object, uint64_t horizon) {
  const ActionPtr action = object->action;
  if (action->sequence > horizon || eventsFirst(*object, *action)) return;
  action->busy = true;
  bool held = false;
  {
    const Release release(_mutex);
    held = _hooks.holdsBack(action->start);
  }
  action->busy = false;
  if (held || object->action != action) return;
  object->action.reset();
  if (object->item && action->result == kNkMAIDResult_NoError) object->state->items.erase(object->item->id);
  const Release release(_mutex);
  if (object->item) object->camera->transferred(object->item->id, object->item->picture, action->result);
  if (action->start.completion == nullptr) return;
  _hooks.carryOut(action->start,
                  [self = shared_from_this(), object, action] { self->callCompletion(object, *action); });
}

void Core::callCompletion(const ObjectPtr& object, const Action& action) {
  const Guard guard(_mutex);
  if (isOpen(*object)) callBack(object, [&] { _hooks.complete(action.start, action.result); });
}

}  // namespace camerakit
