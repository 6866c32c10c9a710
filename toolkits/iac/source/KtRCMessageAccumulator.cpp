#include "KtRCMessageAccumulator.h"

#include <algorithm>
#include <chrono>
#include <cstring>
#include <utility>

#include "KtNSDataStreamBuf.h"
#include "Log.h"

namespace {

using namespace std::chrono_literals;

constexpr auto kQueueLockWait = 10s;
// A buffer that had to grow beyond this is given back once it is empty.
constexpr std::size_t kBufferToKeep = std::size_t{1} << 20;

}  // namespace

struct KtRCMessageAccumulator::Pass {
  Pass(std::istream& stream, std::shared_ptr<const platform::Data> data)
      : buffer(std::move(data)), in(stream), total(buffer.available()) {
    in.rdbuf(&buffer);
  }
  Pass(const Pass&) = delete;
  Pass& operator=(const Pass&) = delete;
  ~Pass() { in.rdbuf(nullptr); }

  // How many bytes have been read; of these, `position` are of steps that are done.
  std::int64_t read() const { return total - buffer.available(); }

  KtNSDataReadStreamBuf buffer;
  std::istream& in;
  const std::int64_t total;
  std::int64_t position = 0;
};

KtRCMessageAccumulator::KtRCMessageAccumulator(std::shared_ptr<platform::FileHandle> source, bool fromOrchard)
    : _sourceFileHandle(std::move(source)),
      _accumulatedData(std::make_shared<platform::MutableData>()),
      _currentMessage(std::make_unique<CRCMessage>()) {
  if (!fromOrchard) {
    _callersLoop = platform::RunLoop::current();
    observePipeForData();
    return;
  }
  // Set before the thread runs: a destruction that comes first must not be overlooked.
  _keepActiveRunloop = true;
  _readThread = platform::Thread::make([this] { startReadThread(); });
  _readThread->start();
}

KtRCMessageAccumulator::~KtRCMessageAccumulator() {
  if (_readThread) {
    _keepActiveRunloop = false;
    _readThread->cancel();
    _readThread->join();
  } else {
    _readObserver.remove();
    _sourceFileHandle->stopReading();
  }
}

void KtRCMessageAccumulator::observePipeForData() {
  _readObserver = platform::NotificationCenter::defaultCenter().addObserver(
      std::string(platform::kFileHandleReadCompletionNotification), _sourceFileHandle.get(),
      [this](const platform::Notification& notification) { dataWasRead(notification); });
  _sourceFileHandle->readInBackgroundAndNotify();
}

void KtRCMessageAccumulator::dataWasRead(const platform::Notification& notification) {
  if (notification.data->length() == 0) {
    _sourceFileHandle->stopReading();  // a thread of the reader's own has nothing left to run for
    platform::NotificationCenter::defaultCenter().post({kReadHandleIsFinished, this, nullptr});
    return;
  }
  const std::size_t chunk = notification.data->length();
  try {
    formMessagesWithData(*notification.data);
  } catch (...) {
    if (mayReadOn(chunk)) readOn();
    throw;
  }
  if (mayReadOn(chunk)) readOn();
}

void KtRCMessageAccumulator::readOn() { _sourceFileHandle->readInBackgroundAndNotify(); }

bool KtRCMessageAccumulator::mayReadOn(std::size_t chunk) {
  if (!_callersLoop) return true;
  if (!_messageQueueLock.try_lock_for(0s)) return true;  // whoever has it takes a message
  const platform::Guard guard(_messageQueueLock, platform::kAdopt);
  if (!_waitingMessages.empty()) _bytesSinceEmpty += chunk;
  _readingRests = _waitingMessages.size() >= kMostWaitingMessages || _bytesSinceEmpty >= kMostWaitingBytes;
  return !_readingRests;
}

void KtRCMessageAccumulator::formMessagesWithData(const platform::Data& chunk) {
  const auto skipped = static_cast<std::size_t>(std::min(_bytesToSkip, static_cast<std::int64_t>(chunk.length())));
  _bytesToSkip -= static_cast<std::int64_t>(skipped);
  _accumulatedData->append(chunk.bytes() + skipped, chunk.length() - skipped);

  const auto total = static_cast<std::int64_t>(_accumulatedData->length());
  if (total < (_currentMessageStage == kWholeFrame ? _currentMessage->length : _bytesNeeded)) return;
  _bytesNeeded = 0;

  Pass pass(_in, _accumulatedData);
  try {
    while (pass.position < pass.total && step(pass)) {
      if (_currentMessageStage == kQueue) addMessageToQueue();
    }
  } catch (const platform::Exception&) {
    // The bytes ran out, or the queue was not to be had: the next chunk goes on from the same step.
  } catch (...) {
    dropConsumedBytes(pass);
    throw;
  }
  dropConsumedBytes(pass);
}

void KtRCMessageAccumulator::dropConsumedBytes(const Pass& pass) {
  if (pass.position < pass.total) {
    if (pass.position > 0) _accumulatedData->removeFront(static_cast<std::size_t>(pass.position));
  } else if (_accumulatedData->capacity() > kBufferToKeep) {
    _accumulatedData->release();
  } else {
    _accumulatedData->clear();
  }
}

bool KtRCMessageAccumulator::step(Pass& pass) {
  switch (_currentMessageStage) {
    case kLength:
      return readLength(pass);
    case kWholeFrame:
      return readId(pass);
    case kName:
      readElement(pass, _currentMessage->name);
      return true;
    case kData:
      readElement(pass, _currentMessage->data);
      return true;
    default:
      return true;
  }
}

bool KtRCMessageAccumulator::readField(Pass& pass, std::int32_t& field) {
  if (pass.buffer.available() < static_cast<std::int64_t>(sizeof field)) return false;
  std::memcpy(&field, pass.buffer.take(sizeof field), sizeof field);
  pass.position = pass.read();
  return true;
}

bool KtRCMessageAccumulator::readLength(Pass& pass) {
  if (!readField(pass, _currentMessage->length)) return false;
  if (static_cast<std::int64_t>(sizeof _currentMessage->length) + _currentMessage->length > kLargestFrame) {
    dropFrame(pass, "longer than 64 MiB");
  } else {
    _currentMessageStage = kWholeFrame;
  }
  return true;
}

bool KtRCMessageAccumulator::readId(Pass& pass) {
  if (pass.total - pass.position < _currentMessage->length) return false;
  if (!readField(pass, _currentMessage->id)) return false;
  _frameConsumed = sizeof _currentMessage->id;
  _currentMessageStage = kName;
  return true;
}

void KtRCMessageAccumulator::readElement(Pass& pass, std::unique_ptr<KtLuaTE>& element) {
  constexpr std::int64_t kLargestRest = kLargestFrame - static_cast<std::int64_t>(sizeof(CRCMessage::length));
  try {
    element.reset(KtLuaTE::createFromStream(pass.in));
    const std::int64_t end = pass.read();
    if (_frameConsumed + end - pass.position > kLargestRest) throw KtMalformedElement("runs past 64 MiB");
    _frameConsumed += end - pass.position;
    pass.position = end;
    if (++_currentMessageStage == kQueue) noteStep();
  } catch (const KtStreamError& error) {
    const std::int64_t there = pass.total - pass.position;
    // Not for all that is missing: it is a length's word, and damage behind it shows with fewer bytes. With twice as
    // many as before, all decoding together stays within a multiple of the last.
    _bytesNeeded = there + std::min(error.missing(), there);
    if (_frameConsumed + there + error.missing() <= kLargestRest) throw;
    dropFrame(pass, "runs past 64 MiB");
  } catch (const KtMalformedElement& error) {
    dropFrame(pass, error.reason().c_str());
  }
}

// The frame ends where its elements do; what comes next is most likely not the length of another.
void KtRCMessageAccumulator::noteStep() {
  const bool fits = _frameConsumed == _currentMessage->length;
  if (!fits && !_outOfStep) {
    platform::log("Out of step with the host: a frame with length %d ended after %lld bytes", _currentMessage->length,
                  static_cast<long long>(_frameConsumed));
  }
  _outOfStep = !fits;
}

void KtRCMessageAccumulator::dropFrame(Pass& pass, const char* reason) {
  platform::log("Dropped a frame with length %d: %s", _currentMessage->length, reason);
  const std::int64_t left = std::max<std::int64_t>(_currentMessage->length - _frameConsumed, 0);
  const std::int64_t here = std::min(left, pass.total - pass.position);
  pass.position += here;
  _bytesToSkip = left - here;
  pass.in.clear();
  pass.in.seekg(pass.position);
  startNextMessage();
}

void KtRCMessageAccumulator::startNextMessage() {
  _currentMessage = std::make_unique<CRCMessage>();
  _currentMessageStage = kLength;
  _frameConsumed = 0;
  _bytesNeeded = 0;
}

void KtRCMessageAccumulator::addMessageToQueue() {
  if (!queueCurrentMessage()) {
    platform::AssertionHandler::current().handleFailureInMethod(
        "addMessageToQueue:", this, "toolkits/iac/source/KtRCMessageAccumulator", 252,
        "KtRemoteCommunicationMac: addMessageToQueue: Message is being lost because we timed out waiting for the queue "
        "lock!");
  }
  startNextMessage();
  platform::NotificationCenter::defaultCenter().post({kMessageIsAvailable, this, nullptr});
}

bool KtRCMessageAccumulator::queueCurrentMessage() {
  if (!_messageQueueLock.try_lock_for(kQueueLockWait)) return false;
  const platform::Guard guard(_messageQueueLock, platform::kAdopt);
  _waitingMessages.push_back(std::move(_currentMessage));
  return true;
}

std::unique_ptr<CRCMessage> KtRCMessageAccumulator::getNextMessage() {
  if (!_messageQueueLock.try_lock_for(kQueueLockWait)) return nullptr;
  const platform::Guard guard(_messageQueueLock, platform::kAdopt);
  if (_waitingMessages.empty()) return nullptr;
  auto message = std::move(_waitingMessages.front());
  _waitingMessages.pop_front();
  if (!_waitingMessages.empty()) return message;
  _bytesSinceEmpty = 0;
  if (std::exchange(_readingRests, false)) {
    _callersLoop->post([this, alive = std::weak_ptr(_alive)] {
      if (!alive.expired()) readOn();
    });
  }
  return message;
}

bool KtRCMessageAccumulator::hasWaiting(std::string_view name) {
  if (!_messageQueueLock.try_lock_for(kQueueLockWait)) return false;
  const platform::Guard guard(_messageQueueLock, platform::kAdopt);
  return std::any_of(_waitingMessages.begin(), _waitingMessages.end(), [&](const auto& message) {
    return message->name && static_cast<std::string>(*message->name) == name;
  });
}

void KtRCMessageAccumulator::startReadThread() {
  observePipeForData();
  while (_keepActiveRunloop && platform::RunLoop::current()->runOnce(platform::Clock::time_point::max())) {
    platform::log("NSRunLoop runs in worker thread to observe data from Pipe");
  }
  _readObserver.remove();
  _sourceFileHandle->stopReading();
  platform::log("NSRunLoop thread exit.");
}
