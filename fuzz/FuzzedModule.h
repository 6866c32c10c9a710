// A camera module whose answers the input of a run changes: the virtual camera's model, between which and its caller
// results, lists, values and deliveries are replaced, and which is joined by callbacks that nobody expects.
//
// It is honest about memory alone: it reads and writes nothing but what it was given for that. Of its caller it expects
// what the interface promises, and a caller that breaks that is a finding: objects are open when they are called,
// children are closed before their parents, and everything is closed in the end. After some polls it answers no more of
// them, so that no wait goes on for ever.
#pragma once

#include <map>
#include <vector>

#include "Input.h"
#include "VirtualCamera.h"

namespace fuzz {

class FuzzedModule {
 public:
  // One at a time: it is behind the entry point while it lives.
  explicit FuzzedModule(Input& input) : _input(input), _talksAtAnyTime(input.onceIn(2)) {
    current = this;
    for (const uint32_t camera : {1, 2}) {
      _model.addCamera(camera, "Fuzzed").setTransfer({.deliveryBytes = 256U + _input.word(), .deliveriesPerPoll = 8});
      for (const uint32_t type : {1, 4}) {
        _model.camera(camera)->shoot(virtualcamera::patternPicture(type + _input.byte(), _input.number()));
      }
    }
    // What the record of an enumeration was changed to is filled, and what that of a delivery was is readable.
    _model.faults().add({.command = kNkMAIDCommand_CapGetArray, .anyArraySize = true});
    _model.faults().add({.command = kNkMAIDCommand_CapStart,
                         .delivery = {.count = UINT32_MAX, .edit = [this](auto& info) { change(info); }}});
  }
  FuzzedModule(const FuzzedModule&) = delete;
  FuzzedModule& operator=(const FuzzedModule&) = delete;
  ~FuzzedModule() {
    check(_model.openObjects() == 0, "everything opened is closed");
    current = nullptr;
  }

  static int32_t entryPoint(tagNkMAIDObject* object, uint32_t command, uint32_t parameter, uint32_t dataType,
                            uint64_t data, NkMAIDCompletionProc* completion, void* reference) {
    check(current != nullptr, "no call after the end");
    return current->call(object, command, parameter, dataType, data, completion, reference);
  }

 private:
  static constexpr int kMostCalls = 200000;
  static constexpr int kMostPolls = 16;
  static constexpr int kDeepestCallback = 3;
  static constexpr uint32_t kLongestFill = 1 << 12;

  struct EventProc {
    int level;  // 0 for the module
    tagNkMAIDCallback callback;
  };
  struct Completion {
    tagNkMAIDObject* object;
    uint32_t capability;
    NkMAIDCompletionProc* procedure;
    void* reference;
  };

  int32_t call(tagNkMAIDObject* record, uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
               NkMAIDCompletionProc* completion, void* reference) {
    check(++_calls < kMostCalls, "a run comes to its end");
    const bool polls = command == kNkMAIDCommand_Async;
    if (polls && ++_polls > kMostPolls) return kNkMAIDResult_HardwareError;
    const bool fails = command != kNkMAIDCommand_Close && _input.onceIn(polls ? 32 : 12);
    // An object is open where the caller is told so, and nowhere else.
    if (fails && command == kNkMAIDCommand_Open) return -1 - _input.byte();
    if (fails && _input.onceIn(2)) return result();
    note(record, command, parameter, dataType, data, completion, reference);
    int32_t answer = kNkMAIDResult_NoError;
    // Events are the input's alone. A new picture of a camera goes to another thread, where no run is like the other.
    if (command != kNkMAIDCommand_CapSet || parameter != kNkMAIDCapability_EventProc) {
      answer = virtualcamera::entryPoint(record, command, parameter, dataType, data, completion, reference);
    }
    check(answer != kNkMAIDResult_ZombieObject, "called objects are open");
    check(answer != kNkMAIDResult_OrphanedChildren, "children are closed before their parents");
    answer = change(command, parameter, dataType, reinterpret_cast<void*>(data), answer);
    for (int left = polls || _talksAtAnyTime ? _input.byte() & 3 : 0; left > 0; --left) talk();
    return fails ? result() : answer;
  }

  int32_t result() { return _input.onceIn(4) ? static_cast<int32_t>(_input.dword()) : 0 - _input.byte(); }

  // Keeps what may be called back.
  void note(tagNkMAIDObject* record, uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
            NkMAIDCompletionProc* completion, void* reference) {
    if (command == kNkMAIDCommand_Open) {
      const auto* const opened = reinterpret_cast<tagNkMAIDObject*>(data);
      check(opened->sdkHead == 0 && opened->sdkTail == 0, "a record is zeroed before it is opened");
      _levels[opened] = record == nullptr ? 0 : _levels[record] + 1;
    }
    if (command == kNkMAIDCommand_CapStart && completion != nullptr) {
      _completions.push_back({record, parameter, completion, reference});
    }
    if (command != kNkMAIDCommand_CapSet || dataType != kNkMAIDDataType_CallbackPtr) return;
    const auto callback = *reinterpret_cast<const tagNkMAIDCallback*>(data);
    check(callback.procedure != nullptr, "a callback that is registered has a procedure");
    if (parameter == kNkMAIDCapability_EventProc) _eventProcs.push_back({_levels[record], callback});
    if (parameter == kNkMAIDCapability_DataProc) _dataProcs.push_back(callback);
  }

  // Changes what the call answered.
  int32_t change(uint32_t command, uint32_t parameter, uint32_t dataType, void* data, int32_t answer) {
    if (command == kNkMAIDCommand_GetCapCount && _input.onceIn(8)) {
      *static_cast<uint32_t*>(data) = _input.onceIn(8) ? _input.dword() : _input.number() & 0xfff;
    }
    if (command == kNkMAIDCommand_GetCapInfo && (answer != kNkMAIDResult_NoError || _input.onceIn(4))) {
      auto* const list = static_cast<tagNkMAIDCapInfo*>(data);
      for (uint32_t index = 0; index < std::min(parameter, kLongestFill); ++index) {
        if (answer != kNkMAIDResult_NoError)
          list[index].id = _input.onceIn(2) ? 0x8000 + _input.byte() : _input.number();
        if (!_input.empty() && _input.onceIn(4)) list[index].valueType = _input.number() & 15;
      }
      return kNkMAIDResult_NoError;
    }
    if (command == kNkMAIDCommand_CapGetArray) fill(*static_cast<tagNkMAIDEnum*>(data));
    if (command != kNkMAIDCommand_CapGet || !_input.onceIn(4)) return answer;
    if (dataType == kNkMAIDDataType_EnumPtr) {
      change(*static_cast<tagNkMAIDEnum*>(data));
    } else if (dataType == kNkMAIDDataType_StringPtr) {
      std::memset(data, 'n', kNkMAIDStringSize);
    } else if (dataType == kNkMAIDDataType_BooleanPtr) {
      *static_cast<uint8_t*>(data) = _input.byte();
    } else {
      *static_cast<uint32_t*>(data) = _input.number();
    }
    return kNkMAIDResult_NoError;
  }

  void change(tagNkMAIDEnum& record) {
    const uint8_t which = _input.byte();
    if ((which & 1) != 0) record.elementType = _input.number();
    if ((which & 2) != 0) record.elementCount = _input.number();
    if ((which & 4) != 0) record.currentIndex = _input.number();
    if ((which & 8) != 0) record.elementSize = static_cast<int16_t>(_input.word());
  }

  void fill(tagNkMAIDEnum& record) {
    check(record.elementSize > 0 && record.elements != nullptr, "there is room for the elements");
    const uint64_t size = uint64_t{record.elementCount} * static_cast<uint64_t>(record.elementSize);
    auto* const bytes = static_cast<uint8_t*>(record.elements);
    if (size > 0) bytes[size - 1] = 0;  // the room is what the record says
    if (!_input.onceIn(8)) return;
    for (uint64_t at = 0; at < std::min<uint64_t>(size, kLongestFill); ++at) bytes[at] = _input.byte();
    change(record);
  }

  void change(tagNkMAIDFileInfo& info) {
    const uint8_t which = _input.onceIn(8) ? _input.byte() : 0;
    if ((which & 1) != 0) info.dataType = _input.number();
    if ((which & 2) != 0) info.totalLength = _input.number();
    if ((which & 4) != 0) info.ulStart = _input.number();
    if ((which & 8) != 0) info.ulLength = _input.word();
  }

  // A callback at a time of its own: a completion, an event or a piece of a file; of closed objects too.
  void talk() {
    const uint8_t kind = _input.byte();
    if (_depth >= kDeepestCallback) return;
    ++_depth;
    if (kind >= 170 && !_completions.empty()) {
      const Completion& done = _completions[_input.byte() % _completions.size()];
      done.procedure(done.object, kNkMAIDCommand_CapStart, done.capability, 0, 0, done.reference, result());
    } else if (kind >= 85 && !_eventProcs.empty()) {
      const EventProc target = _eventProcs[_input.byte() % _eventProcs.size()];
      const uint32_t event = _input.onceIn(4) ? _input.number() : _input.byte() % 8;
      const auto procedure = reinterpret_cast<NkMAIDEventProc*>(target.callback.procedure);
      if (target.level != 1 || event != kNkMAIDEvent_AddChild) {
        procedure(target.callback.reference, event, _input.number());
      }
    } else if (!_dataProcs.empty()) {
      const tagNkMAIDCallback target = _dataProcs[_input.byte() % _dataProcs.size()];
      tagNkMAIDFileInfo info{kNkMAIDDataObjType_File | kNkMAIDDataObjType_Image, _input.byte(), _input.number(),
                             _input.number(), _input.number()};
      // As many bytes as the record says, or none.
      std::vector<uint8_t> bytes(info.ulLength <= UINT16_MAX ? info.ulLength : 0);
      void* const record = _input.onceIn(32) ? nullptr : &info;
      reinterpret_cast<NkMAIDDataProc*>(target.procedure)(target.reference, record,
                                                          bytes.empty() ? nullptr : bytes.data());
    }
    --_depth;
  }

  static inline FuzzedModule* current = nullptr;
  Input& _input;
  virtualcamera::Model _model;
  std::map<const tagNkMAIDObject*, int> _levels;
  std::vector<EventProc> _eventProcs;
  std::vector<tagNkMAIDCallback> _dataProcs;
  std::vector<Completion> _completions;
  const bool _talksAtAnyTime;
  int _polls = 0;
  int _calls = 0;
  int _depth = 0;  // callbacks inside each other
};

}  // namespace fuzz
