// Opening and closing, and what is queued for what is open.
#include "Core.h"

namespace camerakit {
namespace {

bool isQueued(const Node& node, uint32_t event, uint64_t data) {
  return std::any_of(node.events.begin(), node.events.end(),
                     [&](const Event& e) { return e.event == event && e.data == data; });
}

}  // namespace

// The record says which object it is; that it is still the one that was opened with this very record is checked.
ObjectPtr Core::find(const tagNkMAIDObject* record) const {
  if (record == nullptr) return nullptr;
  const auto found = _objects.find(record->sdkHead);
  return found != _objects.end() && found->second->record == record ? found->second : nullptr;
}

bool Core::isGone(const Object& object) {
  return object.orphaned || (object.state != nullptr && object.state->gone) || (object.item && object.item->gone);
}

Node& Core::nodeOf(const Object& object) {
  switch (object.target.level) {
    case Level::Camera:
      return *object.state;
    case Level::Item:
      return *object.item;
    case Level::Data:
      return object.item->data;
    default:
      return _module;
  }
}

int32_t Core::open(const Call& call) {
  auto* record = reinterpret_cast<tagNkMAIDObject*>(call.data);
  if (call.dataType != kNkMAIDDataType_ObjectPtr || record == nullptr) return kNkMAIDResult_UnexpectedDataType;
  const ObjectPtr parent = find(call.object);
  if (call.object != nullptr && (!parent || isGone(*parent))) return kNkMAIDResult_ZombieObject;

  auto object = std::make_shared<Object>();
  if (const int32_t result = place(parent, call.parameter, *object)) return result;
  if (object->target.level == Level::Camera)
    if (const int32_t result = connect(parent, *object)) return result;
  object->handle = ++_lastHandle;
  object->record = record;
  object->parent = parent ? parent->handle : 0;
  record->sdkHead = object->handle;
  nodeOf(*object).opened = object->handle;
  _objects.emplace(object->handle, object);
  return kNkMAIDResult_NoError;
}

// Finds what the id names below the parent.
int32_t Core::place(const ObjectPtr& parent, uint32_t id, Object& object) {
  if (!parent) {
    object.target.level = Level::Module;
    return id == 0 ? kNkMAIDResult_NoError : kNkMAIDResult_ValueOutOfBounds;
  }
  object.target = parent->target;
  object.camera = parent->camera;
  object.state = parent->state;
  object.item = parent->item;
  if (parent->target.level == Level::Module) {
    const auto found = _cameras.find(id);
    if (found == _cameras.end()) return kNkMAIDResult_ValueOutOfBounds;
    object.camera = found->second;
    object.state = object.camera->_state.get();
    object.target = {Level::Camera, id, 0};
    return kNkMAIDResult_NoError;
  }
  if (parent->target.level == Level::Camera) {
    const auto found = parent->state->items.find(id);
    if (found == parent->state->items.end()) return kNkMAIDResult_ValueOutOfBounds;
    object.item = found->second;
    object.target = {Level::Item, parent->target.camera, id};
    return kNkMAIDResult_NoError;
  }
  if (parent->target.level != Level::Item) return kNkMAIDResult_NotSupported;
  if ((parent->item->picture.dataTypes & id) == 0) return kNkMAIDResult_ValueOutOfBounds;
  object.target.level = Level::Data;
  return kNkMAIDResult_NoError;
}

// Asks the author; meanwhile the camera may have been unplugged, or its module closed.
int32_t Core::connect(const ObjectPtr& parent, const Object& object) {
  int32_t refused = kNkMAIDResult_NoError;
  {
    const Release release(_mutex);
    refused = object.camera->opened();
  }
  if (refused != kNkMAIDResult_NoError || (isOpen(*parent) && !isGone(*parent) && !isGone(object))) return refused;
  const Release release(_mutex);
  object.camera->closed();
  return kNkMAIDResult_ZombieObject;
}

// What is open below a closed object stays open, and counts as such, but is good for nothing but its own close.
int32_t Core::close(const ObjectPtr& object) {
  std::vector<Abandoned> abandoned;
  abandon(object, abandoned, false);
  _objects.erase(object->handle);
  object->record->sdkHead = 0;
  if (Node& node = nodeOf(*object); node.opened == object->handle) {
    node.opened = 0;
    node.events.clear();
    if (object->target.level == Level::Camera)
      for (auto& [id, item] : object->state->items) item->announced = false;
  }
  std::set<uint64_t> closed{object->handle};
  for (auto& [handle, other] : _objects) {  // parents have lower handles than their children
    if (!closed.contains(other->parent)) continue;
    other->orphaned = true;
    closed.insert(handle);
  }
  waitForCallbacks(*object);
  const Release release(_mutex);
  tell(abandoned);
  if (object->target.level == Level::Camera) object->camera->closed();
  return closed.size() == 1 ? kNkMAIDResult_NoError : kNkMAIDResult_OrphanedChildren;
}

void Core::waitForCallbacks(const Object& object) {
  const auto noneElsewhere = [&object] {
    return std::all_of(object.callbacks.begin(), object.callbacks.end(),
                       [](std::thread::id id) { return id == std::this_thread::get_id(); });
  };
  const auto end = Clock::now() + _options.closeWait;
  while (!noneElsewhere() && _callbackEnded.waitUntil(_mutex, end)) continue;
}

int32_t Core::setCallback(const ObjectPtr& object, const Call& call) {
  const bool events = call.parameter == kNkMAIDCapability_EventProc;
  tagNkMAIDCallback& slot = events ? object->eventProc : object->dataProc;
  if (call.dataType == kNkMAIDDataType_Null) {
    slot = {};
    if (Node& node = nodeOf(*object); events && node.opened == object->handle) node.events.clear();
    waitForCallbacks(*object);
    return kNkMAIDResult_NoError;
  }
  const auto* callback = reinterpret_cast<const tagNkMAIDCallback*>(call.data);
  if (call.dataType != kNkMAIDDataType_CallbackPtr || callback == nullptr) return kNkMAIDResult_UnexpectedDataType;
  slot = *callback;
  if (events && object->target.level == Level::Camera) announceItems(*object->state);
  return kNkMAIDResult_NoError;
}

// Pictures that nobody was there to hear of.
void Core::announceItems(CameraState& camera) {
  for (const auto& [id, item] : camera.items)
    if (!item->announced && !isQueued(camera, kNkMAIDEvent_AddChild, id)) queueEvent(camera, kNkMAIDEvent_AddChild, id);
}

int32_t Core::enumChildren(const Object& object) {
  Node& node = nodeOf(object);
  for (const uint32_t id : children(object))
    if (!isQueued(node, kNkMAIDEvent_AddChild, id)) queueEvent(node, kNkMAIDEvent_AddChild, id);
  return kNkMAIDResult_NoError;
}

void Core::queueEvent(Node& node, uint32_t event, uint64_t data) {
  const auto found = _objects.find(node.opened);
  if (found == _objects.end() || found->second->eventProc.procedure == nullptr) return;
  node.events.push_back({++_lastSequence, event, data});
}

}  // namespace camerakit
