#include "Session.h"

#include <poll.h>
#include <pthread.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>

namespace tether {
namespace {

using namespace std::chrono_literals;

constexpr std::size_t kMostMessages = 10'000;
constexpr std::size_t kMostBytes = std::size_t{64} << 20;
// How long each step of an end may take that the helper did not make by itself.
constexpr auto kEndStep = 1s;
constexpr auto kDestructionGrace = 2s;
// A wait that ends this much late was not waited through by a running process.
constexpr auto kAsleep = 2s;

// Writing to a pipe that nobody reads raises SIGPIPE in the writing thread. The process's own handling of it is not
// ours to change, so it is blocked and, when it was raised here, taken away again.
class NoPipeSignal {
 public:
  NoPipeSignal() {
    sigemptyset(&_pipe);
    sigaddset(&_pipe, SIGPIPE);
    _wasPending = isPending();
    pthread_sigmask(SIG_BLOCK, &_pipe, &_before);
  }
  NoPipeSignal(const NoPipeSignal&) = delete;
  NoPipeSignal& operator=(const NoPipeSignal&) = delete;
  ~NoPipeSignal() {
    int number = 0;
    if (!_wasPending && isPending()) sigwait(&_pipe, &number);
    pthread_sigmask(SIG_SETMASK, &_before, nullptr);
  }

 private:
  static bool isPending() {
    sigset_t pending;
    sigemptyset(&pending);
    sigpending(&pending);
    return sigismember(&pending, SIGPIPE) == 1;
  }

  sigset_t _pipe{};
  sigset_t _before{};
  bool _wasPending = false;
};

}  // namespace

Session::Session(const Options& options)
    : _silence(options.silence),
      _wakeup(options.wakeup ? options.wakeup : std::make_shared<Wakeup>()),
      _heard(Clock::now()) {
  start(options);
}

Session::~Session() { end(kDestructionGrace); }

void Session::start(const Options& options) {
  Pipe toHelper = Pipe::make();
  Pipe fromHelper = Pipe::make();
  // The reader is complete before there is a helper: it cannot miss a message, nor the end.
  _reader =
      std::make_unique<KtRCMessageAccumulator>(std::make_shared<platform::FileHandle>(fromHelper.read.release()), true);
  auto& center = platform::NotificationCenter::defaultCenter();
  auto* const reader = _reader.get();
  _available = center.addObserver(std::string(kMessageIsAvailable), reader, [this, reader](const auto&) {
    while (auto received = reader->getNextMessage()) keep(messageFrom(std::move(received)));
  });
  _finished = center.addObserver(std::string(kReadHandleIsFinished), reader, [this](const auto&) { noteEndOfInput(); });

  HelperProcess::Start child;
  child.executable = options.helper.empty() ? helperBesideExecutable() : options.helper;
  child.environment = options.environment;
  child.environment.push_back("TMPDIR=" + _directory.path());
  child.input = toHelper.read.get();
  child.output = fromHelper.write.get();
  child.error = options.errorDescriptor;
  _process = std::make_unique<HelperProcess>(child);
  _input = std::move(toHelper.write);
  setNonBlocking(_input.get());
}

// On the reading thread.
void Session::keep(Message message) {
  std::unique_lock guard(_lock);
  _heard = Clock::now();
  const bool beat = message.id == 0 && message.name == "heartbeat";
  _beatOnce = _beatOnce || beat;
  // Heartbeats that nobody takes say no more than the last of them.
  if (beat && !_messages.empty() && _messages.back().name == "heartbeat" && _messages.back().id == 0) return;
  _room.wait(guard, [this] { return _takesAll || (_messages.size() < kMostMessages && _bytes < kMostBytes); });
  _heard = Clock::now();
  _bytes += message.size;
  _messages.push_back(std::move(message));
  guard.unlock();
  _wakeup->ring();
}

void Session::noteEndOfInput() {
  {
    const std::lock_guard guard(_lock);
    _inputFinished = true;
  }
  _wakeup->ring();
}

std::optional<Message> Session::nextMessage(Clock::time_point until) {
  if (!waitFor(until, [this] { return !_messages.empty(); })) return {};
  const std::lock_guard guard(_lock);
  Message message = std::move(_messages.front());
  _messages.pop_front();
  _bytes -= message.size;
  _room.notify_one();
  return message;
}

std::optional<Event> Session::nextEvent(Clock::time_point until) {
  if (const auto message = nextMessage(until)) return eventFrom(*message);
  if (_lost) return *_lost;
  return {};
}

// Waits until `done`, which is called with the lock held. False when the time is over, the wait was interrupted, or the
// helper is lost and so nothing more will come.
bool Session::waitFor(Clock::time_point until, const Done& done) {
  for (;;) {
    bool finished = false;
    {
      const std::lock_guard guard(_lock);
      if (done()) return true;
      finished = _inputFinished;
    }
    if (_lost) return false;
    if (finished) {
      lose(HelperLost::How::kEnded);
      continue;
    }
    if (_wakeup->interrupted() || Clock::now() >= until) return false;
    const Clock::time_point silent = silentAt();
    if (isSilent(silent)) {
      lose(HelperLost::How::kSilent);
      continue;
    }
    _wakeup->waitUntil(std::min(until, silent));
  }
}

Clock::time_point Session::silentAt() {
  const std::lock_guard guard(_lock);
  return _heard + _silence;
}

// A process that was stopped, or a machine that slept, finds the time gone without the helper having had it.
bool Session::isSilent(Clock::time_point expected) {
  const auto late = Clock::now() - expected;
  if (late < 0s) return false;
  const std::lock_guard guard(_lock);
  const bool heardMeanwhile = _heard + _silence > expected;
  if (!heardMeanwhile && late < kAsleep) return true;
  _heard = std::max(_heard, Clock::now() - _silence + kAsleep);
  return false;
}

void Session::lose(HelperLost::How how) {
  HelperLost lost;
  lost.how = how;
  std::optional<int> status;
  if (how == HelperLost::How::kEnded) status = _process->waitUntil(Clock::now() + kEndStep);
  const bool ended = status.has_value();
  lost.status = ended ? *status : _process->stop(kEndStep);
  if (ended) {
    lost.description = "the helper ended (" + describeStatus(lost.status) + ")";
  } else if (how == HelperLost::How::kEnded) {
    lost.description = "the helper closed its output";
  } else if (how == HelperLost::How::kSilent) {
    lost.description = "the helper has been silent for " + std::to_string(_silence.count() / 1000) + " s";
  } else {
    lost.description = "the helper does not read what is sent to it";
  }
  _input.reset();
  readToTheEnd();
  _lost = std::move(lost);
}

// What a process wrote before its end may still be in the pipe.
void Session::readToTheEnd() {
  const auto finished = [this] {
    const std::lock_guard guard(_lock);
    return _inputFinished;
  };
  takeAll(true);
  for (const auto until = Clock::now() + kEndStep; _reader && !finished() && Clock::now() < until;) {
    _wakeup->waitUntil(until);
  }
}

void Session::takeAll(bool all) {
  {
    const std::lock_guard guard(_lock);
    _takesAll = all;
  }
  _room.notify_one();
}

int Session::end(std::chrono::milliseconds grace) {
  takeAll(true);
  std::optional<int> status = _process->waitUntil(Clock::now());
  if (!status && _input && !_lost) {
    const auto until = Clock::now() + grace;
    if (writeAll(encodeFrame(0, "shutdown", nullptr), until)) status = _process->waitUntil(until);
  }
  _input.reset();
  if (!status) status = _process->waitUntil(Clock::now() + kEndStep);
  if (!status) status = _process->stop(kEndStep);

  readToTheEnd();
  _available.remove();
  _finished.remove();
  _reader.reset();
  if (!_lost)
    _lost = HelperLost{HelperLost::How::kEnded, *status, "the helper ended (" + describeStatus(*status) + ")"};
  return *status;
}

// False when the helper is gone, or does not read in time.
bool Session::writeAll(std::string_view bytes, Clock::time_point until) {
  const NoPipeSignal noSignal;
  while (!bytes.empty()) {
    const ssize_t written = write(_input.get(), bytes.data(), bytes.size());
    if (written >= 0) {
      bytes.remove_prefix(static_cast<std::size_t>(written));
    } else if (errno == EAGAIN || errno == EWOULDBLOCK) {
      const auto left = std::chrono::ceil<std::chrono::milliseconds>(until - Clock::now());
      if (left <= 0ms) return false;
      pollfd ready{_input.get(), POLLOUT, 0};
      poll(&ready, 1, static_cast<int>(left.count()));
    } else if (errno != EINTR) {
      return false;
    }
  }
  return true;
}

}  // namespace tether
