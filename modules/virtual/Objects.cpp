// Opening, closing and what becomes of open objects when a camera or a picture goes.
#include "Core.h"

namespace virtualcamera {
namespace {

bool eraseQueued(Node& node, uint32_t event, uint64_t data) {
  return std::erase_if(node.events, [&](const Event& e) { return e.event == event && e.data == data; }) != 0;
}

bool isQueued(const Node& node, uint32_t event, uint64_t data) {
  return std::any_of(node.events.begin(), node.events.end(),
                     [&](const Event& e) { return e.event == event && e.data == data; });
}

}  // namespace

// The record says which object it is; that it is still the one that was opened with this very record is checked.
ObjectPtr Core::find(const tagNkMAIDObject* record) const {
  if (record == nullptr) return nullptr;
  const auto found = objects_.find(record->sdkHead);
  return found != objects_.end() && found->second->record == record ? found->second : nullptr;
}

bool Core::isGone(const Object& object) {
  return object.orphaned || (object.camera && object.camera->gone) || (object.item && object.item->gone);
}

Node& Core::nodeOf(const Object& object) {
  switch (object.target.level) {
    case Level::Camera:
      return *object.camera;
    case Level::Item:
      return *object.item;
    case Level::Data:
      return object.item->data;
    default:
      return module_;
  }
}

int32_t Core::open(Lock&, tagNkMAIDObject* parent, const Arguments& arguments) {
  auto* record = reinterpret_cast<tagNkMAIDObject*>(arguments.data);
  if (arguments.dataType != kNkMAIDDataType_ObjectPtr || record == nullptr) return kNkMAIDResult_UnexpectedDataType;
  const ObjectPtr parentObject = find(parent);
  if (parent != nullptr && (!parentObject || isGone(*parentObject))) return kNkMAIDResult_ZombieObject;

  auto object = std::make_shared<Object>();
  if (const int32_t result = place(parentObject, arguments.parameter, *object)) return result;
  object->handle = ++lastHandle_;
  object->record = record;
  object->parent = parentObject ? parentObject->handle : 0;
  record->sdkHead = object->handle;
  nodeOf(*object).opened = object->handle;
  objects_.emplace(object->handle, object);
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
  object.item = parent->item;
  if (parent->target.level == Level::Module) {
    const auto found = cameras_.find(id);
    if (found == cameras_.end()) return kNkMAIDResult_ValueOutOfBounds;
    object.camera = found->second.first;
    object.target = {Level::Camera, id, 0};
    return kNkMAIDResult_NoError;
  }
  if (parent->target.level == Level::Camera) {
    const auto found = parent->camera->items.find(id);
    if (found == parent->camera->items.end()) return kNkMAIDResult_ValueOutOfBounds;
    object.item = found->second;
    object.target = {Level::Item, parent->target.camera, id};
    return kNkMAIDResult_NoError;
  }
  if (parent->target.level != Level::Item) return kNkMAIDResult_NotSupported;
  if ((parent->item->picture.dataTypes & id) == 0) return kNkMAIDResult_ValueOutOfBounds;
  object.target.level = Level::Data;
  return kNkMAIDResult_NoError;
}

// What is open below a closed object stays open, and counts as such, but is good for nothing but its own close.
int32_t Core::close(Lock& lock, const ObjectPtr& object) {
  abandon(*object);
  objects_.erase(object->handle);
  object->record->sdkHead = 0;
  if (Node& node = nodeOf(*object); node.opened == object->handle) {
    node.opened = 0;
    node.events.clear();
    if (object->target.level == Level::Camera)
      for (auto& [id, item] : object->camera->items) item->announced = false;
  }
  std::set<uint64_t> closed{object->handle};
  for (auto& [handle, other] : objects_) {  // parents have lower handles than their children
    if (!closed.contains(other->parent)) continue;
    other->orphaned = true;
    closed.insert(handle);
  }
  waitForCallbacks(lock, *object);
  return closed.size() == 1 ? kNkMAIDResult_NoError : kNkMAIDResult_OrphanedChildren;
}

// The object's action ends with the object, without a completion, unless a fault wants a late one.
void Core::abandon(Object& object) {
  if (object.action && object.action->fault.completionAfterClose && object.action->completion != nullptr)
    strays_.push_back({++lastSequence_, object.record, object.action});
  object.action.reset();
}

void Core::waitForCallbacks(Lock& lock, const Object& object) {
  const auto noneElsewhere = [&object] {
    return std::all_of(object.callbacks.begin(), object.callbacks.end(),
                       [](std::thread::id id) { return id == std::this_thread::get_id(); });
  };
  if (!noneElsewhere()) callbackEnded_.wait_for(lock, options_.closeWait, noneElsewhere);
}

int32_t Core::setCallback(Lock& lock, const ObjectPtr& object, const Arguments& arguments) {
  const bool events = arguments.parameter == kNkMAIDCapability_EventProc;
  tagNkMAIDCallback& slot = events ? object->eventProc : object->dataProc;
  if (arguments.dataType == kNkMAIDDataType_Null) {
    slot = {};
    if (Node& node = nodeOf(*object); events && node.opened == object->handle) node.events.clear();
    waitForCallbacks(lock, *object);
    return kNkMAIDResult_NoError;
  }
  const auto* callback = reinterpret_cast<const tagNkMAIDCallback*>(arguments.data);
  if (arguments.dataType != kNkMAIDDataType_CallbackPtr || callback == nullptr) return kNkMAIDResult_UnexpectedDataType;
  slot = *callback;
  if (events && object->target.level == Level::Camera) announceItems(*object->camera);
  return kNkMAIDResult_NoError;
}

// Pictures that nobody was there to hear of.
void Core::announceItems(CameraState& camera) {
  for (const auto& [id, item] : camera.items)
    if (!item->announced && !isQueued(camera, kNkMAIDEvent_AddChild, id)) queueEvent(camera, kNkMAIDEvent_AddChild, id);
}

int32_t Core::enumChildren(Lock&, const Object& object) {
  Node& node = nodeOf(object);
  for (const uint32_t id : children(object))
    if (!isQueued(node, kNkMAIDEvent_AddChild, id)) queueEvent(node, kNkMAIDEvent_AddChild, id);
  return kNkMAIDResult_NoError;
}

void Core::queueEvent(Node& node, uint32_t event, uint64_t data) {
  const auto found = objects_.find(node.opened);
  if (found == objects_.end() || found->second->eventProc.procedure == nullptr) return;
  node.events.push_back({++lastSequence_, event, data});
}

std::vector<uint32_t> Core::addItems(CameraState& camera, Shot shot) {
  std::vector<uint32_t> ids;
  const bool pair = shot.size() == 2;
  for (Picture& picture : shot) {
    auto item = std::make_shared<ItemState>();
    item->id = ++camera.lastItem;
    item->picture = std::move(picture);
    ids.push_back(item->id);
    item->pair = pair ? ids.front() : 0;
    camera.items.emplace(item->id, std::move(item));
    queueEvent(camera, kNkMAIDEvent_AddChild, ids.back());
  }
  return ids;
}

void Core::removeItem(CameraState& camera, uint32_t id) {
  const auto found = camera.items.find(id);
  if (found == camera.items.end()) return;
  const std::shared_ptr<ItemState> item = found->second;
  camera.items.erase(found);
  item->gone = true;
  for (auto& [handle, object] : objects_)
    if (object->item == item) endUnplugged(*object);
  if (!eraseQueued(camera, kNkMAIDEvent_AddChild, id)) queueEvent(camera, kNkMAIDEvent_RemoveChild, id);
}

std::vector<Shot> Core::removeCamera(uint32_t id) {
  const auto found = cameras_.find(id);
  if (found == cameras_.end()) return {};
  const std::shared_ptr<CameraState> camera = found->second.first;
  cameras_.erase(found);
  for (const auto& [handle, object] : objects_)
    if (object->camera == camera && isSent(*object)) camera->items.erase(object->item->id);
  camera->gone = true;
  camera->events.clear();
  for (auto& [handle, object] : objects_)
    if (object->camera == camera) endUnplugged(*object);
  if (!eraseQueued(module_, kNkMAIDEvent_AddChild, id)) queueEvent(module_, kNkMAIDEvent_RemoveChild, id);
  return shotsOn(*camera);
}

std::vector<Shot> Core::shotsOn(const CameraState& camera) {
  std::vector<Shot> shots;
  uint32_t pair = 0;
  for (const auto& [id, item] : camera.items) {
    if (pair == 0 || item->pair != pair) shots.emplace_back();
    shots.back().push_back(item->picture);
    pair = item->pair;
  }
  return shots;
}

void Core::endUnplugged(Object& object) {
  if (!object.action) return;
  if (options_.unplugResult) {
    endAction(*object.action, *options_.unplugResult);
  } else {
    abandon(object);
  }
}

void Core::endAction(Action& action, int32_t result) {
  if (action.done) return;
  action.done = true;
  action.result = result;
  action.sequence = ++lastSequence_;
}

}  // namespace virtualcamera
