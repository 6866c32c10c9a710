#include "TetherTask.h"

#include <array>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <ostream>
#include <string_view>

#include "Application.h"
#include "HostMessages.h"
#include "KtNSDataStreamBuf.h"
#include "Log.h"
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
    Request{"listDevices", &NikonTetherService::listDevices, false},
    Request{"getDeviceInfo", nullptr, false},
    Request{"connectDevice", &NikonTetherService::connectDevice, false},
    Request{"disconnectDevice", &NikonTetherService::disconnectDevice, false},
    Request{"doCapture", &NikonTetherService::doCapture, true},
    Request{"downloadThumbnail", nullptr, false},
    Request{"getCaptureInfo", nullptr, false},
    Request{"startDownload", nullptr, false},
    Request{"getCameraSettings", &NikonTetherService::getCameraSettings, true},
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

TetherTask::~TetherTask() = default;

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
    platform::Application::shared().terminate();
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
  if (name == "shutdown") {
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

void TetherTask::sendHeartbeat() { sendMessage(KtLuaTEString("heartbeat"), 0, nullptr); }

// Frames out.

std::shared_ptr<const platform::Data> TetherTask::luaTableElementToNSData(const KtLuaTE& element) {
  KtNSDataWriteStreamBuf buffer(0);
  std::ostream out(&buffer);
  element.writeToStream(out);
  return buffer.getNSData();
}

void TetherTask::sendMessage(const KtLuaTEString& name, std::int32_t id, const KtLuaTETable* data) {
  const auto nameBytes = luaTableElementToNSData(name);
  const auto dataBytes = data != nullptr ? luaTableElementToNSData(*data) : luaTableElementToNSData(KtLuaTENil());
  const auto length = static_cast<std::int32_t>(sizeof id + nameBytes->length() + dataBytes->length());

  // One write for the whole frame, so that nothing comes between its parts.
  platform::MutableData frame(sizeof length + static_cast<std::size_t>(length));
  frame.append(reinterpret_cast<const char*>(&length), sizeof length);
  frame.append(reinterpret_cast<const char*>(&id), sizeof id);
  frame.append(nameBytes->bytes(), nameBytes->length());
  frame.append(dataBytes->bytes(), dataBytes->length());
  if (_hostIsGone) return;
  const int error = _outputFileHandle->write(frame.bytes(), frame.length());
  if (error != 0 && error != ECANCELED && !_hostIsGone.exchange(true)) {
    platform::log("Writing to the host failed, no more is written: %s", std::strerror(error));
  }
}
