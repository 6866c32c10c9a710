// What objects announce about themselves, read and set.
#include "Core.h"

namespace camerakit {
namespace {

bool contains(const std::vector<Capability>& list, uint32_t id) {
  return std::any_of(list.begin(), list.end(), [id](const Capability& capability) { return capability.id == id; });
}

Capability childList(std::vector<uint32_t> ids) {
  return Capability::unsigneds(kNkMAIDCapability_Children, std::move(ids));
}

uint32_t shownSize(const Picture& picture) {
  return static_cast<uint32_t>(std::min<uint64_t>(picture.size(), UINT32_MAX));
}

void addOfCamera(std::vector<Capability>& list, const CameraState& camera) {
  list.push_back(Capability::boolean(kNkMAIDCapability_IsAlive, camera.alive && !camera.gone));
  list.push_back(Capability::string(kNkMAIDCapability_Name, camera.name));
  list.push_back(Capability::process(kNkMAIDCapability_Capture));
  std::erase_if(list, [&](const Capability& builtIn) {
    return contains(camera.settings, builtIn.id) && !(camera.gone && builtIn.id == kNkMAIDCapability_IsAlive);
  });
  for (const Capability& setting : camera.settings)
    if (!contains(list, setting.id)) list.push_back(setting);
}

void addOfData(std::vector<Capability>& list, const ItemState& item) {
  list.push_back(Capability::string(kNkMAIDCapability_Name, item.picture.name));
  list.push_back(Capability::unsignedInteger(kNkMAIDCapability_StoredBytes, shownSize(item.picture)));
  list.push_back(Capability::unsignedInteger(kNkMAIDCapability_RawJpegImageStatus, item.pair != 0 ? 1 : 0));
  list.push_back(Capability::process(kNkMAIDCapability_Acquire));
}

bool started(int32_t answer) { return answer == kNkMAIDResult_NoError || answer == kNkMAIDResult_Pending; }

}  // namespace

std::vector<uint32_t> Core::children(const Object& object) const {
  std::vector<uint32_t> ids;
  if (object.target.level == Level::Module)
    for (const auto& [id, camera] : _cameras) ids.push_back(id);
  if (object.target.level == Level::Camera)
    for (const auto& [id, item] : object.state->items) ids.push_back(id);
  if (object.target.level == Level::Item)
    for (uint32_t bit = 1; bit != 0; bit <<= 1)
      if (object.item->picture.dataTypes & bit) ids.push_back(bit);
  return ids;
}

// The callback slots are announced as capabilities without a value.
std::vector<Capability> Core::capabilities(const Object& object) const {
  std::vector<Capability> list{Capability::process(kNkMAIDCapability_EventProc),
                               Capability::process(kNkMAIDCapability_DataProc)};
  if (object.target.level != Level::Data) list.push_back(childList(children(object)));
  const auto hide = [&list](const auto& ids) {
    for (const uint32_t id : ids) std::erase_if(list, [id](const Capability& c) { return c.id == id; });
  };
  switch (object.target.level) {
    case Level::Camera:
      addOfCamera(list, *object.state);
      hide(object.state->withoutCapabilities);
      break;
    case Level::Item:
      list.push_back(Capability::string(kNkMAIDCapability_Name, object.item->picture.name));
      list.push_back(Capability::unsignedInteger(kNkMAIDCapability_DataTypes, object.item->picture.dataTypes));
      hide(object.item->picture.withoutCapabilities);
      break;
    case Level::Data:
      addOfData(list, *object.item);
      hide(object.item->picture.withoutCapabilities);
      break;
    default:
      list.push_back(Capability::string(kNkMAIDCapability_Name, _options.name));
      break;
  }
  return list;
}

std::optional<Capability> Core::capability(const Object& object, uint32_t id) const {
  for (Capability& capability : capabilities(object))
    if (capability.id == id) return std::move(capability);
  return std::nullopt;
}

int32_t Core::capInfo(const Object& object, const Call& call) const {
  auto* records = reinterpret_cast<tagNkMAIDCapInfo*>(call.data);
  if (call.dataType != kNkMAIDDataType_CapInfoPtr || records == nullptr) return kNkMAIDResult_UnexpectedDataType;
  const std::vector<Capability> list = capabilities(object);
  if (list.size() != call.parameter) return kNkMAIDResult_BufferSize;
  for (const Capability& capability : list) {
    *records = {};
    records->id = capability.id;
    records->valueType = capability.valueType;
    ++records;
  }
  return kNkMAIDResult_NoError;
}

int32_t Core::capRead(const Object& object, const Call& call) {
  const std::optional<Capability> found = capability(object, call.parameter);
  if (!found) return kNkMAIDResult_NotSupported;
  const Release release(_mutex);
  return _hooks.read(call, *found);
}

// Callbacks, and unsigned settings given by value.
int32_t Core::capSet(const ObjectPtr& object, const Call& call) {
  if (!capability(*object, call.parameter)) return kNkMAIDResult_NotSupported;
  if (call.parameter == kNkMAIDCapability_EventProc || call.parameter == kNkMAIDCapability_DataProc)
    return setCallback(object, call);
  if (object->target.level != Level::Camera) return kNkMAIDResult_NotSupported;
  const auto setting = [&]() -> Capability* {
    for (Capability& each : object->state->settings)
      if (each.id == call.parameter) return &each;
    return nullptr;
  };
  const Capability* before = setting();
  if (before == nullptr) return kNkMAIDResult_NotSupported;
  if (!std::holds_alternative<uint32_t>(before->value) || call.dataType != kNkMAIDDataType_Unsigned)
    return kNkMAIDResult_UnexpectedDataType;
  const auto wanted = static_cast<uint32_t>(call.data);
  int32_t result = kNkMAIDResult_NoError;
  {
    const Release release(_mutex);
    result = object->camera->change(call.parameter, wanted);
  }
  Capability* now = setting();
  if (result == kNkMAIDResult_NoError && now != nullptr && std::holds_alternative<uint32_t>(now->value))
    now->value = wanted;
  return result;
}

int32_t Core::capStart(const ObjectPtr& object, const Call& call) {
  if (!capability(*object, call.parameter)) return kNkMAIDResult_NotSupported;
  const bool captures = object->target.level == Level::Camera && call.parameter == kNkMAIDCapability_Capture;
  const bool acquires = object->target.level == Level::Data && call.parameter == kNkMAIDCapability_Acquire;
  if (!captures && !acquires) return kNkMAIDResult_NotSupported;
  if (object->action) return kNkMAIDResult_DeviceBusy;
  if (acquires && object->dataProc.procedure == nullptr) return kNkMAIDResult_NoDataProc;
  const auto action = std::make_shared<Action>();
  action->start = call;
  object->action = action;
  return captures ? fire(object, action) : kNkMAIDResult_Pending;
}

// Its end may be reported before the author has answered: until then no poll completes it.
int32_t Core::fire(const ObjectPtr& object, const ActionPtr& action) {
  action->busy = true;
  int32_t answer = kNkMAIDResult_UnexpectedError;
  {
    const Release release(_mutex);
    try {
      answer = object->camera->fire(Exposure(shared_from_this(), action));
    } catch (...) {  // it does not fire, then
    }
  }
  action->busy = false;
  if (started(answer)) return answer;
  action->done = true;
  if (object->action == action) object->action.reset();
  return answer;
}

}  // namespace camerakit
