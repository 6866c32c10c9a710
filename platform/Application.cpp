#include "Application.h"

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <exception>
#include <mutex>
#include <system_error>
#include <thread>

#include "FileHandle.h"
#include "Log.h"
#include "NotificationCenter.h"
#include "RunLoop.h"
#include "Thread.h"

#if defined(__SANITIZE_ADDRESS__)
#include <sanitizer/lsan_interface.h>
#endif

namespace platform {
namespace {

using namespace std::chrono_literals;

// Together less than the two seconds within which the process is gone, whatever it was doing.
constexpr auto kMainThreadWait = 1200ms;
constexpr auto kLastWriteWait = 500ms;

int signalWrite = -1;

void noteSignal(int) {
  const int savedErrno = errno;
  const char byte = 0;
  [[maybe_unused]] const ssize_t ignored = write(signalWrite, &byte, 1);
  errno = savedErrno;
}

// A descriptor below 3 that the parent left closed would be taken by the next file opened.
void fillStandardDescriptors() {
  int descriptor = 0;
  do {
    descriptor = open("/dev/null", O_RDWR);
  } while (descriptor >= 0 && descriptor <= STDERR_FILENO);
  if (descriptor > STDERR_FILENO) close(descriptor);
}

// Signals are for the watching thread alone: one that holds the main thread up might hold the signal up with it.
void setSignalMask(int how) {
  sigset_t mask{};
  sigemptyset(&mask);
  for (const int signal : {SIGTERM, SIGINT}) sigaddset(&mask, signal);
  pthread_sigmask(how, &mask, nullptr);
}

// Ends the process when a signal or the end of the standard input asks for it. The main thread, which does so itself
// where it is free to, may be writing to a host that does not read, or be inside a call that does not return.
void watchForTheEnd(int signals, RunLoop& mainLoop) {
  setSignalMask(SIG_UNBLOCK);
  std::array<pollfd, 2> watched{{{signals, POLLIN, 0}, {FileHandle::standardInput()->descriptor(), 0, 0}}};
  const auto wait = [&](std::chrono::milliseconds time) {
    for (pollfd& each : watched) each.revents = 0;
    while (poll(watched.data(), watched.size(), static_cast<int>(time.count())) < 0 && errno == EINTR) {
    }
    return watched[0].revents != 0;
  };
  bool signalled = wait(-1ms);
  watched[1].fd = -1;
  if (!signalled) signalled = wait(kMainThreadWait);
  if (!signalled && Application::shared().ignoresEndOfInput()) signalled = wait(-1ms);
  if (signalled) {
    mainLoop.post([] { Application::shared().terminate(); });
    std::this_thread::sleep_for(kMainThreadWait);
  }
  Application::shared().terminate();
}

void startWatching() {
  std::array<int, 2> ends{};
  if (pipe(ends.data()) != 0) throw std::system_error(errno, std::generic_category(), "signal pipe");
  for (const int descriptor : ends) {
    fcntl(descriptor, F_SETFD, FD_CLOEXEC);
    fcntl(descriptor, F_SETFL, fcntl(descriptor, F_GETFL) | O_NONBLOCK);
  }
  signalWrite = ends[1];
  setSignalMask(SIG_BLOCK);
  struct sigaction action {};
  action.sa_handler = noteSignal;
  action.sa_flags = SA_RESTART;
  sigaction(SIGTERM, &action, nullptr);
  sigaction(SIGINT, &action, nullptr);
  startDetached([signals = ends[0], mainLoop = RunLoop::current()] { watchForTheEnd(signals, *mainLoop); });
}

}  // namespace

Application& Application::shared() {
  static Application application;
  return application;
}

void Application::terminate() {
  NotificationCenter::defaultCenter().post({kApplicationWillTerminateNotification, this, nullptr});
  FileHandle::standardOutput()->finishWriting(kLastWriteWait);
#if defined(__SANITIZE_ADDRESS__)
  __lsan_do_leak_check();
#endif
  _exit(0);
}

int applicationMain(int /*argc*/, char** /*argv*/, const std::function<std::shared_ptr<void>()>& load) {
  fillStandardDescriptors();
  // A reader that is gone and a limit on file sizes are errors of the write.
  for (const int number : {SIGPIPE, SIGXFSZ}) std::signal(number, SIG_IGN);
  std::shared_ptr<void> mainInterface;
  try {
    FileHandle::guardStandardPipes();
    startWatching();
    mainInterface = load();
  } catch (const std::exception& exception) {
    log("The application could not start: %s", exception.what());
    return EXIT_FAILURE;
  }
  RunLoop::current()->run();
  return EXIT_SUCCESS;
}

}  // namespace platform
