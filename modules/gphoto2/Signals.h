// Signals are for the helper's threads: one in the middle of a call would be an error of the camera's for the library.
#pragma once

#include <csignal>
#include <initializer_list>

namespace gphoto2camera {

// On the calling thread. Those that tell of a crash come all the same.
inline void blockSignals() {
  sigset_t signals;
  sigfillset(&signals);
  for (const int crash : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT}) sigdelset(&signals, crash);
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
}

}  // namespace gphoto2camera
