#include "HelperProcess.h"

#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstring>
#include <string_view>
#include <system_error>

#include "Bundle.h"
#include "Descriptors.h"
#include "FileManager.h"

extern char** environ;

namespace tether {
namespace {

using platform::Clock;

// This process's environment, with some of it replaced.
std::vector<std::string> environmentWith(const std::vector<std::string>& additions) {
  const auto nameOf = [](std::string_view entry) { return entry.substr(0, entry.find('=')); };
  std::vector<std::string> all = additions;
  for (char** entry = environ; entry != nullptr && *entry != nullptr; ++entry) {
    bool replaced = false;
    for (const std::string& addition : additions) replaced = replaced || nameOf(addition) == nameOf(*entry);
    if (!replaced) all.emplace_back(*entry);
  }
  return all;
}

std::vector<char*> pointersTo(std::vector<std::string>& texts) {
  std::vector<char*> pointers;
  pointers.reserve(texts.size() + 1);
  for (std::string& text : texts) pointers.push_back(text.data());
  pointers.push_back(nullptr);
  return pointers;
}

class FileActions {
 public:
  explicit FileActions(const HelperProcess::Start& start) {
    posix_spawn_file_actions_init(&_actions);
    // Standard error first: it may come from one of the two that the others take.
    posix_spawn_file_actions_adddup2(&_actions, start.error < 0 ? STDERR_FILENO : start.error, STDERR_FILENO);
    posix_spawn_file_actions_adddup2(&_actions, start.input, STDIN_FILENO);
    posix_spawn_file_actions_adddup2(&_actions, start.output, STDOUT_FILENO);
    // After the others: one of them may have this number here.
    if (start.inherited >= 0) posix_spawn_file_actions_adddup2(&_actions, start.inherited, STDERR_FILENO + 1);
  }
  FileActions(const FileActions&) = delete;
  FileActions& operator=(const FileActions&) = delete;
  ~FileActions() { posix_spawn_file_actions_destroy(&_actions); }
  const posix_spawn_file_actions_t* get() const { return &_actions; }

 private:
  posix_spawn_file_actions_t _actions{};
};

class Attributes {
 public:
  Attributes() {
    posix_spawnattr_init(&_attributes);
    sigset_t signals;
    sigemptyset(&signals);
    posix_spawnattr_setsigmask(&_attributes, &signals);
    for (const int number : {SIGINT, SIGTERM, SIGHUP, SIGPIPE, SIGQUIT}) sigaddset(&signals, number);
    posix_spawnattr_setsigdefault(&_attributes, &signals);
    posix_spawnattr_setpgroup(&_attributes, 0);
    int flags = POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETPGROUP;
#ifdef POSIX_SPAWN_CLOEXEC_DEFAULT
    flags |= POSIX_SPAWN_CLOEXEC_DEFAULT;
#endif
    posix_spawnattr_setflags(&_attributes, static_cast<short>(flags));
  }
  Attributes(const Attributes&) = delete;
  Attributes& operator=(const Attributes&) = delete;
  ~Attributes() { posix_spawnattr_destroy(&_attributes); }
  const posix_spawnattr_t* get() const { return &_attributes; }

 private:
  posix_spawnattr_t _attributes{};
};

}  // namespace

std::string helperBesideExecutable() {
  const std::string executable = platform::executablePath();
  return platform::appendingPathComponent(platform::deletingLastPathComponent(executable),
                                          "TetherHelper.app/Contents/" TETHER_BUNDLE_PLATFORM "/TetherHelper");
}

HelperProcess::HelperProcess(const Start& start) {
  std::vector<std::string> environment = environmentWith(start.environment);
  std::vector<std::string> arguments{start.executable};
  const FileActions actions(start);
  const Attributes attributes;
  int error = 0;
  {
    const platform::Guard guard(spawnLock());
    error = posix_spawn(&_pid, start.executable.c_str(), actions.get(), attributes.get(), pointersTo(arguments).data(),
                        pointersTo(environment).data());
  }
  if (error != 0) throw HelperNotStarted("cannot start " + start.executable + ": " + std::strerror(error));
  try {
    _reaper = std::thread([this, ended = start.ended] { reap(ended); });
  } catch (const std::system_error& noThread) {
    kill(_pid, SIGKILL);
    waitpid(_pid, nullptr, 0);
    throw HelperNotStarted("cannot watch over " + start.executable + ": " + noThread.what());
  }
}

HelperProcess::~HelperProcess() {
  signal(SIGKILL);
  _reaper.join();
}

// The child is collected under the lock: as long as no status is known its number belongs to nobody else.
void HelperProcess::reap(const std::function<void()>& ended) {
  siginfo_t ignored{};
  while (waitid(P_PID, static_cast<id_t>(_pid), &ignored, WEXITED | WNOWAIT) != 0 && errno == EINTR) {
  }
  {
    const platform::Guard guard(_lock);
    int status = 0;
    while (waitpid(_pid, &status, 0) < 0 && errno == EINTR) {
    }
    _status = status;
    _changed.notifyAll();
  }
  if (ended) ended();
}

std::optional<int> HelperProcess::waitUntil(Clock::time_point until) {
  const platform::Guard guard(_lock);
  while (!_status && _changed.waitUntil(_lock, until)) continue;
  return _status;
}

void HelperProcess::signal(int number) {
  const platform::Guard guard(_lock);
  if (!_status) kill(_pid, number);
}

int HelperProcess::stop(std::chrono::milliseconds grace) {
  signal(SIGTERM);
  waitUntil(Clock::now() + grace);
  signal(SIGKILL);
  const platform::Guard guard(_lock);
  while (!_status) _changed.wait(_lock);
  return *_status;
}

std::string describeStatus(int status) {
  if (WIFEXITED(status)) return "exit status " + std::to_string(WEXITSTATUS(status));
  if (WIFSIGNALED(status)) {
    const int number = WTERMSIG(status);
    return "killed by signal " + std::to_string(number) + " (" + strsignal(number) + ")";
  }
  return "wait status " + std::to_string(status);
}

}  // namespace tether
