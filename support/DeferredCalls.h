// Calls put off: a function runs once with its argument after a delay, on the run loop of the thread that asks, and a
// newer request for the same function and argument cancels the older ones. One thread, the main thread here, makes all
// requests and cancellations.
#pragma once

#include <cstddef>
#include <memory>
#include <vector>

// Runs `proc` with `param` not before `delay` seconds have passed, never inside this call. What `param` points to must
// live until then or cancel first.
void CallAfterDelay(void (*proc)(void*), void* param, double delay);

// Seconds since 1 January 2001, 00:00:00 UTC. The clock may be set back.
double currentTime();

class CallDelay {
 public:
  // Cancels what is pending for this function and argument. A cancelled request still wakes up, does nothing and goes.
  static void cancelCallsToProc(void (*proc)(void*), void* param);
  // How many requests, cancelled ones included, have not woken up yet.
  static std::size_t queuedCount() { return queuedDelayedCalls == nullptr ? 0 : queuedDelayedCalls->size(); }

 private:
  friend void CallAfterDelay(void (*proc)(void*), void* param, double delay);

  CallDelay(void (*proc)(void*), void* param) : _proc(proc), _param(param) {}
  static std::shared_ptr<CallDelay> init(void (*proc)(void*), void* param);
  void execute();

  // In order of request. Made with the first request; lives as long as the process.
  static std::vector<std::shared_ptr<CallDelay>>* queuedDelayedCalls;

  void (*_proc)(void*);
  void* _param;
  bool _canceled = false;
};
