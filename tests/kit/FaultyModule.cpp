#include "FaultyModule.h"

#include <atomic>

namespace testkit {
namespace {

using virtualcamera::Level;
using virtualcamera::Target;

constexpr std::uint32_t kLongestFill = 1 << 12;

std::atomic<FaultyModule*> current{nullptr};

}  // namespace

void FaultyModule::Procedure::event(std::uint32_t event, std::uint64_t data) const {
  reinterpret_cast<NkMAIDEventProc*>(callback.procedure)(callback.reference, event, data);
}

void FaultyModule::Procedure::deliver(tagNkMAIDFileInfo* info, void* data) const {
  reinterpret_cast<NkMAIDDataProc*>(callback.procedure)(callback.reference, info, data);
}

void FaultyModule::Completion::operator()(std::int32_t result) const {
  procedure(nullptr, kNkMAIDCommand_CapStart, 0, 0, 0, reference, result);
}

FaultyModule::FaultyModule(std::function<Deed(const virtualcamera::Call&)> decide,
                           std::function<void(const char*)> broken)
    : _decide(std::move(decide)), _broken(std::move(broken)) {
  current = this;
}

FaultyModule::~FaultyModule() {
  if (!_open.empty()) _broken("everything opened is closed");
  current = nullptr;
}

std::int32_t FaultyModule::entryPoint(tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter,
                                      std::uint32_t dataType, std::uint64_t data, NkMAIDCompletionProc* completion,
                                      void* reference) {
  FaultyModule* const module = current;
  check(module != nullptr, "no call after the end");
  return module->call(object, command, parameter, dataType, data, completion, reference);
}

FaultyModule::Callbacks FaultyModule::callbacks() {
  const std::lock_guard guard(_lock);
  return _callbacks;
}

Target FaultyModule::targetOf(const tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter) {
  if (object == nullptr) return {Level::Module, 0, 0};
  const auto found = _open.find(object);
  if (found == _open.end()) _broken("called objects are open");
  Target target = found == _open.end() ? Target() : found->second;
  if (command != kNkMAIDCommand_Open) return target;
  target.level = static_cast<Level>(static_cast<int>(target.level) + 1);
  if (target.level == Level::Camera) target.camera = parameter;
  if (target.level == Level::Item) target.item = parameter;
  return target;
}

std::int32_t FaultyModule::call(tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter,
                                std::uint32_t dataType, std::uint64_t data, NkMAIDCompletionProc* completion,
                                void* reference) {
  const bool opens = command == kNkMAIDCommand_Open;
  const bool closes = command == kNkMAIDCommand_Close;
  auto* const record = reinterpret_cast<tagNkMAIDObject*>(data);
  virtualcamera::Call call;
  call.command = command;
  call.parameter = parameter;
  call.dataType = dataType;
  {
    const std::lock_guard guard(_lock);
    call.target = targetOf(object, command, parameter);
    if (opens && (record->sdkHead != 0 || record->sdkTail != 0)) _broken("a record is zeroed before it is opened");
    if (completion != nullptr) _callbacks.completions.push_back({completion, reference});
    if (command == kNkMAIDCommand_CapSet && dataType == kNkMAIDDataType_CallbackPtr) {
      const auto callback = *reinterpret_cast<const tagNkMAIDCallback*>(data);
      if (callback.procedure == nullptr) _broken("a callback that is registered has a procedure");
      auto& all = parameter == kNkMAIDCapability_EventProc ? _callbacks.events : _callbacks.deliveries;
      all.push_back({call.target.level, callback});
    }
    if (closes) _open.erase(object);  // whatever comes of it
  }
  const auto pass = [&](tagNkMAIDObject* on, std::uint32_t which) {
    return virtualcamera::entryPoint(on, which, parameter, dataType, data, completion, reference);
  };
  const Deed deed = _decide(call);
  if (deed.before) deed.before();
  std::int32_t own = kNkMAIDResult_NoError;
  if (deed.done || closes) own = pass(object, command);
  if (own == kNkMAIDResult_OrphanedChildren) _broken("children are closed before their parents");
  const std::int32_t answer = deed.answer.value_or(own);
  if (deed.nonsense != nullptr) scribble(*deed.nonsense, command, parameter, dataType, record);
  // What was not said to be open will not be closed.
  if (opens && deed.done && own == kNkMAIDResult_NoError && answer != own) pass(record, kNkMAIDCommand_Close);
  if (opens && answer == kNkMAIDResult_NoError) {
    const std::lock_guard guard(_lock);
    _open[record] = call.target;
  }
  if (deed.after) deed.after();
  return answer;
}

void FaultyModule::scribble(Input& from, std::uint32_t command, std::uint32_t count, std::uint32_t dataType,
                            void* data) {
  if (dataType == kNkMAIDDataType_BooleanPtr) {
    *static_cast<std::uint8_t*>(data) = from.byte();
  } else if (dataType == kNkMAIDDataType_IntegerPtr || dataType == kNkMAIDDataType_UnsignedPtr) {
    *static_cast<std::uint32_t*>(data) = from.number();
  } else if (dataType == kNkMAIDDataType_StringPtr) {
    std::memset(data, from.byte() == 0 ? 0 : 'X', kNkMAIDStringSize);
  } else if (dataType == kNkMAIDDataType_CapInfoPtr) {
    for (auto* info = static_cast<tagNkMAIDCapInfo*>(data); count > 0 && !from.empty(); ++info, --count) {
      const std::uint8_t which = from.byte();
      if ((which & 1) != 0) info->id = (which & 2) != 0 ? 0x8000 + from.byte() : from.number();
      if ((which & 4) != 0) info->valueType = from.number() & 15;
    }
  } else if (dataType == kNkMAIDDataType_EnumPtr) {
    auto& record = *static_cast<tagNkMAIDEnum*>(data);
    if (command == kNkMAIDCommand_CapGetArray) {
      // The room is what the record says.
      check(record.elementSize > 0 && record.elements != nullptr, "there is room for the elements");
      const std::uint64_t size = std::uint64_t{record.elementCount} * static_cast<std::uint64_t>(record.elementSize);
      auto* const bytes = static_cast<std::uint8_t*>(record.elements);
      if (size > 0) bytes[size - 1] = 0;
      for (std::uint64_t at = 0; at < std::min<std::uint64_t>(size, kLongestFill); ++at) bytes[at] = from.byte();
    }
    const std::uint8_t which = from.byte();
    if ((which & 1) != 0) record.elementType = from.number();
    if ((which & 2) != 0) record.elementCount = from.number();
    if ((which & 4) != 0) record.currentIndex = from.number();
    if ((which & 8) != 0) record.elementSize = static_cast<std::int16_t>(from.word());
    if ((which & 16) != 0) record.elements = reinterpret_cast<void*>(std::uintptr_t{8});
  }
}

void FaultyModule::scribble(Input& from, tagNkMAIDFileInfo& info) {
  const std::uint8_t which = from.byte();
  if ((which & 1) != 0) info.dataType = from.number();
  if ((which & 2) != 0) info.totalLength = from.number();
  if ((which & 4) != 0) info.ulStart = from.number();
  if ((which & 8) != 0) info.ulLength = from.word();
}

}  // namespace testkit
