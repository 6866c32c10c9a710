// What scripts do to a model and its cameras.
#include "Core.h"

namespace virtualcamera {

Model::Model(Options options) : core_(std::make_unique<Core>(std::move(options))) { install(core_.get()); }

Model::~Model() { uninstall(core_.get()); }

NkMAIDEntryPoint* Model::entryPoint() { return virtualcamera::entryPoint; }

Camera& Model::addCamera(uint32_t id, const std::string& name) {
  removeCamera(id);
  auto state = std::make_shared<CameraState>();
  state->id = id;
  state->name = name;
  state->settings = defaultSettings();
  auto camera = std::make_unique<Camera>(*core_, state);
  Camera& handle = *camera;
  const Lock lock(core_->mutex_);
  core_->cameras_[id] = {std::move(state), std::move(camera)};
  core_->queueEvent(core_->module_, kNkMAIDEvent_AddChild, id);
  return handle;
}

std::vector<Shot> Model::removeCamera(uint32_t id) {
  const Lock lock(core_->mutex_);
  return core_->removeCamera(id);
}

Camera* Model::camera(uint32_t id) {
  const Lock lock(core_->mutex_);
  const auto found = core_->cameras_.find(id);
  return found != core_->cameras_.end() ? found->second.second.get() : nullptr;
}

std::vector<uint32_t> Model::cameras() const {
  const Lock lock(core_->mutex_);
  std::vector<uint32_t> ids;
  for (const auto& [id, camera] : core_->cameras_) ids.push_back(id);
  return ids;
}

void Model::raise(uint32_t event, uint64_t data) {
  const Lock lock(core_->mutex_);
  core_->queueEvent(core_->module_, event, data);
}

void Model::remove(uint32_t capability) {
  const Lock lock(core_->mutex_);
  core_->moduleWithout_.insert(capability);
}

FaultPlan& Model::faults() { return core_->faults_; }

void Model::failCall(uint64_t k, int32_t result, Counting counting) {
  const Lock lock(core_->mutex_);
  core_->failingCall_ = k;
  core_->failingResult_ = result;
  core_->counting_ = counting;
  core_->countedCalls_ = 0;
}

uint64_t Model::countedCalls() const {
  const Lock lock(core_->mutex_);
  return core_->countedCalls_;
}

void Model::beforeCall(CallHook hook) {
  auto shared = hook ? std::make_shared<const CallHook>(std::move(hook)) : nullptr;
  const Lock lock(core_->mutex_);
  core_->before_.swap(shared);
}

void Model::afterCall(CallHook hook) {
  auto shared = hook ? std::make_shared<const CallHook>(std::move(hook)) : nullptr;
  const Lock lock(core_->mutex_);
  core_->after_.swap(shared);
}

void Model::record(bool on) {
  const Lock lock(core_->mutex_);
  core_->recording_ = on;
  if (on) core_->calls_.clear();
}

std::vector<Call> Model::calls() const {
  const Lock lock(core_->mutex_);
  return core_->calls_;
}

std::vector<Target> Model::closed() const {
  const Lock lock(core_->mutex_);
  std::vector<Target> targets;
  for (const Call& call : core_->calls_) {
    const bool closed = call.result == kNkMAIDResult_NoError || call.result == kNkMAIDResult_OrphanedChildren;
    if (call.command == kNkMAIDCommand_Close && closed) targets.push_back(call.target);
  }
  return targets;
}

size_t Model::openObjects() const {
  const Lock lock(core_->mutex_);
  return core_->objects_.size();
}

Camera::Camera(Core& core, std::shared_ptr<CameraState> state) : core_(core), state_(std::move(state)) {}

Camera::~Camera() = default;

uint32_t Camera::id() const { return state_->id; }

std::string Camera::name() const { return state_->name; }

uint32_t Camera::shoot(Picture picture) {
  Shot shot;
  shot.push_back(std::move(picture));
  return shoot(std::move(shot)).front();
}

std::vector<uint32_t> Camera::shootPair(Picture raw, Picture jpeg) {
  Shot shot;
  shot.push_back(std::move(raw));
  shot.push_back(std::move(jpeg));
  return shoot(std::move(shot));
}

std::vector<uint32_t> Camera::shoot(Shot shot) {
  const Lock lock(core_.mutex_);
  return core_.addItems(*state_, std::move(shot));
}

void Camera::load(Shot shot) {
  const Lock lock(core_.mutex_);
  state_->roll.push_back(std::move(shot));
}

void Camera::load(Picture picture) {
  Shot shot;
  shot.push_back(std::move(picture));
  load(std::move(shot));
}

void Camera::setMaker(ShotMaker maker) {
  auto shared = std::make_shared<const ShotMaker>(std::move(maker));
  const Lock lock(core_.mutex_);
  state_->maker.swap(shared);
}

std::vector<uint32_t> Camera::items() const {
  const Lock lock(core_.mutex_);
  std::vector<uint32_t> ids;
  for (const auto& [id, item] : state_->items) ids.push_back(id);
  return ids;
}

void Camera::removeItem(uint32_t item) {
  const Lock lock(core_.mutex_);
  core_.removeItem(*state_, item);
}

void Camera::set(Capability capability) {
  const Lock lock(core_.mutex_);
  const uint32_t id = capability.id;
  state_->withoutCapabilities.erase(id);
  uint32_t event = kNkMAIDEvent_CapChange;
  const auto found = std::find_if(state_->settings.begin(), state_->settings.end(),
                                  [id](const Capability& setting) { return setting.id == id; });
  if (found == state_->settings.end()) {
    state_->settings.push_back(std::move(capability));
  } else {
    if (found->valueType == capability.valueType) event = kNkMAIDEvent_CapChangeValueOnly;
    *found = std::move(capability);
  }
  core_.queueEvent(*state_, event, id);
}

void Camera::remove(uint32_t capability) {
  const Lock lock(core_.mutex_);
  std::erase_if(state_->settings, [capability](const Capability& setting) { return setting.id == capability; });
  state_->withoutCapabilities.insert(capability);
  core_.queueEvent(*state_, kNkMAIDEvent_CapChange, capability);
}

void Camera::restore(uint32_t capability) {
  const Lock lock(core_.mutex_);
  if (state_->withoutCapabilities.erase(capability) != 0) core_.queueEvent(*state_, kNkMAIDEvent_CapChange, capability);
}

std::optional<Capability> Camera::get(uint32_t capability) const {
  const Lock lock(core_.mutex_);
  for (const Capability& setting : state_->settings)
    if (setting.id == capability) return setting;
  return std::nullopt;
}

void Camera::setAlive(bool alive) {
  const Lock lock(core_.mutex_);
  state_->alive = alive;
}

void Camera::setTransfer(const TransferOptions& options) {
  const Lock lock(core_.mutex_);
  state_->transfer = options;
}

void Camera::setCapture(const CaptureOptions& options) {
  const Lock lock(core_.mutex_);
  state_->capture = options;
}

void Camera::raise(uint32_t event, uint64_t data) {
  const Lock lock(core_.mutex_);
  core_.queueEvent(*state_, event, data);
}

void Camera::raise(uint32_t item, Level level, uint32_t event, uint64_t data) {
  const Lock lock(core_.mutex_);
  for (const auto& [handle, object] : core_.objects_) {
    if (object->camera != state_ || object->target.item != item || object->target.level != level) continue;
    core_.queueEvent(level == Level::Data ? object->item->data : *object->item, event, data);
    return;
  }
}

}  // namespace virtualcamera
