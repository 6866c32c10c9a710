#include "NikonThreadedObject.h"

#include <chrono>

#include "Thread.h"

namespace {

using namespace std::chrono_literals;

constexpr auto kForwardWait = 300ms;

}  // namespace

void CNikonThreadedObject::completionCallback_thread(std::int32_t /*command*/, std::int32_t /*result*/,
                                                     void* /*context*/) {}

std::int32_t CNikonThreadedObject::dataCallback_thread(void* /*dataInfo*/, void* /*data*/) { return 0; }

void CNikonThreadedObject::eventNotification_thread(std::int32_t /*event*/, void* /*data*/) {}

bool CNikonThreadedObject::shouldPassToDownloadThread() const {
  HomeThread* const thread = _downloadThread;
  return thread != nullptr && platform::Thread::current() != thread->homeThread();
}

void CNikonThreadedObject::completionCallback(std::int32_t command, std::int32_t result, void* context) {
  if (!shouldPassToDownloadThread()) {
    completionCallback_thread(command, result, context);
    return;
  }
  MessageForwardPackage::initCompletionWithTargetObject(this, command, result, context).performOnDownloadThread();
}

std::int32_t CNikonThreadedObject::dataCallback(void* dataInfo, void* data) {
  if (!shouldPassToDownloadThread()) return dataCallback_thread(dataInfo, data);
  auto package = MessageForwardPackage::initDataWithTargetObject(this, dataInfo, data);
  package.performOnDownloadThread();
  return package.getResult() ? 1 : 0;
}

void CNikonThreadedObject::eventNotification(std::int32_t event, void* data) {
  if (!shouldPassToDownloadThread()) {
    eventNotification_thread(event, data);
    return;
  }
  MessageForwardPackage::initEventNotificationWithTargetObject(this, event, data).performOnDownloadThread();
}

MessageForwardPackage::MessageForwardPackage(CallbackType type, CNikonThreadedObject* target)
    : _callbackType(type), _targetObject(target), _gate(target->gate()) {}

MessageForwardPackage MessageForwardPackage::initCompletionWithTargetObject(CNikonThreadedObject* target,
                                                                            std::int32_t commandId,
                                                                            std::int32_t errorCode, void* data) {
  MessageForwardPackage package(kCompletion, target);
  package._commandId = commandId;
  package._errorCode = errorCode;
  package._data = data;
  return package;
}

MessageForwardPackage MessageForwardPackage::initDataWithTargetObject(CNikonThreadedObject* target, void* dataInfo,
                                                                      void* data) {
  MessageForwardPackage package(kData, target);
  package._dataInfo = dataInfo;
  package._data = data;
  return package;
}

MessageForwardPackage MessageForwardPackage::initEventNotificationWithTargetObject(CNikonThreadedObject* target,
                                                                                   std::int32_t eventId, void* data) {
  MessageForwardPackage package(kEvent, target);
  package._commandId = eventId;
  package._data = data;
  return package;
}

void MessageForwardPackage::performOnDownloadThread() {
  HomeThread* const thread = _targetObject->downloadThread();
  // The object may have given it up meanwhile. It may wait for the outer callback, which would wait for this one, or
  // for the access lock.
  if (thread == nullptr || CallbackGate::Entry::isNested() || getAsyncLock().isMine()) return forwardMessage();
  const auto home = thread->homeThread()->runLoop();
  // Whoever deletes the target on the download thread must not wait for this thread, which waits for that one.
  const CallbackGate::StepOut outside(_gate);
  // Urgent: a transfer, which the thread may be waiting for, would keep this one as long as it takes. And not for ever:
  // the thread may be in a call into a module that waits for this callback.
  if (!home->performUrgently([this] { forwardMessage(); }, kForwardWait)) forwardMessage();
}

void MessageForwardPackage::forwardMessage() {
  const CallbackGate::Entry entry(_gate);
  if (!entry) return;
  switch (_callbackType) {
    case kCompletion:
      _targetObject->completionCallback_thread(_commandId, _errorCode, _data);
      break;
    case kData:
      _result = _targetObject->dataCallback_thread(_dataInfo, _data);
      break;
    case kEvent:
      _targetObject->eventNotification_thread(_commandId, _data);
      break;
    default:
      break;
  }
}
