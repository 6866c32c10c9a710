// The requests of a session, and how those are dealt with that the helper may leave unanswered.
#include <algorithm>

#include "Session.h"

namespace tether {
namespace {

using namespace std::chrono_literals;

// A helper that takes nothing for this long takes nothing any more.
constexpr auto kWriteWait = 5s;
// When an unanswered request is sent again, or asked after.
constexpr auto kAskAgain = 1s;
// A camera that takes this long to connect is asked after.
constexpr auto kConnectPatience = 3s;

// Module ids that a helper may have: 256 to 17 times 256.
constexpr std::int32_t kModuleStep = 256;
constexpr std::int32_t kModules = 17;

}  // namespace

std::int32_t Session::send(std::string_view name, const KtLuaTE* payload) {
  const std::int32_t id = _nextId;
  _nextId = _nextId == INT32_MAX ? 1 : _nextId + 1;
  if (_lost || !_input) return id;
  if (!writeAll(encodeFrame(id, name, payload), Clock::now() + kWriteWait)) {
    // A pipe without a reader: the end of its output tells how it ended.
    const bool gone = _process->waitUntil(Clock::now() + kAskAgain).has_value();
    lose(gone ? HelperLost::How::kEnded : HelperLost::How::kNotReading);
  }
  return id;
}

// A reply with an id from `first` to `last`.
Reply Session::awaitReply(std::int32_t first, std::int32_t last, Clock::time_point until) {
  std::optional<Message> message;
  std::size_t passed = 0;
  waitFor(until, [&] {
    message = _incoming->takeReply(first, last, passed);
    return message.has_value();
  });

  Reply reply;
  if (!message) {
    reply.kind = _lost                    ? Reply::Kind::kLost
                 : _wakeup->interrupted() ? Reply::Kind::kInterrupted
                                          : Reply::Kind::kTimeout;
    return reply;
  }
  reply.kind = message->name == kMessageOk ? Reply::Kind::kOk : Reply::Kind::kError;
  reply.payload = std::move(message->payload);
  if (reply.kind == Reply::Kind::kError) {
    reply.errorCode = integerIn(*reply.payload, kKeyErrorCode);
    reply.errorText = textIn(*reply.payload, kKeyErrorDescription);
  }
  return reply;
}

Reply Session::request(std::string_view name, const KtLuaTE* payload, Clock::time_point until) {
  const std::int32_t id = send(name, payload);
  return awaitReply(id, id, until);
}

Reply::Kind Session::awaitListing(Clock::time_point until) {
  send(kMessageListDevices);
  const std::int32_t first = _nextId;
  std::int32_t last = first;
  for (std::int32_t module = 1; module <= kModules; ++module) {
    last = send(kMessageGetCameraSettings, devicePayload(module * kModuleStep).get());
  }
  std::size_t passed = 0;
  if (waitFor(until, [&] { return _incoming->beatOnce() || _incoming->takeReply(first, last, passed); })) {
    return Reply::Kind::kOk;
  }
  if (_lost) return Reply::Kind::kLost;
  return _wakeup->interrupted() ? Reply::Kind::kInterrupted : Reply::Kind::kTimeout;
}

Reply Session::connect(std::int32_t device, Clock::time_point until) {
  const auto payload = devicePayload(device);
  const std::int32_t id = send(kMessageConnectDevice, payload.get());
  auto patience = kConnectPatience;
  for (;;) {
    Reply reply = awaitReply(id, id, std::min(until, Clock::now() + patience));
    if (reply.kind != Reply::Kind::kTimeout || Clock::now() >= until) return reply;
    // Requests are dealt with in order: what this one answers holds after the connecting.
    const std::int32_t asked = send(kMessageGetCameraSettings, payload.get());
    reply = awaitReply(id, asked, std::min(until, Clock::now() + kAskAgain));
    if (reply.kind != Reply::Kind::kTimeout) return reply;
    patience = kAskAgain;
  }
}

Reply Session::settings(std::int32_t device, Clock::time_point until) {
  const auto payload = devicePayload(device);
  const std::int32_t first = _nextId;
  for (;;) {
    const std::int32_t last = send(kMessageGetCameraSettings, payload.get());
    Reply reply = awaitReply(std::min(first, last), last, std::min(until, Clock::now() + kAskAgain));
    if (reply.kind != Reply::Kind::kTimeout || Clock::now() >= until) return reply;
  }
}

}  // namespace tether
