// Pictures on their way: one delivery after another.
#include "Core.h"

namespace camerakit {
namespace {

uint64_t sizeOf(const Picture& picture) { return std::min<uint64_t>(picture.size(), UINT32_MAX); }

uint32_t nextLength(const Object& object, const Action& action) {
  const uint64_t left = sizeOf(object.item->picture) - action.offset;
  const uint32_t most = std::max(object.state->transfer.deliveryBytes, 1u);
  return static_cast<uint32_t>(std::min<uint64_t>(left, most));
}

bool isDue(const TransferOptions& options, const Action& action) {
  if (action.polls < options.pollsPerDelivery) return false;
  if (options.bytesPerSecond == 0) return true;
  const std::chrono::duration<double> elapsed = Clock::now() - action.begun;
  return static_cast<double>(action.offset) <= elapsed.count() * static_cast<double>(options.bytesPerSecond);
}

Piece read(const Picture& picture, const tagNkMAIDFileInfo& info, std::vector<uint8_t>& scratch) {
  static constexpr uint8_t kNothing = 0;
  try {
    return picture.source ? picture.source->piece(info.ulStart, info.ulLength, scratch) : &kNothing;
  } catch (...) {  // as if it could not be read
    return nullptr;
  }
}

}  // namespace

void Core::transfer(const ObjectPtr& object, const ActionPtr& action) {
  ++action->polls;
  for (uint32_t i = 0; i < object->state->transfer.deliveriesPerPoll; ++i) {
    if (!isOpen(*object) || object->action != action || action->busy || action->done || isGone(*object)) return;
    if (!isDue(object->state->transfer, *action)) return;
    const uint32_t before = action->deliveries;
    deliverPiece(object, action);
    if (action->deliveries == before) return;
  }
  action->polls = 0;
}

void Core::deliverPiece(const ObjectPtr& object, const ActionPtr& action) {
  const Picture& picture = object->item->picture;
  tagNkMAIDFileInfo info{};
  info.dataType = kNkMAIDDataObjType_Image | kNkMAIDDataObjType_File;
  info.fileDataType = picture.fileDataType;
  info.totalLength = static_cast<uint32_t>(sizeOf(picture));
  info.ulStart = static_cast<uint32_t>(action->offset);
  info.ulLength = nextLength(*object, *action);
  action->busy = true;
  const Release release(_mutex);
  _hooks.carryOut(action->start,
                  [self = shared_from_this(), object, action, info] { self->step(object, *action, info); });
}

void Core::step(const ObjectPtr& object, Action& action, const tagNkMAIDFileInfo& info) {
  {
    const Guard guard(_mutex);
    if (action.done) return;  // abandoned
  }
  const Piece piece = read(object->item->picture, info, action.scratch);
  const Guard guard(_mutex);
  const bool waits = piece.bytes() == nullptr && piece.result() == kNkMAIDResult_Pending;
  if (!waits) {
    const std::optional<int32_t> end =
        piece.bytes() != nullptr ? show(object, action, info, piece.bytes()) : piece.result();
    action.offset += info.ulLength;
    ++action.deliveries;
    if (end || action.offset >= info.totalLength) endAction(action, end.value_or(action.start.outcome));
  }
  action.busy = false;
}

std::optional<int32_t> Core::show(const ObjectPtr& object, const Action& action, const tagNkMAIDFileInfo& info,
                                  const uint8_t* bytes) {
  const tagNkMAIDCallback receiver = object->dataProc;
  if (!isOpen(*object) || isGone(*object)) return kNkMAIDResult_ZombieObject;
  if (receiver.procedure == nullptr) return kNkMAIDResult_NoDataProc;
  const Delivery delivery{action.start, action.deliveries, info, bytes, receiver};
  return callBack(object, [&] { return _hooks.deliver(delivery); });
}

// Also while the client is still being shown the last piece: it keeps it.
bool Core::isSent(const Object& object) {
  if (!object.action || !object.item) return false;
  const Action& action = *object.action;
  if (action.done) return action.result == kNkMAIDResult_NoError;
  const bool showing = action.busy && !object.callbacks.empty();
  const bool fails = action.start.outcome != kNkMAIDResult_NoError;
  return showing && !fails && action.offset + nextLength(object, action) >= sizeOf(object.item->picture);
}

}  // namespace camerakit
