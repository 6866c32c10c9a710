#include "Session.h"

#include <poll.h>
#include <pthread.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <filesystem>

namespace tether {
namespace {

using namespace std::chrono_literals;

constexpr const char* kState = "TETHER_STATE";
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

std::string absolute(const std::string& path) {
  std::error_code ignored;
  return path.empty() ? path : std::filesystem::absolute(path, ignored).string();
}

// Where camera modules remember which pictures they have delivered. Nothing where there is no place for it.
std::string stateFolder() {
  const char* const states = std::getenv("XDG_STATE_HOME");
  const char* const home = std::getenv("HOME");
  std::string folder;
  if (states != nullptr && *states == '/') {
    folder = states;
  } else if (home != nullptr && *home == '/') {
    folder = std::string(home) + "/.local/state";
  }
  if (folder.empty()) return folder;
  std::error_code error;
  std::filesystem::create_directories(folder += "/tether", error);
  return error ? std::string() : folder;
}

}  // namespace

Session::Session(const Options& options)
    : _silence(options.silence),
      _wakeup(options.wakeup ? options.wakeup : std::make_shared<Wakeup>()),
      _directory(std::make_shared<PrivateDirectory>(absolute(options.folder))) {
  start(options);
}

Session::~Session() { end(kDestructionGrace); }

void Session::start(const Options& options) {
  Pipe toHelper = Pipe::make();
  Pipe fromHelper = Pipe::make();
  Pipe logOfHelper = Pipe::make();
  // The readers are complete before there is a helper: they cannot miss its end.
  _incoming =
      std::make_unique<Incoming>(std::move(fromHelper.read), _wakeup, [directory = _directory](const Message& message) {
        if (message.name != kMessageObjectWasAdded && message.name != kMessageFileDownloadComplete) return;
        const Event event = eventFrom(message);
        if (const auto* const object = std::get_if<ObjectWasAdded>(&event)) directory->noteAnnounced(*object);
        if (const auto* const complete = std::get_if<FileDownloadComplete>(&event)) directory->noteComplete(*complete);
      });
  const int target = options.errorDescriptor < 0 ? STDERR_FILENO : options.errorDescriptor;
  _log = std::make_unique<HelperLog>(std::move(logOfHelper.read), target, _wakeup);

  HelperProcess::Start child;
  child.executable = options.helper.empty() ? helperBesideExecutable() : options.helper;
  child.environment = options.environment;
  if (std::getenv(kState) == nullptr) {
    // Of two of a name the first counts.
    if (const std::string folder = stateFolder(); !folder.empty()) {
      child.environment.push_back(std::string(kState) + "=" + folder);
    }
  }
  child.environment.push_back("TMPDIR=" + _directory->path());
  child.input = toHelper.read.get();
  child.output = fromHelper.write.get();
  child.error = logOfHelper.write.get();
  // It may write there for a moment after this process is gone.
  child.inherited = _directory->descriptor();
  child.ended = [this] {
    _log->processEnded();
    _incoming->processEnded();
  };
  _process = std::make_unique<HelperProcess>(child);
  _input = std::move(toHelper.write);
  setNonBlocking(_input.get());
}

std::optional<Message> Session::nextMessage(Clock::time_point until) {
  if (!waitFor(until, [this] { return !_incoming->empty() || _wakeup->takeNudge(); })) return {};
  return _incoming->take();
}

std::optional<Event> Session::nextEvent(Clock::time_point until) {
  waitFor(until, [this] { return !_log->empty() || !_incoming->empty() || _wakeup->takeNudge(); });
  if (const auto line = _log->take()) return *line;
  if (const auto message = _incoming->take()) return eventFrom(*message);
  if (_lost) return *_lost;
  return {};
}

// Waits until `done`. False when the time is over, the wait was interrupted, or the helper is lost and so nothing more
// will come.
bool Session::waitFor(Clock::time_point until, const Done& done) {
  for (;;) {
    const bool finished = _incoming->finished();
    if (done()) return true;
    if (_lost) return false;
    if (finished) {
      lose(HelperLost::How::kEnded);
      continue;
    }
    if (_wakeup->interrupted() || Clock::now() >= until) return false;
    const Clock::time_point silent = std::max(_incoming->heard(), _notSilentBefore) + _silence;
    if (isSilent(silent)) {
      lose(HelperLost::How::kSilent);
      continue;
    }
    _wakeup->waitUntil(std::min(until, silent));
  }
}

// A process that was stopped, or a machine that slept, finds the time gone without the helper having had it.
bool Session::isSilent(Clock::time_point expected) {
  const auto late = Clock::now() - expected;
  if (late < 0s) return false;
  const bool heardMeanwhile = _incoming->heard() + _silence > expected;
  if (!heardMeanwhile && late < kAsleep) return true;
  _notSilentBefore = Clock::now() - _silence + kAsleep;
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

// What a process wrote before its end may still be in the pipes.
void Session::readToTheEnd() {
  const auto until = Clock::now() + kEndStep;
  _log->waitUntilFinished(until);
  _incoming->waitUntilFinished(until);
}

int Session::end(std::chrono::milliseconds grace) {
  std::optional<int> status = _process->waitUntil(Clock::now());
  if (!status && _input && !_lost) {
    const auto until = Clock::now() + grace;
    if (writeAll(encodeFrame(0, kMessageShutdown, nullptr), until)) status = _process->waitUntil(until);
  }
  _input.reset();
  if (!status) status = _process->waitUntil(Clock::now() + kEndStep);
  if (!status) status = _process->stop(kEndStep);

  readToTheEnd();
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
