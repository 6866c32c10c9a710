#include "DeferredCalls.h"

#include <algorithm>
#include <chrono>

#include "RunLoop.h"

namespace {

// From 1 January 1970, where the system clock begins, to 1 January 2001.
constexpr double kReferenceDate = 978307200.0;

}  // namespace

std::vector<std::shared_ptr<CallDelay>>* CallDelay::queuedDelayedCalls = nullptr;

void CallAfterDelay(void (*proc)(void*), void* param, double delay) {
  CallDelay::cancelCallsToProc(proc, param);
  const auto call = CallDelay::init(proc, param);
  platform::RunLoop::current()->performAfter(platform::Seconds(delay), [call] { call->execute(); });
}

double currentTime() {
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  return std::chrono::duration<double>(now).count() - kReferenceDate;
}

std::shared_ptr<CallDelay> CallDelay::init(void (*proc)(void*), void* param) {
  std::shared_ptr<CallDelay> call(new CallDelay(proc, param));
  if (queuedDelayedCalls == nullptr) queuedDelayedCalls = new std::vector<std::shared_ptr<CallDelay>>;
  queuedDelayedCalls->push_back(call);
  return call;
}

void CallDelay::cancelCallsToProc(void (*proc)(void*), void* param) {
  if (queuedDelayedCalls == nullptr) return;
  for (const auto& call : *queuedDelayedCalls) {
    if (call->_proc == proc && call->_param == param) call->_canceled = true;
  }
}

void CallDelay::execute() {
  if (!_canceled) _proc(_param);
  auto& queued = *queuedDelayedCalls;
  queued.erase(std::find_if(queued.begin(), queued.end(), [this](const auto& call) { return call.get() == this; }));
}
