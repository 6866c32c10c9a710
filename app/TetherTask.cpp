#include "TetherTask.h"

#include <array>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <string_view>

#include "Application.h"
#include "HostMessages.h"
#include "Log.h"
#include "MessageNames.h"
#include "NikonTetherService.h"

namespace {

using namespace std::chrono_literals;

constexpr auto kHeartbeatInterval = 2.0s;
constexpr auto kFirstIdleDelay = 1.0s;
constexpr auto kIdleDelay = 0.1s;
constexpr auto kDispatchDelay = 0.1s;

struct Request {
  std::string_view name;
  void (NikonTetherService::*operation)(int id, KtLuaTE* data);  // null: known, but nothing is done
  bool guarded;                                                  // dropped while the busy flag is set
};

constexpr std::array kRequests{
    Request{kMessageListDevices, &NikonTetherService::listDevices, false},
    Request{kMessageGetDeviceInfo, nullptr, false},
    Request{kMessageConnectDevice, &NikonTetherService::connectDevice, false},
    Request{kMessageDisconnectDevice, &NikonTetherService::disconnectDevice, false},
    Request{kMessageDoCapture, &NikonTetherService::doCapture, true},
    Request{kMessageDownloadThumbnail, nullptr, false},
    Request{kMessageGetCaptureInfo, nullptr, false},
    Request{kMessageStartDownload, nullptr, false},
    Request{kMessageGetCameraSettings, &NikonTetherService::getCameraSettings, true},
};

void carryOut(const Request& request, NikonTetherService& service, const CRCMessage& message) {
  if (request.operation == nullptr) return;
  if (!request.guarded) {
    (service.*request.operation)(message.id, message.data.get());
  } else if (!TetherTaskStatus::IsInProgress()) {
    const TetherTaskStatus busy;
    (service.*request.operation)(message.id, message.data.get());
  }
}

}  // namespace

TetherTask* gTetherTask = nullptr;

bool TetherTaskStatus::inProgress = false;

void SendMessageToClient(long id, const char* name, KtLuaTETable* data) {
  const KtLuaTEString nameElement(name);
  gTetherTask->sendMessage(nameElement, static_cast<std::int32_t>(id), data);
}

TetherTask::TetherTask() = default;

TetherTask::~TetherTask() {
  _accumulatorObserver.remove();
  _messageAccumulator.reset();
  _inputFileHandle.reset();
  _tetherService.reset();  // it may send until it is gone
  _timer.invalidate();
}

void TetherTask::awakeFromNib() {
  gTetherTask = this;
  _tetherService.reset(NikonTetherService::getSingleton());
  _outputFileHandle = platform::FileHandle::standardOutput();
  _inputFileHandle = platform::FileHandle::standardInput();
  _messageAccumulator = std::make_unique<KtRCMessageAccumulator>(_inputFileHandle);
  _timer = platform::Timer::repeating(kHeartbeatInterval, [this] { sendHeartbeat(); });

  _accumulatorObserver = platform::NotificationCenter::defaultCenter().addObserver(
      "", _messageAccumulator.get(), [this](const auto& notification) { notificationFromAccumulator(notification); });
  _terminateObserver = platform::NotificationCenter::defaultCenter().addObserver(
      std::string(platform::kApplicationWillTerminateNotification), nullptr, [this](const auto&) { willShutdown(); });
  _wakeObserver = platform::NotificationCenter::workspaceCenter().addObserver(
      std::string(platform::kWorkspaceDidWakeNotification), nullptr, [this](const auto&) { receiveWakeNote(); });

  _tetherService->doInitialCameraScan();
  _idleTimer = platform::Timer::once(kFirstIdleDelay, [this] { timer(); });
}

// Requests in.

void TetherTask::notificationFromAccumulator(const platform::Notification& notification) {
  if (notification.name == kMessageIsAvailable) {
    platform::RunLoop::current()->performAfter(kDispatchDelay, [this, alive = std::weak_ptr(_alive)] {
      if (!alive.expired()) dispatchMessages();
    });
  } else if (notification.name == kReadHandleIsFinished) {
    // A host may close the pipe as soon as it has asked for the end.
    if (!_messageAccumulator->hasWaiting(kMessageShutdown)) platform::Application::shared().terminate();
    platform::Application::shared().ignoreEndOfInput();
  }
}

void TetherTask::dispatchMessages() {
  while (const auto message = _messageAccumulator->getNextMessage()) dispatchMessage(message.get());
}

void TetherTask::dispatchMessage(CRCMessage* message) {
  if (!_tetherService || message == nullptr || !message->name) return;
  const std::string name = static_cast<std::string>(*message->name);
  for (const Request& request : kRequests) {
    if (request.name != name) continue;
    carryOut(request, *_tetherService, *message);
    return;
  }
  if (name == kMessageShutdown) {
    platform::Application::shared().ignoreEndOfInput();
    _tetherService.reset();
    platform::Application::shared().terminate();
  }
}

// Time.

void TetherTask::timer() {
  try {
    if (!TetherTaskStatus::IsInProgress()) {
      const TetherTaskStatus busy;
      _tetherService->idle();
    }
  } catch (...) {
    scheduleNextIdle();  // one pass that went wrong is not the last
    throw;
  }
  scheduleNextIdle();
}

void TetherTask::scheduleNextIdle() {
  _idleTimer = platform::Timer::once(kIdleDelay, [this] { timer(); });
}

void TetherTask::sendHeartbeat() { sendMessage(KtLuaTEString(kMessageHeartbeat), 0, nullptr); }

// Frames out.

void TetherTask::sendMessage(const KtLuaTEString& name, std::int32_t id, const KtLuaTETable* data) {
  const platform::Guard guard(_frameLock);
  if (_hostIsGone) return;
  const platform::Data& frame = _frameWriter.frame(id, name, data);
  // One write for the whole frame, so that nothing comes between its parts.
  const int error = _outputFileHandle->write(frame.bytes(), frame.length());
  if (error == 0 || error == ECANCELED) return;
  _hostIsGone = true;
  platform::log("Writing to the host failed, no more is written: %s", std::strerror(error));
}
