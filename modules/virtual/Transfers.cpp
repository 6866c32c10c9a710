// Pictures on their way: one delivery after another, through the faults that are about them.
#include <cstring>

#include "Core.h"

namespace virtualcamera {
namespace {

constexpr uint64_t kMaxPaddedBytes = 64u << 20;

uint64_t sizeOf(const Picture& picture) { return std::min<uint64_t>(picture.size(), UINT32_MAX); }

uint32_t nextLength(const Object& object, const Action& action) {
  const uint64_t left = sizeOf(object.item->picture) - action.offset;
  const uint32_t most = std::max(object.camera->transfer.deliveryBytes, 1u);
  return static_cast<uint32_t>(std::min<uint64_t>(left, most));
}

// A record may announce more than there is: what a client copies on its word is zero, not foreign memory.
const uint8_t* padded(const uint8_t* bytes, uint32_t length, uint32_t announced, std::vector<uint8_t>& room) {
  if (announced <= length) return bytes;
  room.resize(std::min<uint64_t>(announced, kMaxPaddedBytes));
  std::memcpy(room.data(), bytes, std::min<size_t>(length, room.size()));
  return room.data();
}

// Without a lock: reads the piece and hands it over. Answers what the transfer would end with.
int32_t show(const Object& object, Action& action, tagNkMAIDFileInfo info, const tagNkMAIDCallback& proc) {
  static constexpr uint8_t kNothing = 0;
  const DeliveryFault& fault = action.fault.delivery;
  const bool faulty = fault.concerns(action.deliveries);
  if (faulty && fault.drop) return kNkMAIDResult_NoError;
  const PictureSource* source = object.item->picture.source.get();
  const uint8_t* bytes = source ? source->piece(info.ulStart, info.ulLength, action.scratch) : &kNothing;
  if (bytes == nullptr) return kNkMAIDResult_DataTransFailure;

  const uint32_t length = info.ulLength;
  if (faulty && fault.cutTo) info.ulLength = std::min(info.ulLength, *fault.cutTo);
  if (faulty && fault.edit) fault.edit(info);
  std::vector<uint8_t> room;
  auto* data = const_cast<uint8_t*>(padded(bytes, length, info.ulLength, room));  // clients do not write to it
  const auto procedure = reinterpret_cast<NkMAIDDataProc*>(proc.procedure);
  for (int times = faulty && fault.twice ? 2 : 1; times > 0; --times) {
    tagNkMAIDFileInfo shown = info;
    if (procedure(proc.reference, &shown, data) != 0) return kNkMAIDResult_Aborted;
  }
  return kNkMAIDResult_NoError;
}

}  // namespace

void Core::transfer(Lock& lock, const ObjectPtr& object, const std::shared_ptr<Action>& action) {
  ++action->polls;
  for (uint32_t i = 0; i < object->camera->transfer.deliveriesPerPoll; ++i) {
    if (!objects_.contains(object->handle) || object->action != action || action->busy || action->done) return;
    if (isGone(*object) || !deliveryDue(*object, *action)) return;
    deliverPiece(lock, object, action);
  }
  action->polls = 0;
}

bool Core::deliveryDue(const Object& object, Action& action) const {
  const TransferOptions& options = object.camera->transfer;
  if (action.polls < options.pollsPerDelivery) return false;
  if (options.bytesPerSecond == 0) return true;
  const std::chrono::duration<double> elapsed = Clock::now() - action.started;
  return static_cast<double>(action.offset) <= elapsed.count() * static_cast<double>(options.bytesPerSecond);
}

void Core::deliverPiece(Lock& lock, const ObjectPtr& object, const std::shared_ptr<Action>& action) {
  const Picture& picture = object->item->picture;
  if (action->fault.stopAfter && action->deliveries >= *action->fault.stopAfter)
    return endAction(*action, action->fault.completionResult.value_or(kNkMAIDResult_DataTransFailure));

  tagNkMAIDFileInfo info{};
  info.dataType = kNkMAIDDataObjType_Image | kNkMAIDDataObjType_File;
  info.fileDataType = picture.fileDataType;
  info.totalLength = static_cast<uint32_t>(sizeOf(picture));
  info.ulStart = static_cast<uint32_t>(action->offset);
  info.ulLength = nextLength(*object, *action);
  action->busy = true;
  const auto deliver = [this, object, action, info](Lock& held) {
    const int32_t result = showPiece(held, object, action, info);
    finishDelivery(object, *action, info.ulLength, result);
  };
  if (!action->fault.ownThread) return deliver(lock);
  worker_.post([this, deliver] {
    Lock held(mutex_);
    deliver(held);
  });
}

int32_t Core::showPiece(Lock& lock, const ObjectPtr& object, const std::shared_ptr<Action>& action,
                        tagNkMAIDFileInfo info) {
  const tagNkMAIDCallback proc = object->dataProc;
  if (!objects_.contains(object->handle) || isGone(*object)) return kNkMAIDResult_ZombieObject;
  if (proc.procedure == nullptr) return kNkMAIDResult_NoDataProc;
  return callBack(lock, object, [&] { return show(*object, *action, info, proc); });
}

// Also while the client is still being shown the last piece: it keeps it.
bool Core::isSent(const Object& object) {
  if (!object.action || object.action->capability != kNkMAIDCapability_Acquire) return false;
  const Action& action = *object.action;
  if (action.done) return action.result == kNkMAIDResult_NoError;
  const bool showing = action.busy && !object.callbacks.empty();
  const bool fails = action.fault.completionResult.value_or(kNkMAIDResult_NoError) != kNkMAIDResult_NoError;
  return showing && !fails && action.offset + nextLength(object, action) >= sizeOf(object.item->picture);
}

void Core::finishDelivery(const ObjectPtr& object, Action& action, uint32_t length, int32_t result) {
  action.busy = false;
  action.offset += length;
  ++action.deliveries;
  if (result != kNkMAIDResult_NoError) {
    endAction(action, result);
  } else if (action.offset >= sizeOf(object->item->picture)) {
    endAction(action, action.fault.completionResult.value_or(kNkMAIDResult_NoError));
  }
}

}  // namespace virtualcamera
