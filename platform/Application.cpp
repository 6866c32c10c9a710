#include "Application.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <exception>
#include <mutex>

#include "FileHandle.h"
#include "Log.h"
#include "NotificationCenter.h"
#include "RunLoop.h"

#if defined(__SANITIZE_ADDRESS__)
#include <sanitizer/lsan_interface.h>
#endif

namespace platform {
namespace {

using namespace std::chrono_literals;

constexpr auto kLastWriteWait = 1s;

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

DescriptorWatch watchSignals() {
  std::array<int, 2> ends{};
  if (pipe(ends.data()) != 0) return {};
  for (const int descriptor : ends) {
    fcntl(descriptor, F_SETFD, FD_CLOEXEC);
    fcntl(descriptor, F_SETFL, fcntl(descriptor, F_GETFL) | O_NONBLOCK);
  }
  signalWrite = ends[1];
  struct sigaction action {};
  action.sa_handler = noteSignal;
  action.sa_flags = SA_RESTART;
  sigaction(SIGTERM, &action, nullptr);
  sigaction(SIGINT, &action, nullptr);
  return DescriptorWatch(ends[0], [] { Application::shared().terminate(); });
}

}  // namespace

Application& Application::shared() {
  static Application application;
  return application;
}

void Application::terminate() {
  NotificationCenter::defaultCenter().post({kApplicationWillTerminateNotification, this, nullptr});
  const std::unique_lock lastWrite(FileHandle::standardOutput()->writeLock(), kLastWriteWait);
#if defined(__SANITIZE_ADDRESS__)
  __lsan_do_leak_check();
#endif
  _exit(0);
}

int applicationMain(int /*argc*/, char** /*argv*/, const std::function<std::shared_ptr<void>()>& load) {
  fillStandardDescriptors();
  std::signal(SIGPIPE, SIG_IGN);
  const DescriptorWatch signals = watchSignals();
  std::shared_ptr<void> mainInterface;
  try {
    mainInterface = load();
  } catch (const std::exception& exception) {
    log("The application could not start: %s", exception.what());
    return EXIT_FAILURE;
  }
  RunLoop::current()->run();
  return EXIT_SUCCESS;
}

}  // namespace platform
