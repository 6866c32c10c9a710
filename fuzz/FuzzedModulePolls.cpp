// What a fuzzed module calls back: completions, events and pieces of files, in time or not.
#include <algorithm>
#include <iterator>

#include "Check.h"
#include "FuzzedModule.h"

namespace fuzz {
namespace {

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

}  // namespace

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
