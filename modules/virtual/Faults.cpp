#include "Faults.h"

#include <algorithm>
#include <cstring>
#include <utility>

namespace virtualcamera {
namespace {

using camerakit::Enumeration;
using camerakit::Guard;

constexpr uint64_t kMaxPaddedBytes = 64u << 20;

bool fits(const std::optional<uint32_t>& wanted, uint32_t value) { return !wanted || *wanted == value; }

bool matches(const Fault& fault, const Call& call) {
  return (fault.level == Level::Any || fault.level == call.target.level) && fits(fault.camera, call.target.camera) &&
         fits(fault.item, call.target.item) && fits(fault.command, call.command) &&
         fits(fault.parameter, call.parameter);
}

// What a call that a fault hits takes along as its note.
struct Hit {
  std::shared_ptr<const Fault> fault;
  uint32_t latePolls = 0;
};

const Fault* faultOf(const Call& call) {
  return call.note ? static_cast<const Hit*>(call.note.get())->fault.get() : nullptr;
}

bool ofStrings(const Capability& value) {
  const Enumeration* list = std::get_if<Enumeration>(&value.value);
  return list != nullptr &&
         (list->elementType == kNkMAIDArrayType_PackedString || list->elementType == kNkMAIDArrayType_String);
}

size_t roomIn(const tagNkMAIDEnum& record) {
  return size_t{record.elementCount} * static_cast<size_t>(std::max<int16_t>(record.elementSize, 0));
}

// As much as there is room for.
int32_t fill(const tagNkMAIDEnum& room, const Capability& value) {
  const std::vector<uint8_t> bytes = std::get<Enumeration>(value.value).elements();
  if (room.elements == nullptr) return bytes.empty() ? kNkMAIDResult_NoError : kNkMAIDResult_BufferSize;
  if (!bytes.empty()) std::memcpy(room.elements, bytes.data(), std::min(roomIn(room), bytes.size()));
  return kNkMAIDResult_NoError;
}

}  // namespace

FaultPlan::Id FaultPlan::add(Fault fault) {
  const Guard guard(_mutex);
  _released = false;
  _entries.push_back({++_lastId, std::make_shared<const Fault>(std::move(fault)), 0});
  return _lastId;
}

void FaultPlan::remove(Id id) {
  const Guard guard(_mutex);
  std::erase_if(_entries, [id](const Entry& entry) { return entry.id == id; });
}

void FaultPlan::clear() {
  const Guard guard(_mutex);
  _entries.clear();
}

void FaultPlan::release() {
  const Guard guard(_mutex);
  _released = true;
  _releasing.notifyAll();
}

// The first fault that is in effect for the call, having counted the call for all that match.
std::shared_ptr<const Fault> FaultPlan::hit(const Call& call) {
  const Guard guard(_mutex);
  std::shared_ptr<const Fault> found;
  for (Entry& entry : _entries) {
    if (!matches(*entry.fault, call)) continue;
    const uint64_t number = entry.matched++;
    const bool active = number >= entry.fault->skip && number - entry.fault->skip < entry.fault->times;
    if (!found && active) found = entry.fault;
  }
  return found;
}

void FaultPlan::spend(std::chrono::milliseconds delay) {
  if (delay.count() <= 0) return;
  const auto end = std::chrono::steady_clock::now() + delay;
  const Guard guard(_mutex);
  while (!_released && _releasing.waitUntil(_mutex, end)) continue;
}

std::optional<int32_t> FaultPlan::before(Call& call) {
  if (const std::shared_ptr<const Fault> fault = hit(call)) {
    call.note = std::make_shared<Hit>(Hit{fault});
    call.outcome = fault->completionResult.value_or(call.outcome);
    spend(fault->delay);
    if (fault->answer && !fault->doAnyway) return fault->answer;
  }
  if (call.command == kNkMAIDCommand_Async && call.target.level == Level::Module) completeStrays();
  return std::nullopt;
}

void FaultPlan::after(Call& call) {
  const Fault* fault = faultOf(call);
  if (fault != nullptr && fault->answer) call.result = *fault->answer;
}

int32_t FaultPlan::read(const Call& call, const Capability& value) {
  const Fault* fault = faultOf(call);
  if (fault == nullptr) return Hooks::read(call, value);
  const bool lists = fault->children && call.parameter == kNkMAIDCapability_Children;
  const Capability shown = lists ? Capability::unsigneds(call.parameter, *fault->children) : value;
  int32_t result = Hooks::read(call, shown);
  auto* data = reinterpret_cast<void*>(call.data);
  if (call.command == kNkMAIDCommand_CapGetArray) {
    const auto* room = static_cast<const tagNkMAIDEnum*>(data);
    if (result == kNkMAIDResult_BufferSize && fault->anyArraySize) result = fill(*room, shown);
    if (result == kNkMAIDResult_NoError && fault->unterminated && ofStrings(shown) && room->elements != nullptr)
      std::memset(room->elements, 'X', roomIn(*room));
  } else if (result == kNkMAIDResult_NoError) {
    if (fault->unterminated && call.dataType == kNkMAIDDataType_StringPtr) std::memset(data, 'X', kNkMAIDStringSize);
    if (fault->editEnum && call.dataType == kNkMAIDDataType_EnumPtr)
      fault->editEnum(*static_cast<tagNkMAIDEnum*>(data));
  }
  return result;
}

void FaultPlan::carryOut(const Call& start, const std::function<void()>& step) {
  const Fault* fault = faultOf(start);
  if (fault != nullptr && fault->ownThread) return _worker.post(step);
  step();
}

// A record may announce more than there is: what a client copies on its word is zero, not foreign memory.
std::optional<int32_t> FaultPlan::deliver(const Delivery& delivery) {
  const Fault* fault = faultOf(delivery.start);
  if (fault == nullptr) return delivery.hand();
  if (fault->stopAfter && delivery.number >= *fault->stopAfter)
    return fault->completionResult.value_or(kNkMAIDResult_DataTransFailure);
  const DeliveryFault& about = fault->delivery;
  if (!about.concerns(delivery.number)) return delivery.hand();
  if (about.drop) return std::nullopt;
  Delivery changed = delivery;
  if (about.cutTo) changed.info.ulLength = std::min(changed.info.ulLength, *about.cutTo);
  if (about.edit) about.edit(changed.info);
  std::vector<uint8_t> padded;
  if (changed.info.ulLength > delivery.info.ulLength) {
    padded.resize(std::min<uint64_t>(changed.info.ulLength, kMaxPaddedBytes));
    std::memcpy(padded.data(), delivery.bytes, std::min<size_t>(delivery.info.ulLength, padded.size()));
    changed.bytes = padded.data();
  }
  const std::optional<int32_t> end = changed.hand();
  return about.twice && !end ? changed.hand() : end;
}

bool FaultPlan::holdsBack(const Call& start) {
  const Fault* fault = faultOf(start);
  return fault != nullptr &&
         (fault->completionAfterClose || static_cast<Hit*>(start.note.get())->latePolls++ < fault->completionPolls);
}

void FaultPlan::complete(const Call& start, int32_t result) {
  const Fault* fault = faultOf(start);
  if (fault != nullptr && fault->noCompletion) return;
  if (fault != nullptr && fault->completionTwice) addStray(start, result);
  start.complete(result);
}

void FaultPlan::abandoned(const Call& start, int32_t result) {
  const Fault* fault = faultOf(start);
  if (fault != nullptr && fault->completionAfterClose) addStray(start, result);
}

void FaultPlan::addStray(const Call& start, int32_t result) {
  const Guard guard(_mutex);
  _strays.push_back({start, result});
}

void FaultPlan::completeStrays() {
  std::vector<Stray> strays;
  {
    const Guard guard(_mutex);
    strays.swap(_strays);
  }
  for (const auto& [start, result] : strays) start.complete(result);
}

}  // namespace virtualcamera
