// The functions that the SDK calls back.

#include <exception>
#include <unordered_map>

#include "CompletionRecords.h"
#include "Log.h"
#include "NikonObject.h"

namespace {

struct Outstanding {
  CompletionRecord record;
  std::shared_ptr<CallbackGate> gate;
};

platform::Mutex outstandingLock;
std::uintptr_t lastReference GUARDED_BY(outstandingLock) = 0;

std::unordered_map<std::uintptr_t, Outstanding>& outstanding() REQUIRES(outstandingLock) {
  static auto* const all = new std::unordered_map<std::uintptr_t, Outstanding>;
  return *all;
}

// Runs what an SDK callback asks for. The SDK's frames are C: nothing is thrown through them.
template <typename Call>
std::int32_t guarded(const char* callback, Call call) {
  try {
    return call();
  } catch (const std::exception& exception) {
    platform::log("Exception in %s: %s", callback, exception.what());
  } catch (std::int32_t result) {
    platform::log("SDK result thrown in %s: %d", callback, result);
  } catch (...) {
    platform::log("Unknown exception in %s", callback);
  }
  return 0;
}

CNikonCallbackReceiver* receiverOf(void* reference) { return static_cast<CNikonCallbackReceiver*>(reference); }

}  // namespace

void* addCompletionRecord(const CompletionRecord& record) {
  auto gate = CallbackGate::find(record.receiver);
  const platform::Guard guard(outstandingLock);
  outstanding()[++lastReference] = {record, std::move(gate)};
  return reinterpret_cast<void*>(lastReference);
}

bool takeCompletionRecord(void* reference, CompletionRecord& record, std::unique_ptr<CallbackGate::Entry>& entry) {
  const platform::Guard guard(outstandingLock);
  const auto found = outstanding().find(reinterpret_cast<std::uintptr_t>(reference));
  if (found == outstanding().end()) return false;
  record = found->second.record;
  if (found->second.gate) {
    // Before the caller is let go: it waits for whom it finds inside.
    entry = std::make_unique<CallbackGate::Entry>(found->second.gate);
    if (!*entry) record.receiver = nullptr;
  }
  outstanding().erase(found);
  if (record.counter != nullptr) record.counter->fetch_add(1);
  return true;
}

void detachCompletionRecord(void* reference) {
  const platform::Guard guard(outstandingLock);
  outstanding().erase(reinterpret_cast<std::uintptr_t>(reference));
}

void MAIDEventHandler(void* reference, std::uint32_t event, std::uint64_t data) {
  guarded("MAIDEventHandler", [&] {
    auto gate = CallbackGate::find(reference);
    if (!gate) return 0;
    const auto notify = [reference, event, data] {
      receiverOf(reference)->eventNotification(static_cast<std::int32_t>(event), reinterpret_cast<void*>(data));
    };
    const CallbackGate::Entry entry(gate);
    if (entry) {
      notify();
    } else if (!gate->keepForLater([=] {
                 guarded("MAIDEventHandler", [&] {
                   notify();
                   return 0;
                 });
               })) {
      const CallbackGate::Entry late(gate);  // it may have opened in between
      if (late) notify();
    }
    return 0;
  });
}

std::int32_t MAIDDataHandler(void* reference, void* dataInfo, void* data) {
  return guarded("MAIDDataHandler", [&] {
    const CallbackGate::Entry entry(CallbackGate::find(reference));
    return entry ? receiverOf(reference)->dataCallback(dataInfo, data) : 0;
  });
}

void CommandCompletionProc(tagNkMAIDObject* /*object*/, std::uint32_t command, std::uint32_t /*parameter*/,
                           std::uint32_t /*dataType*/, std::uint64_t /*data*/, void* reference, std::int32_t result) {
  guarded("CommandCompletionProc", [&] {
    CompletionRecord record{};
    std::unique_ptr<CallbackGate::Entry> entry;
    if (reference == nullptr || !takeCompletionRecord(reference, record, entry)) return 0;
    if (record.receiver != nullptr) {
      record.receiver->completionCallback(static_cast<std::int32_t>(command), result, record.context);
    }
    return 0;
  });
}
