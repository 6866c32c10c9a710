#include "FuzzedModule.h"

#include <algorithm>
#include <cstring>
#include <iterator>

namespace fuzz {
namespace {

constexpr int kMostCalls = 200000;
constexpr uint32_t kLongestFilledList = 64;
constexpr std::size_t kLongestFill = 1 << 12;

const int32_t kResults[] = {
    kNkMAIDResult_NotSupported,   kNkMAIDResult_UnexpectedDataType,
    kNkMAIDResult_BufferSize,     kNkMAIDResult_Aborted,
    kNkMAIDResult_ZombieObject,   kNkMAIDResult_OutOfMemory,
    kNkMAIDResult_Pending,        kNkMAIDResult_DeviceBusy,
    kNkMAIDResult_CameraNotFound, -1,
};

constexpr int kMostPolls = 48;
constexpr int kDeepestCallback = 3;
constexpr uint32_t kLongestDelivery = 1 << 16;

const uint32_t kEvents[] = {
    kNkMAIDEvent_AddChild,           kNkMAIDEvent_RemoveChild,      kNkMAIDEvent_CapChange,       kNkMAIDEvent_WarmedUp,
    kNkMAIDEvent_CapChangeValueOnly, kNkMAIDEvent_OrphanedChildren, kNkMAIDEvent_CaptureComplete, 0xffffffff};

const uint32_t kFileTypes[] = {kNkMAIDFileDataType_JPEG, kNkMAIDFileDataType_NEF, kNkMAIDFileDataType_TIFF,
                               kNkMAIDFileDataType_NDF, 0xffffffff};

template <typename Procedure>
Procedure* as(void (*procedure)()) {
  return reinterpret_cast<Procedure*>(procedure);
}

FuzzedModule* current = nullptr;

}  // namespace

const std::vector<Announced>& usualCapabilities = *new std::vector<Announced>{
    {kNkMAIDCapability_EventProc, kNkMAIDCapType_Process},
    {kNkMAIDCapability_DataProc, kNkMAIDCapType_Process},
    {kNkMAIDCapability_IsAlive, kNkMAIDCapType_Boolean},
    {kNkMAIDCapability_Children, kNkMAIDCapType_Enum},
    {kNkMAIDCapability_Name, kNkMAIDCapType_String},
    {kNkMAIDCapability_DataTypes, kNkMAIDCapType_Unsigned},
    {kNkMAIDCapability_StoredBytes, kNkMAIDCapType_Unsigned},
    {kNkMAIDCapability_Capture, kNkMAIDCapType_Process},
    {kNkMAIDCapability_Acquire, kNkMAIDCapType_Process},
    {kNkMAIDCapability_BatteryLevel, kNkMAIDCapType_Integer},
    {kNkMAIDCapability_FreeBytes, kNkMAIDCapType_Unsigned},
    {kNkMAIDCapability_ExposureMode, kNkMAIDCapType_Enum},
    {kNkMAIDCapability_ShutterSpeed, kNkMAIDCapType_Enum},
    {kNkMAIDCapability_Aperture, kNkMAIDCapType_Enum},
    {kNkMAIDCapability_Sensitivity, kNkMAIDCapType_Enum},
    {kNkMAIDCapability_WBMode, kNkMAIDCapType_Enum},
    {kNkMAIDCapability_RawJpegImageStatus, kNkMAIDCapType_Integer},
    {kNkMAIDCapability_SaveMedia, kNkMAIDCapType_Unsigned},
};

FuzzedModule::FuzzedModule(Input& input) : _input(input), _talksAtAnyTime(input.onceIn(2)) {
  check(current == nullptr, "one module at a time");
  current = this;
}

FuzzedModule::~FuzzedModule() {
  check(_open.empty(), "everything opened is closed");
  current = nullptr;
}

int32_t FuzzedModule::entryPoint(tagNkMAIDObject* object, uint32_t command, uint32_t parameter, uint32_t dataType,
                                 uint64_t data, NkMAIDCompletionProc* completion, void* reference) {
  check(current != nullptr, "no call after the end");
  return current->call(object, command, parameter, dataType, data, completion, reference);
}

int32_t FuzzedModule::call(tagNkMAIDObject* record, uint32_t command, uint32_t parameter, uint32_t dataType,
                           uint64_t data, NkMAIDCompletionProc* completion, void* reference) {
  check(++_calls < kMostCalls, "a run comes to its end");
  check(_open.count(record) == 1 || (record == nullptr && command == kNkMAIDCommand_Open), "called objects are open");
  if (command == kNkMAIDCommand_Async) return poll();
  const int32_t result = answer();
  const bool good = result == kNkMAIDResult_NoError;
  void* const room = reinterpret_cast<void*>(data);
  switch (command) {
    case kNkMAIDCommand_Open:
      return good ? open(record, static_cast<tagNkMAIDObject*>(room)) : result;
    case kNkMAIDCommand_Close:
      close(record);
      break;
    case kNkMAIDCommand_GetCapCount: {
      const uint32_t more = _input.byte();
      // Either a length that is worth reading or one that cannot be true.
      const uint32_t count = more < 250 ? static_cast<uint32_t>(usualCapabilities.size()) + more % 8
                                        : _input.dword() | (more < 252 ? 0 : 1U << 20);
      *static_cast<uint32_t*>(room) = more < 252 ? count & 0xfff : count;
      break;
    }
    case kNkMAIDCommand_GetCapInfo:
      announce(static_cast<tagNkMAIDCapInfo*>(room), parameter);
      break;
    case kNkMAIDCommand_CapStart:
      // One that says that it failed may complete all the same.
      if (completion != nullptr && (good || result == kNkMAIDResult_Pending || _input.onceIn(4))) {
        _completions.push_back({record, parameter, completion, reference});
      }
      break;
    case kNkMAIDCommand_CapSet:
      return good ? set(_open[record], parameter, dataType, data) : result;
    case kNkMAIDCommand_CapGet:
      return good ? get(parameter, dataType, room) : result;
    case kNkMAIDCommand_CapGetArray:
      check(dataType == kNkMAIDDataType_EnumPtr, "arrays are asked for with their record");
      fillEnum(parameter, *static_cast<tagNkMAIDEnum*>(room));
      break;
    case kNkMAIDCommand_EnumChildren:
      break;
    default:
      check(false, "commands are known");
  }
  if (_talksAtAnyTime && _input.onceIn(8)) deliverSomething();
  return result;
}

int32_t FuzzedModule::answer() {
  const uint8_t kind = _input.byte();
  if (kind < 216) return kNkMAIDResult_NoError;
  if (kind < 250) return kResults[kind % std::size(kResults)];
  return static_cast<int32_t>(_input.dword());
}

int32_t FuzzedModule::open(tagNkMAIDObject* parent, tagNkMAIDObject* record) {
  check(record != nullptr && _open.count(record) == 0, "an object is opened into a record of its own");
  check(record->sdkHead == 0 && record->sdkTail == 0, "a record is zeroed before it is opened");
  Object object;
  object.parent = parent;
  object.isCamera = parent != nullptr && _open[parent].parent == nullptr;
  _open[record] = object;
  record->sdkHead = record->sdkTail = UINT64_MAX;
  return kNkMAIDResult_NoError;
}

void FuzzedModule::close(tagNkMAIDObject* record) {
  for (const auto& [child, object] : _open) check(object.parent != record, "children are closed before their parents");
  if (const Object& object = _open[record]; object.eventProc.procedure != nullptr) {
    _lateEventProcs.push_back(object.eventProc);
  }
  _open.erase(record);
}

// The usual ones first, with what the input changes about them; then whatever it says.
void FuzzedModule::announce(tagNkMAIDCapInfo* list, uint32_t count) {
  const bool changes = _input.onceIn(3);
  for (uint32_t index = 0; index < std::min(count, kLongestFilledList); ++index) {
    tagNkMAIDCapInfo& entry = list[index];
    if (index < usualCapabilities.size()) {
      entry.id = usualCapabilities[index].capability;
      entry.valueType = usualCapabilities[index].valueType;
      if (!changes || !_input.onceIn(4)) continue;
    }
    const uint32_t id = _input.number();
    entry.id = id < usualCapabilities.size() ? usualCapabilities[id].capability : id;
    entry.valueType = _input.number() & (_input.onceIn(8) ? UINT32_MAX : 15);
  }
}

int32_t FuzzedModule::set(Object& object, uint32_t capability, uint32_t dataType, uint64_t data) {
  tagNkMAIDCallback callback{};
  if (dataType == kNkMAIDDataType_CallbackPtr) {
    std::memcpy(&callback, reinterpret_cast<const void*>(data), sizeof callback);
    check(callback.procedure != nullptr, "a callback that is registered has a procedure");
  }
  if (capability == kNkMAIDCapability_EventProc) object.eventProc = callback;
  if (capability == kNkMAIDCapability_DataProc) {
    object.dataProc = callback;
    if (callback.procedure != nullptr) _dataProcs.push_back(callback);
  }
  return kNkMAIDResult_NoError;
}

// Values.

uint32_t FuzzedModule::unsignedValue(uint32_t capability) {
  if (capability == kNkMAIDCapability_DataTypes && !_input.onceIn(8)) return kNkMAIDDataObjType_Image;
  if (capability == kNkMAIDCapability_StoredBytes) return _fileSize = _input.number();
  return _input.number();
}

int32_t FuzzedModule::get(uint32_t capability, uint32_t dataType, void* data) {
  switch (dataType) {
    case kNkMAIDDataType_BooleanPtr:
      *static_cast<uint8_t*>(data) = static_cast<uint8_t>(~_input.byte());
      return kNkMAIDResult_NoError;
    case kNkMAIDDataType_IntegerPtr:
    case kNkMAIDDataType_UnsignedPtr:
      *static_cast<uint32_t*>(data) = unsignedValue(capability);
      return kNkMAIDResult_NoError;
    case kNkMAIDDataType_StringPtr: {
      const std::size_t length = _input.byte();
      std::memset(data, _input.onceIn(2) ? _input.byte() : 'n', length + (length == UINT8_MAX ? 1 : 0));
      return kNkMAIDResult_NoError;
    }
    case kNkMAIDDataType_EnumPtr:
      describeEnum(capability, *static_cast<tagNkMAIDEnum*>(data));
      return kNkMAIDResult_NoError;
    default:
      check(false, "values are asked for with known data types");
      return kNkMAIDResult_UnexpectedDataType;
  }
}

void FuzzedModule::describeEnum(uint32_t capability, tagNkMAIDEnum& record) {
  static constexpr uint32_t kTypes[] = {kNkMAIDArrayType_Unsigned, kNkMAIDArrayType_Integer,
                                        kNkMAIDArrayType_PackedString, kNkMAIDArrayType_String};
  const uint8_t kind = _input.byte();
  const bool children = capability == kNkMAIDCapability_Children;
  record.elementType = children ? kTypes[0] : kTypes[kind % std::size(kTypes)];
  const bool packed = record.elementType == kNkMAIDArrayType_PackedString;
  const bool strings = record.elementType == kNkMAIDArrayType_String;
  record.elementSize = static_cast<int16_t>(packed ? 1 : strings ? int{kNkMAIDStringSize} : 4);
  record.elementCount = 1U + (packed ? 31 : 0) + (_input.byte() & 3);
  record.currentIndex = _input.byte() & 3;
  if (kind < 224) return;
  if ((kind & 1) != 0) record.elementType = _input.number();
  if ((kind & 2) != 0) record.elementCount = _input.number();
  if ((kind & 4) != 0) record.currentIndex = _input.number();
  if ((kind & 8) != 0) record.elementSize = static_cast<int16_t>(_input.word());
  record.defaultIndex = _input.byte();
}

void FuzzedModule::fillEnum(uint32_t capability, tagNkMAIDEnum& record) {
  check(record.elementSize > 0 && record.elements != nullptr, "there is room for the elements");
  const uint64_t size = uint64_t{record.elementCount} * static_cast<uint64_t>(record.elementSize);
  auto* const bytes = static_cast<uint8_t*>(record.elements);
  // The room is what the record says.
  if (size > 0) bytes[size - 1] = 0;
  const bool children = capability == kNkMAIDCapability_Children && !_input.onceIn(8);
  for (uint64_t at = 0; at < std::min<uint64_t>(size, kLongestFill); ++at) {
    bytes[at] = children ? static_cast<uint8_t>(at % 4 == 0 ? 1 + at / 4 : 0) : _input.byte();
  }
  if (!_input.onceIn(4)) return;
  record.currentIndex = _input.number();
  record.elementCount = _input.number();
  record.elementSize = static_cast<int16_t>(_input.word());
}

// What it calls back: completions, events and pieces of files, in time or not.

int32_t FuzzedModule::poll() {
  if (++_polls > kMostPolls) return kNkMAIDResult_HardwareError;
  if (_input.empty()) {
    complete();
    return kNkMAIDResult_NoError;
  }
  const int32_t result = _input.onceIn(32) ? answer() : static_cast<int32_t>(kNkMAIDResult_Pending);
  for (int left = _input.byte() & 3; left > 0; --left) deliverSomething();
  return result;
}

void FuzzedModule::deliverSomething() {
  if (_depth >= kDeepestCallback) return;
  ++_depth;
  const uint8_t kind = _input.byte();
  if (kind < 40) {
    complete();
  } else if (kind < 90) {
    deliverEvent();
  } else {
    deliverData();
  }
  --_depth;
}

void FuzzedModule::complete() {
  if (_completions.empty()) return;
  const Completion done = _completions.front();
  // Some complete twice.
  if (!_input.onceIn(16)) _completions.erase(_completions.begin());
  done.procedure(done.object, kNkMAIDCommand_CapStart, done.capability, kNkMAIDDataType_Null, 0, done.reference,
                 answer());
}

void FuzzedModule::deliverEvent() {
  const uint32_t event = kEvents[_input.byte() % std::size(kEvents)];
  if (!_lateEventProcs.empty() && _input.onceIn(8)) {
    const tagNkMAIDCallback late = _lateEventProcs[_input.byte() % _lateEventProcs.size()];
    // A camera may stand where the closed object stood.
    if (event != kNkMAIDEvent_AddChild) as<NkMAIDEventProc>(late.procedure)(late.reference, event, _input.number());
    return;
  }
  if (_open.empty()) return;
  const Object target = std::next(_open.begin(), static_cast<long>(_input.byte() % _open.size()))->second;
  // New pictures of cameras would go to another thread, where no run is like the other.
  if (target.eventProc.procedure == nullptr || (target.isCamera && event == kNkMAIDEvent_AddChild)) return;
  as<NkMAIDEventProc>(target.eventProc.procedure)(target.eventProc.reference, event, _input.number());
}

tagNkMAIDFileInfo FuzzedModule::nextPiece() {
  const uint8_t kind = _input.byte();
  tagNkMAIDFileInfo info{};
  info.dataType = kNkMAIDDataObjType_File | kNkMAIDDataObjType_Image;
  info.fileDataType = kFileTypes[kind % std::size(kFileTypes)];
  info.totalLength = _fileSize;
  info.ulStart = _delivered;
  info.ulLength = std::min<uint32_t>(_fileSize - _delivered, (kind & 7) == 0 ? _input.word() : UINT32_MAX);
  if (kind >= 192) {
    if ((kind & 1) != 0) info.dataType = _input.number();
    if ((kind & 2) != 0) info.totalLength = _input.number();
    if ((kind & 4) != 0) info.ulStart = _input.number();
    if ((kind & 8) != 0) info.ulLength = _input.number();
  }
  return info;
}

void FuzzedModule::deliverData() {
  if (_dataProcs.empty()) return;
  // The latest, most of the time.
  const std::size_t back = _input.onceIn(8) ? _input.byte() % _dataProcs.size() : 0;
  const tagNkMAIDCallback target = _dataProcs[_dataProcs.size() - 1 - back];
  tagNkMAIDFileInfo info = nextPiece();
  _delivered = info.ulStart + info.ulLength >= _fileSize ? 0 : info.ulStart + info.ulLength;
  // As many bytes as the record says, or none.
  const bool without = info.ulLength > kLongestDelivery || _input.onceIn(16);
  std::vector<uint8_t> bytes(without ? 0 : info.ulLength, _input.byte());
  void* const record = _input.onceIn(32) ? nullptr : &info;
  as<NkMAIDDataProc>(target.procedure)(target.reference, record, without ? nullptr : bytes.data());
}

}  // namespace fuzz
