// Pictures on a camera, and what becomes of them and of open objects when the camera or a picture goes.
#include <iterator>

#include "Core.h"

namespace camerakit {
namespace {

bool eraseQueued(Node& node, uint32_t event, uint64_t data) {
  return std::erase_if(node.events, [&](const Event& e) { return e.event == event && e.data == data; }) != 0;
}

std::vector<Shot> shotsOn(const CameraState& camera) {
  std::vector<Shot> shots;
  uint32_t pair = 0;
  for (const auto& [id, item] : camera.items) {
    if (pair == 0 || item->pair != pair) shots.emplace_back();
    shots.back().push_back(item->picture);
    pair = item->pair;
  }
  return shots;
}

}  // namespace

std::vector<uint32_t> Core::add(CameraState& camera, Shot shot) {
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
  std::vector<Abandoned> abandoned;
  {
    const Guard guard(_mutex);
    const auto found = camera.items.find(id);
    if (found == camera.items.end()) return;
    const std::shared_ptr<ItemState> item = found->second;
    camera.items.erase(found);
    item->gone = true;
    for (auto& [handle, object] : _objects)
      if (object->item == item) abandon(object, abandoned, false);
    if (!eraseQueued(camera, kNkMAIDEvent_AddChild, id)) queueEvent(camera, kNkMAIDEvent_RemoveChild, id);
  }
  tell(abandoned);
}

std::vector<Shot> Core::unplug(uint32_t id) {
  std::vector<Abandoned> abandoned;
  std::vector<Shot> left;
  {
    const Guard guard(_mutex);
    const auto found = _cameras.find(id);
    if (found == _cameras.end()) return {};
    const std::shared_ptr<Camera> camera = found->second;
    CameraState& state = *camera->_state;
    _cameras.erase(found);
    _unplugged.push_back(camera);
    state.gone = true;
    state.events.clear();
    for (auto& [handle, object] : _objects) {
      if (object->camera != camera) continue;
      const bool sent = isSent(*object);
      if (sent) state.items.erase(object->item->id);
      abandon(object, abandoned, sent);
    }
    left = shotsOn(state);
    if (!eraseQueued(_module, kNkMAIDEvent_AddChild, id)) queueEvent(_module, kNkMAIDEvent_RemoveChild, id);
  }
  tell(abandoned);
  abandoned.clear();
  letGo();
  return left;
}

// Cameras that nobody holds any more. An author's destructor may wait for a thread that wants the lock.
void Core::letGo() {
  std::vector<std::shared_ptr<Camera>> unused;
  const Guard guard(_mutex);
  const auto first =
      std::partition(_unplugged.begin(), _unplugged.end(), [](const auto& c) { return c.use_count() > 1; });
  unused.assign(std::move_iterator(first), std::move_iterator(_unplugged.end()));
  _unplugged.erase(first, _unplugged.end());
}

void Core::abandon(const ObjectPtr& object, std::vector<Abandoned>& abandoned, bool sent) {
  if (!object->action) return;
  abandoned.push_back({object, object->action, sent});
  object->action->done = true;
  object->action.reset();
}

void Core::tell(const std::vector<Abandoned>& abandoned) {
  for (const auto& [object, action, sent] : abandoned) {
    _hooks.abandoned(action->start, action->result);
    if (object->item)
      object->camera->transferred(object->item->id, object->item->picture,
                                  sent ? kNkMAIDResult_NoError : kNkMAIDResult_Aborted);
  }
}

}  // namespace camerakit
