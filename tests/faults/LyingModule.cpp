#include "LyingModule.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <climits>
#include <cstdio>
#include <cstring>

#include "NameTables.h"

using virtualcamera::Level;

namespace {

std::atomic<LyingModule*> current{nullptr};

// How many polls of an object there are is the threads' business: only the first are places.
constexpr std::uint32_t kPolls = 4;

const char* const kSystemCalls[] = {"open", "fdopen", "fwrite", "write", "fclose", "memory", "thread"};

}  // namespace

LyingModule* lyingModule() { return current; }

// What the forwarding module calls.
extern "C" __attribute__((visibility("default"))) std::int32_t testEntryPoint(
    tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter, std::uint32_t dataType, std::uint64_t data,
    NkMAIDCompletionProc* completion, void* reference) {
  return lyingModule()->call(object, command, parameter, dataType, data, completion, reference);
}

std::string Place::text() const {
  const char* name = command == kDelivery ? "delivery"
                     : command >= kOpen   ? kSystemCalls[command - kOpen]
                                          : commandToName(static_cast<std::int32_t>(command));
  char line[160];
  std::snprintf(line, sizeof line, "%s 0x%x #%u of level %d, camera %u, item %u", name, parameter, nth,
                static_cast<int>(level), camera, item);
  return line;
}

LyingModule::LyingModule(virtualcamera::Model& model, std::optional<Place> place, Way way)
    : _model(model), _place(place), _way(way) {
  current = this;
}

LyingModule::~LyingModule() { current = nullptr; }

bool LyingModule::reached() {
  const std::lock_guard guard(_lock);
  return _reached;
}

std::vector<Place> LyingModule::places() {
  const std::lock_guard guard(_lock);
  return _places;
}

bool LyingModule::arrive(Place& place) {
  const std::lock_guard guard(_lock);
  place.nth = ++_counts[place.kind()];
  if (place.command != kNkMAIDCommand_Async || place.nth <= kPolls) _places.push_back(place);
  const bool here = _place == place;
  if (here) _reached = true;
  return here;
}

// The books.

Place LyingModule::placeOf(const tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter) {
  Place place{Level::Module, 0, 0, command, parameter, 0};
  if (object == nullptr) return place;
  const std::lock_guard guard(_lock);
  const auto found = _open.find(object);
  if (found == _open.end()) {
    ADD_FAILURE() << "not open: " << place.text();
    place.level = Level::Any;
    return place;
  }
  const Place& of = found->second.first;
  place.level = of.level;
  place.camera = of.camera;
  place.item = of.item;
  if (command != kNkMAIDCommand_Open) return place;
  place.level = static_cast<Level>(static_cast<int>(of.level) + 1);
  if (place.level == Level::Camera) place.camera = parameter;
  if (place.level == Level::Item) place.item = parameter;
  return place;
}

void LyingModule::keepBooks(const tagNkMAIDObject* object, const Place& place, std::uint64_t data,
                            std::int32_t result) {
  const std::lock_guard guard(_lock);
  if (place.command == kNkMAIDCommand_Open && result == kNkMAIDResult_NoError) {
    _open[reinterpret_cast<const tagNkMAIDObject*>(data)] = {place, object};
  } else if (place.command == kNkMAIDCommand_Close) {
    for (const auto& [record, opened] : _open) {
      EXPECT_NE(opened.second, object) << "still open: " << opened.first.text();
    }
    _open.erase(object);
  }
}

void LyingModule::expectAllClosed() {
  const std::lock_guard guard(_lock);
  for (const auto& [record, opened] : _open) ADD_FAILURE() << "never closed: " << opened.first.text();
}

// Calls.

std::int32_t LyingModule::call(tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter,
                               std::uint32_t dataType, std::uint64_t data, NkMAIDCompletionProc* completion,
                               void* reference) {
  Place place = placeOf(object, command, parameter);
  const bool here = arrive(place);
  if (beforeCall) beforeCall(place);
  auto callback =
      dataType == kNkMAIDDataType_CallbackPtr ? *reinterpret_cast<const tagNkMAIDCallback*>(data) : tagNkMAIDCallback{};
  {
    const std::lock_guard guard(_lock);
    if (completion != nullptr) _completions.emplace_back(completion, reference);
    if (callback.procedure != nullptr && parameter == kNkMAIDCapability_EventProc)
      _eventProcs.push_back({callback, place});
    if (callback.procedure != nullptr && parameter == kNkMAIDCapability_DataProc) {
      _dataProcs.push_back({callback, place});
      callback = {reinterpret_cast<void (*)()>(deliver), &_dataProcs.back()};
      data = reinterpret_cast<std::uintptr_t>(&callback);
    }
  }
  const auto pass = [&] {
    return virtualcamera::entryPoint(object, command, parameter, dataType, data, completion, reference);
  };
  if (command == kNkMAIDCommand_Close) keepBooks(object, place, data, 0);  // whatever comes of it
  const std::int32_t result = here ? astray(place, dataType, data, pass) : pass();
  if (command == kNkMAIDCommand_Open) keepBooks(object, place, data, result);
  return result;
}

std::int32_t LyingModule::astray(const Place& place, std::uint32_t dataType, std::uint64_t data,
                                 const std::function<std::int32_t()>& pass) {
  switch (_way) {
    case kRefused:
      return kNkMAIDResult_UnexpectedError;
    case kCondition:
      return kNkMAIDResult_DeviceBusy;
    case kBufferSize:
      return kNkMAIDResult_BufferSize;
    case kDoneButRefused:
      if (pass() == kNkMAIDResult_NoError && place.command == kNkMAIDCommand_Open) {
        virtualcamera::entryPoint(reinterpret_cast<tagNkMAIDObject*>(data), kNkMAIDCommand_Close, 0, 0, 0, nullptr,
                                  nullptr);
      }
      return kNkMAIDResult_UnexpectedError;
    case kNothingDone:
      // A completion that never comes is waited for as long as the camera is there.
      if (place.command == kNkMAIDCommand_CapStart) toUnplug = place.camera;
      return kNkMAIDResult_NoError;
    case kStormBefore:
    case kStormAfter:
    case kStormElsewhere: {
      stormOnce(kStormBefore);
      const std::int32_t result = pass();
      stormOnce(kStormAfter);
      return result;
    }
    default:
      break;
  }
  if (place.parameter == kNkMAIDCapability_Children && place.command == kNkMAIDCommand_CapGet && _way == kNonsense) {
    _model.faults().add({.level = place.level,
                         .parameter = kNkMAIDCapability_Children,
                         .times = 2,
                         .children = {{0, 256, 0xFFFFFFFF, 1, 1, 0x80000000, 2}}});
  }
  const std::int32_t result = pass();
  const std::int32_t results[] = {result, result, result, result, kNkMAIDResult_OrphanedChildren, INT_MIN, 99};
  const bool listed = place.parameter == kNkMAIDCapability_Children && _way == kNonsense;  // as it was said to be
  if (result == kNkMAIDResult_NoError && data != 0 && !(listed && place.command == kNkMAIDCommand_CapGet))
    scribble(place, dataType, reinterpret_cast<void*>(data));
  const std::int32_t answer = results[_way - kNonsense];
  if (place.command == kNkMAIDCommand_Open && answer != result && result == kNkMAIDResult_NoError) {
    // What was not said to be open will not be closed.
    virtualcamera::entryPoint(reinterpret_cast<tagNkMAIDObject*>(data), kNkMAIDCommand_Close, 0, 0, 0, nullptr,
                              nullptr);
  }
  return answer;
}

// Nonsense of the kind in question; nothing that only a module that writes where it should not would do.
void LyingModule::scribble(const Place& place, std::uint32_t dataType, void* data) const {
  const int kind = _way - kNonsense;
  constexpr std::uint32_t kNumbers[] = {0xFFFFFFFF, 0x80000000, 0, 1, 0x7FFFFFFF, 100, 1U << 20};
  switch (dataType) {
    case kNkMAIDDataType_BooleanPtr:
      *static_cast<std::uint8_t*>(data) = static_cast<std::uint8_t>(kNumbers[kind]);
      break;
    case kNkMAIDDataType_IntegerPtr:
    case kNkMAIDDataType_UnsignedPtr:
      *static_cast<std::uint32_t*>(data) = kNumbers[kind];
      break;
    case kNkMAIDDataType_StringPtr:
      std::memset(data, kind == 1 ? 0 : 'X', kNkMAIDStringSize);
      break;
    case kNkMAIDDataType_CapInfoPtr:
      for (auto* entry = static_cast<tagNkMAIDCapInfo*>(data);
           entry < static_cast<tagNkMAIDCapInfo*>(data) + place.parameter; ++entry) {
        if (kind == 0) std::memset(entry, 0xFF, sizeof *entry);
        constexpr std::uint32_t kTypes[] = {0, 1, 2, 3, 8, 12, 99};
        entry->valueType = kTypes[kind];
      }
      break;
    case kNkMAIDDataType_EnumPtr: {
      auto& record = *static_cast<tagNkMAIDEnum*>(data);
      if (place.command == kNkMAIDCommand_CapGetArray) {
        // The block is as large as the record said; so much of it may be filled with anything.
        std::memset(record.elements, kind < 2 ? 0xFF : 0,
                    std::size_t{record.elementCount} * static_cast<std::size_t>(record.elementSize));
        if (kind < 4) record.elements = reinterpret_cast<void*>(std::uintptr_t{8});
      }
      if (kind == 1) record.elementCount = 0xFFFFFFFF;
      if (kind == 2) record.elementSize = -1;
      if (kind == 3) record.currentIndex = 0xFFFFFFFF;
      if (kind == 4)
        record.elementType =
            record.elementType == kNkMAIDArrayType_String ? kNkMAIDArrayType_PackedString : kNkMAIDArrayType_String;
      if (kind == 5) record.elementCount = 0;
      if (kind == 6) record.elementSize = 2, record.elementType = 99;
      break;
    }
    default:
      break;
  }
}

// Deliveries.

std::int32_t LyingModule::deliver(void* registered, void* dataInfo, void* data) {
  auto& [callback, of] = *static_cast<Registered*>(registered);
  const auto next = [&callback = callback](void* info, void* bytes) {
    return reinterpret_cast<NkMAIDDataProc*>(callback.procedure)(callback.reference, info, bytes);
  };
  LyingModule* const self = lyingModule();
  Place place{of.level, of.camera, of.item, kDelivery, 0, 0};
  if (!self->arrive(place)) return next(dataInfo, data);
  auto info = *static_cast<tagNkMAIDFileInfo*>(dataInfo);
  switch (static_cast<int>(self->_way)) {
    case kRefused:  // lost
      return 0;
    case kCondition:  // again
      next(&info, data);
      break;
    case kBufferSize:
      return next(nullptr, data);
    case kDoneButRefused:
      return next(&info, nullptr);
    case kNothingDone:
      info.ulLength = 0;
      break;
    case kNonsense:
      info.dataType = 0;
      break;
    case kNonsense + 1:
      info.totalLength = 0;
      break;
    case kNonsense + 2:
      info.totalLength = 0xFFFFFFFF;
      break;
    case kNonsense + 3:
      info.ulStart = 0xFFFFFFF0;
      break;
    case kNonsense + 4:
      info.ulLength = 0xFFFFFFFF;
      info.ulStart = 1;
      break;
    case kNonsense + 5:
      info.ulLength = 0x7FFFFFFF;
      break;
    case kNonsense + 6:
      std::memset(&info.fileDataType, 0xFF, sizeof info.fileDataType);
      info.ulStart = 0;
      break;
    default:
      self->stormOnce(kStormBefore, true);
      break;
  }
  const std::int32_t result = next(&info, data);
  self->stormOnce(kStormAfter, true);
  return result;
}

// Calls of the system.

std::optional<Way> LyingModule::systemCall(SystemCall which) {
  Place place{Level::Any, 0, 0, which, 0, 0};
  return arrive(place) ? std::optional(_way) : std::nullopt;
}

// Storms.

void LyingModule::stormOnce(Way when, bool fromDelivery) {
  if (_way == when) storm(fromDelivery);
  if (_way == kStormElsewhere && when == kStormBefore) _stormThreads.emplace_back([this] { storm(); });
}

void LyingModule::storm(bool fromDelivery) {
  std::unique_lock guard(_lock);
  const auto events = _eventProcs;
  const auto deliveries = _dataProcs;
  const auto completions = _completions;
  guard.unlock();
  for (const auto& [callback, place] : events) {
    if (fromDelivery && place.level >= Level::Item) continue;
    for (const auto& [event, data] : {std::pair{kNkMAIDEvent_AddChild, 1},
                                      {kNkMAIDEvent_AddChild, 999},
                                      {kNkMAIDEvent_RemoveChild, 1},
                                      {kNkMAIDEvent_CapChange, 9}}) {
      reinterpret_cast<NkMAIDEventProc*>(callback.procedure)(callback.reference, static_cast<std::uint32_t>(event),
                                                             static_cast<std::uint64_t>(data));
    }
  }
  for (const auto& [callback, place] : deliveries) {
    if (fromDelivery && place.level == Level::Item) continue;
    tagNkMAIDFileInfo info{kNkMAIDDataObjType_Image | kNkMAIDDataObjType_File, kNkMAIDFileDataType_JPEG, kPictureBytes,
                           0, 0};
    reinterpret_cast<NkMAIDDataProc*>(callback.procedure)(callback.reference, &info, nullptr);
  }
  for (const auto& [procedure, reference] : completions) {
    procedure(nullptr, kNkMAIDCommand_CapStart, 0, 0, 0, reference, kNkMAIDResult_UnexpectedError);
  }
}

void LyingModule::endStorms() {
  for (auto& thread : _stormThreads) thread.join();
  _stormThreads.clear();
}
