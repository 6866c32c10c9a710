#include "Incoming.h"

#include <poll.h>

#include <algorithm>

#include "Log.h"

namespace tether {
namespace {

using namespace std::chrono_literals;

constexpr std::size_t kMostMemory = std::size_t{64} << 20;
// What a pipe may hold when its writer has ended, as messages.
constexpr std::size_t kMostBehindTheEnd = std::size_t{16} << 20;
// Others may write to the pipe for ever.
constexpr auto kLongestEnd = 1s;

bool hasBytes(int pipe) {
  pollfd readable{pipe, POLLIN, 0};
  return poll(&readable, 1, 0) == 1 && (readable.revents & POLLIN) != 0;
}

bool isReply(const Message& message) { return message.name == kMessageOk || message.name == kMessageError; }

}  // namespace

Incoming::Incoming(Descriptor pipe, std::shared_ptr<Wakeup> wakeup, std::function<void(const Message&)> seen)
    : _wakeup(std::move(wakeup)), _seen(std::move(seen)) {
  _thread =
      platform::Thread::make([this, owned = std::make_shared<Descriptor>(std::move(pipe))] { read(owned->release()); });
  _thread->start();
}

Incoming::~Incoming() {
  {
    const platform::Guard guard(_lock);
    _stops = true;
  }
  _changed.notifyAll();
  _thread->cancel();
  _thread->join();
}

void Incoming::processEnded() {
  {
    const platform::Guard guard(_lock);
    _processEnded = true;
  }
  _changed.notifyAll();
  _thread->runLoop()->wakeUp();
}

void Incoming::read(int pipe) {
  KtRCMessageAccumulator reader(std::make_shared<platform::FileHandle>(pipe));
  auto& center = platform::NotificationCenter::defaultCenter();
  const auto available = center.addObserver(std::string(kMessageIsAvailable), &reader, [&](const auto&) {
    while (auto received = reader.getNextMessage()) keep(messageFrom(std::move(received)));
  });
  const auto ended = center.addObserver(std::string(kReadHandleIsFinished), &reader, [this](const auto&) { finish(); });
  auto until = Clock::time_point::max();
  for (;;) {
    {
      const platform::Guard guard(_lock);
      if (_stops || _finished) return;
      if (_processEnded) until = std::min(until, Clock::now() + kLongestEnd);
    }
    if (until != Clock::time_point::max() && (!hasBytes(pipe) || Clock::now() >= until)) return finish();
    platform::RunLoop::current()->runOnce(until);
  }
}

void Incoming::keep(Message message) {
  const std::size_t memory = memoryOf(message);
  const bool fits = memory <= kMostMemory;
  if (!fits) platform::log("Dropped a message that takes %zu bytes of memory", memory);
  {
    const platform::Guard guard(_lock);
    _heard = Clock::now();
    if (!fits) return;
    const bool beat = message.id == 0 && message.name == kMessageHeartbeat;
    _beatOnce = _beatOnce || beat;
    // Heartbeats that nobody takes say no more than the last of them.
    if (beat && !_messages.empty() && _messages.back().name == kMessageHeartbeat && _messages.back().id == 0) return;
    _full = true;
    while (!_stops && !_processEnded && _memory + memory > kMostMemory) _changed.wait(_lock);
    _full = false;
    _heard = Clock::now();
    if (_stops || _memory + memory > kMostMemory + kMostBehindTheEnd) return;
  }
  if (_seen) _seen(message);
  {
    const platform::Guard guard(_lock);
    _memory += memory;
    _messages.push_back(std::move(message));
  }
  _wakeup->ring();
}

void Incoming::finish() {
  {
    const platform::Guard guard(_lock);
    _finished = true;
  }
  _changed.notifyAll();
  _wakeup->ring();
}

bool Incoming::finished() const {
  const platform::Guard guard(_lock);
  return _finished;
}

bool Incoming::waitUntilFinished(Clock::time_point until) const {
  const platform::Guard guard(_lock);
  while (!_finished && _changed.waitUntil(_lock, until)) continue;
  return _finished;
}

bool Incoming::empty() const {
  const platform::Guard guard(_lock);
  return _messages.empty();
}

std::optional<Message> Incoming::take() {
  const platform::Guard guard(_lock);
  if (_messages.empty()) return {};
  Message message = std::move(_messages.front());
  _messages.pop_front();
  _memory -= memoryOf(message);
  _changed.notifyAll();
  return message;
}

std::optional<Message> Incoming::takeReply(std::int32_t first, std::int32_t last, std::size_t& passed) {
  const platform::Guard guard(_lock);
  for (; passed < _messages.size(); ++passed) {
    const Message& message = _messages[passed];
    if (message.id < first || message.id > last || !isReply(message)) continue;
    Message reply = std::move(_messages[passed]);
    _messages.erase(_messages.begin() + static_cast<std::ptrdiff_t>(passed));
    _memory -= memoryOf(reply);
    _changed.notifyAll();
    return reply;
  }
  return {};
}

bool Incoming::beatOnce() const {
  const platform::Guard guard(_lock);
  return _beatOnce;
}

Clock::time_point Incoming::heard() const {
  const platform::Guard guard(_lock);
  return _full ? Clock::now() : _heard;
}

}  // namespace tether
