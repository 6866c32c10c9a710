// Starting what an object announces, and waiting for its end.

#include <ctime>

#include "CompletionRecords.h"
#include "ModuleLoading.h"
#include "NikonObject.h"
#include "RunLoop.h"

namespace {

constexpr timespec kPollPause{0, 10000};

}  // namespace

std::int32_t CNikonObject::capStart(std::int32_t capability, CNikonCallbackReceiver* receiver, void* context) {
  const auto open = record();
  if (!open) return kNotOpen;
  std::atomic<std::uint32_t> counter{0};
  void* const reference = receiver == nullptr ? nullptr : addCompletionRecord({receiver, context, &counter});
  std::int32_t result = kNotOpen;
  {
    const SdkRecord::Call call(open);
    if (call) {
      result = CallMAIDEntryPoint(_entryPoint, call.object(), kNkMAIDCommand_CapStart, capability, kNkMAIDDataType_Null,
                                  0, CommandCompletionProc, reference);
    }
  }
  if (receiver == nullptr) return result;
  if (result == kNkMAIDResult_NoError || result == kNkMAIDResult_Pending) IdleLoop(open->get(), &counter, 1);
  // A completion that comes later than this finds nothing; one that has come on another thread is waited for.
  detachCompletionRecord(reference);
  if (const auto receiverGate = CallbackGate::find(receiver)) receiverGate->waitForOthers();
  return result;
}

// The record is polled as long as it is this object's.
int CNikonObject::IdleLoop(tagNkMAIDObject* /*object*/, const std::atomic<std::uint32_t>* counter,
                           std::uint32_t target) {
  bool goesOn = true;
  while (*counter < target && goesOn) {
    goesOn = async() && !isGivenUp();
    platform::RunLoop::runUrgentCalls();
    nanosleep(&kPollPause, nullptr);
  }
  return 1;
}

bool CNikonObject::async() {
  const std::int32_t result = send(kNkMAIDCommand_Async, 0, kNkMAIDDataType_Null, 0);
  _lastPollResult = result;
  return result == kNkMAIDResult_NoError || result == kNkMAIDResult_Pending;
}

std::int32_t CNikonObject::issueCommand(std::int32_t capability, CNikonCallbackReceiver* receiver, void* context) {
  if (!hasCapability(capability)) return kNkMAIDResult_NoError;
  const std::int32_t result = capStart(capability, receiver, context);
  return result == kNkMAIDResult_Pending ? static_cast<std::int32_t>(kNkMAIDResult_NoError) : result;
}
