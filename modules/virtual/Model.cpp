// What scripts do to a model: calls are hooked and recorded around what the plan of faults does to them.
#include "VirtualCamera.h"

namespace virtualcamera {

using camerakit::Guard;

class Model::Script final : public FaultPlan {
 public:
  using FaultPlan::end;

  std::optional<int32_t> before(Call& call) override {
    if (const std::shared_ptr<const CallHook> function = hook(Before)) (*function)(call);
    return FaultPlan::before(call);
  }

  void after(Call& call) override {
    const bool polls = call.command == kNkMAIDCommand_Async;
    if (polls && call.done && call.result == kNkMAIDResult_NoError) advanceCaptures(call.target);
    FaultPlan::after(call);
    if (!polls) keep(call);
    if (const std::shared_ptr<const CallHook> function = hook(After)) (*function)(call);
  }

  enum When { Before, After };
  void setHook(When when, CallHook function) {
    auto shared = function ? std::make_shared<const CallHook>(std::move(function)) : nullptr;
    const Guard guard(mutex);
    hooks[when].swap(shared);
  }

  camerakit::Model* model = nullptr;
  camerakit::Mutex mutex;
  std::shared_ptr<const CallHook> hooks[2] KIT_GUARDED_BY(mutex);
  bool recording KIT_GUARDED_BY(mutex) = false;
  std::vector<Call> calls KIT_GUARDED_BY(mutex);

 private:
  std::shared_ptr<const CallHook> hook(When when) {
    const Guard guard(mutex);
    return hooks[when];
  }

  void keep(const Call& call) {
    const Guard guard(mutex);
    if (recording) calls.push_back(call);
  }

  void advanceCaptures(const Target& polled) {
    if (polled.level != Level::Module && polled.level != Level::Camera) return;
    for (const auto& camera : model->cameras())
      if (polled.level == Level::Module || polled.camera == camera->id()) static_cast<Camera&>(*camera).polled();
  }
};

Model::Model(Options options) : _script(std::make_unique<Script>()), _model(std::move(options), _script.get()) {
  _script->model = &_model;
}

Model::~Model() { _script->end(); }

Camera& Model::addCamera(uint32_t id, const std::string& name) {
  auto camera = std::make_shared<Camera>(_model, id, name);
  _model.plug(camera);
  return *camera;
}

Camera* Model::camera(uint32_t id) { return static_cast<Camera*>(_model.camera(id).get()); }

std::vector<uint32_t> Model::cameras() const {
  std::vector<uint32_t> ids;
  for (const auto& camera : _model.cameras()) ids.push_back(camera->id());
  return ids;
}

FaultPlan& Model::faults() { return *_script; }

void Model::beforeCall(CallHook hook) { _script->setHook(Script::Before, std::move(hook)); }

void Model::afterCall(CallHook hook) { _script->setHook(Script::After, std::move(hook)); }

void Model::record(bool on) {
  const Guard guard(_script->mutex);
  _script->recording = on;
  if (on) _script->calls.clear();
}

std::vector<Call> Model::calls() const {
  const Guard guard(_script->mutex);
  return _script->calls;
}

std::vector<Target> Model::closed() const {
  std::vector<Target> targets;
  for (const Call& call : calls()) {
    const bool closed = call.result == kNkMAIDResult_NoError || call.result == kNkMAIDResult_OrphanedChildren;
    if (call.command == kNkMAIDCommand_Close && closed) targets.push_back(call.target);
  }
  return targets;
}

}  // namespace virtualcamera
