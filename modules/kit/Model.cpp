// What authors ask of a model, its cameras and exposures.
#include "Core.h"

namespace camerakit {

Model::Model(Options options, Hooks* hooks) : _core(std::make_shared<Core>(std::move(options), hooks)) {
  install(_core.get());
}

// Cameras may outlive it, and keep the core: what the core keeps of them goes here.
Model::~Model() {
  uninstall(_core.get());
  decltype(_core->_cameras) cameras;
  decltype(_core->_unplugged) unplugged;
  decltype(_core->_objects) objects;
  const Guard guard(_core->_mutex);
  cameras.swap(_core->_cameras);
  unplugged.swap(_core->_unplugged);
  objects.swap(_core->_objects);
}

void Model::plug(std::shared_ptr<Camera> camera) {
  const uint32_t id = camera->id();
  unplug(id);
  const Guard guard(_core->_mutex);
  camera.swap(_core->_cameras[id]);
  _core->queueEvent(_core->_module, kNkMAIDEvent_AddChild, id);
}

std::vector<Shot> Model::unplug(uint32_t id) { return _core->unplug(id); }

std::shared_ptr<Camera> Model::camera(uint32_t id) const {
  const Guard guard(_core->_mutex);
  const auto found = _core->_cameras.find(id);
  return found != _core->_cameras.end() ? found->second : nullptr;
}

std::vector<std::shared_ptr<Camera>> Model::cameras() const {
  const Guard guard(_core->_mutex);
  std::vector<std::shared_ptr<Camera>> all;
  for (const auto& [id, camera] : _core->_cameras) all.push_back(camera);
  return all;
}

void Model::raise(uint32_t event, uint64_t data) {
  const Guard guard(_core->_mutex);
  _core->queueEvent(_core->_module, event, data);
}

size_t Model::openObjects() const {
  const Guard guard(_core->_mutex);
  return _core->_objects.size();
}

Camera::Camera(const Model& model, uint32_t id, std::string name)
    : _core(model._core), _state(std::make_unique<CameraState>()) {
  _state->id = id;
  _state->name = std::move(name);
}

Camera::~Camera() = default;

uint32_t Camera::id() const { return _state->id; }

std::string Camera::name() const { return _state->name; }

void Camera::set(Capability capability) {
  const Guard guard(_core->_mutex);
  const uint32_t id = capability.id;
  const bool wasRemoved = _state->withoutCapabilities.erase(id) != 0;
  uint32_t event = kNkMAIDEvent_CapChange;
  const auto found = std::find_if(_state->settings.begin(), _state->settings.end(),
                                  [id](const Capability& setting) { return setting.id == id; });
  if (found == _state->settings.end()) {
    _state->settings.push_back(std::move(capability));
  } else {
    if (*found == capability && !wasRemoved) return;
    if (found->valueType == capability.valueType) event = kNkMAIDEvent_CapChangeValueOnly;
    *found = std::move(capability);
  }
  _core->queueEvent(*_state, event, id);
}

void Camera::remove(uint32_t capability) {
  const Guard guard(_core->_mutex);
  std::erase_if(_state->settings, [capability](const Capability& setting) { return setting.id == capability; });
  _state->withoutCapabilities.insert(capability);
  _core->queueEvent(*_state, kNkMAIDEvent_CapChange, capability);
}

void Camera::restore(uint32_t capability) {
  const Guard guard(_core->_mutex);
  if (_state->withoutCapabilities.erase(capability) != 0)
    _core->queueEvent(*_state, kNkMAIDEvent_CapChange, capability);
}

std::optional<Capability> Camera::get(uint32_t capability) const {
  const Guard guard(_core->_mutex);
  for (const Capability& setting : _state->settings)
    if (setting.id == capability) return setting;
  return std::nullopt;
}

void Camera::setAlive(bool alive) {
  const Guard guard(_core->_mutex);
  _state->alive = alive;
}

void Camera::setTransfer(const TransferOptions& options) {
  const Guard guard(_core->_mutex);
  _state->transfer = options;
}

std::vector<uint32_t> Camera::add(Shot shot) {
  const Guard guard(_core->_mutex);
  return _core->add(*_state, std::move(shot));
}

std::vector<uint32_t> Camera::items() const {
  const Guard guard(_core->_mutex);
  std::vector<uint32_t> ids;
  for (const auto& [id, item] : _state->items) ids.push_back(id);
  return ids;
}

void Camera::removeItem(uint32_t item) { _core->removeItem(*_state, item); }

void Camera::raise(uint32_t event, uint64_t data) {
  const Guard guard(_core->_mutex);
  _core->queueEvent(*_state, event, data);
}

void Camera::raise(uint32_t item, Level level, uint32_t event, uint64_t data) {
  const Guard guard(_core->_mutex);
  for (const auto& [handle, object] : _core->_objects) {
    if (object->camera.get() != this || object->target.item != item || object->target.level != level) continue;
    _core->queueEvent(level == Level::Data ? object->item->data : *object->item, event, data);
    return;
  }
}

int32_t Camera::fire(const Exposure& /*exposure*/) { return kNkMAIDResult_NotSupported; }

int32_t Camera::change(uint32_t /*capability*/, uint32_t /*value*/) { return kNkMAIDResult_NotSupported; }

void Camera::transferred(uint32_t /*item*/, const Picture& /*picture*/, int32_t /*result*/) {}

Exposure::Exposure(std::shared_ptr<Core> core, std::shared_ptr<Action> action)
    : _core(std::move(core)), _action(std::move(action)) {}

void Exposure::end(int32_t result) const {
  const Guard guard(_core->_mutex);
  _core->endAction(*_action, result != kNkMAIDResult_NoError ? result : _action->start.outcome);
}

bool Exposure::isAwaited() const {
  const Guard guard(_core->_mutex);
  return !_action->done;
}

const Call& Exposure::start() const { return _action->start; }

}  // namespace camerakit
