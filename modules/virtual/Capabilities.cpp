// What objects announce about themselves, read and set.
#include <cstring>

#include "Core.h"

namespace virtualcamera {
namespace {

bool contains(const std::vector<Capability>& list, uint32_t id) {
  return std::any_of(list.begin(), list.end(), [id](const Capability& capability) { return capability.id == id; });
}

Capability childList(std::vector<uint32_t> ids) {
  return Capability::unsigneds(kNkMAIDCapability_Children, std::move(ids));
}

uint32_t shownSize(const Picture& picture) {
  return picture.storedBytes.value_or(static_cast<uint32_t>(std::min<uint64_t>(picture.size(), UINT32_MAX)));
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

bool isString(const tagNkMAIDEnum& header) {
  return header.elementType == kNkMAIDArrayType_PackedString || header.elementType == kNkMAIDArrayType_String;
}

bool started(int32_t answer) { return answer == kNkMAIDResult_NoError || answer == kNkMAIDResult_Pending; }

}  // namespace

std::vector<uint32_t> Core::children(const Object& object) const {
  std::vector<uint32_t> ids;
  if (object.target.level == Level::Module)
    for (const auto& [id, camera] : cameras_) ids.push_back(id);
  if (object.target.level == Level::Camera)
    for (const auto& [id, item] : object.camera->items) ids.push_back(id);
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
      addOfCamera(list, *object.camera);
      hide(object.camera->withoutCapabilities);
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
      list.push_back(Capability::string(kNkMAIDCapability_Name, options_.name));
      hide(moduleWithout_);
      break;
  }
  return list;
}

std::optional<Capability> Core::capability(const Object& object, uint32_t id, const Fault* fault) const {
  for (Capability& capability : capabilities(object)) {
    if (capability.id != id) continue;
    if (id == kNkMAIDCapability_Children && fault != nullptr && fault->children) return childList(*fault->children);
    return std::move(capability);
  }
  return std::nullopt;
}

int32_t Core::capInfo(const Object& object, const Arguments& arguments) const {
  auto* records = reinterpret_cast<tagNkMAIDCapInfo*>(arguments.data);
  if (arguments.dataType != kNkMAIDDataType_CapInfoPtr || records == nullptr) return kNkMAIDResult_UnexpectedDataType;
  const std::vector<Capability> list = capabilities(object);
  if (list.size() != arguments.parameter) return kNkMAIDResult_BufferSize;
  for (const Capability& capability : list) {
    *records = {};
    records->id = capability.id;
    records->valueType = capability.valueType;
    ++records;
  }
  return kNkMAIDResult_NoError;
}

int32_t Core::capGet(const Object& object, const Arguments& arguments, const Fault* fault) const {
  const std::optional<Capability> found = capability(object, arguments.parameter, fault);
  if (!found) return kNkMAIDResult_NotSupported;
  auto* data = reinterpret_cast<void*>(arguments.data);
  const int32_t result = found->read(arguments.dataType, data);
  if (fault == nullptr || result != kNkMAIDResult_NoError) return result;
  if (fault->unterminated && arguments.dataType == kNkMAIDDataType_StringPtr) std::memset(data, 'X', kNkMAIDStringSize);
  if (fault->editEnum && arguments.dataType == kNkMAIDDataType_EnumPtr)
    fault->editEnum(*static_cast<tagNkMAIDEnum*>(data));
  return result;
}

int32_t Core::capGetArray(const Object& object, const Arguments& arguments, const Fault* fault) const {
  const std::optional<Capability> found = capability(object, arguments.parameter, fault);
  if (!found) return kNkMAIDResult_NotSupported;
  const Enumeration* list = std::get_if<Enumeration>(&found->value);
  const auto* room = reinterpret_cast<const tagNkMAIDEnum*>(arguments.data);
  if (list == nullptr || arguments.dataType != kNkMAIDDataType_EnumPtr || room == nullptr)
    return kNkMAIDResult_UnexpectedDataType;

  const tagNkMAIDEnum header = list->header();
  std::vector<uint8_t> bytes = list->elements();
  if (fault != nullptr && fault->unterminated && isString(header)) std::fill(bytes.begin(), bytes.end(), 'X');
  const bool fits = room->elementCount == header.elementCount && room->elementSize == header.elementSize;
  const uint64_t size = uint64_t{room->elementCount} * static_cast<uint64_t>(std::max<int16_t>(room->elementSize, 0));
  if (!fits && (fault == nullptr || !fault->anyArraySize)) return kNkMAIDResult_BufferSize;
  if (room->elements == nullptr) return bytes.empty() ? kNkMAIDResult_NoError : kNkMAIDResult_BufferSize;
  if (!bytes.empty()) std::memcpy(room->elements, bytes.data(), std::min<uint64_t>(size, bytes.size()));
  return kNkMAIDResult_NoError;
}

// Callbacks, and unsigned settings given by value.
int32_t Core::capSet(Lock& lock, const ObjectPtr& object, const Arguments& arguments) {
  const std::optional<Capability> found = capability(*object, arguments.parameter, nullptr);
  if (!found) return kNkMAIDResult_NotSupported;
  if (arguments.parameter == kNkMAIDCapability_EventProc || arguments.parameter == kNkMAIDCapability_DataProc)
    return setCallback(lock, object, arguments);
  if (object->target.level != Level::Camera) return kNkMAIDResult_NotSupported;
  for (Capability& setting : object->camera->settings) {
    if (setting.id != arguments.parameter) continue;
    uint32_t* value = std::get_if<uint32_t>(&setting.value);
    if (value == nullptr || arguments.dataType != kNkMAIDDataType_Unsigned) return kNkMAIDResult_UnexpectedDataType;
    *value = static_cast<uint32_t>(arguments.data);
    return kNkMAIDResult_NoError;
  }
  return kNkMAIDResult_NotSupported;
}

int32_t Core::capStart(Lock&, const ObjectPtr& object, const Arguments& arguments, const Fault* fault) {
  if (!capability(*object, arguments.parameter, nullptr)) return kNkMAIDResult_NotSupported;
  const bool captures = object->target.level == Level::Camera && arguments.parameter == kNkMAIDCapability_Capture;
  const bool acquires = object->target.level == Level::Data && arguments.parameter == kNkMAIDCapability_Acquire;
  if (!captures && !acquires) return kNkMAIDResult_NotSupported;
  if (object->action) return kNkMAIDResult_DeviceBusy;
  if (acquires && object->dataProc.procedure == nullptr) return kNkMAIDResult_NoDataProc;
  const int32_t answer = captures ? object->camera->capture.answer : kNkMAIDResult_Pending;
  if (!started(answer)) return answer;

  auto action = std::make_shared<Action>();
  action->capability = arguments.parameter;
  action->dataType = arguments.dataType;
  action->data = arguments.data;
  action->completion = arguments.completion;
  action->reference = arguments.reference;
  if (fault != nullptr) action->fault = *fault;
  object->action = std::move(action);
  return answer;
}

}  // namespace virtualcamera
