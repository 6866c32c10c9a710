// The download thread: takes captured pictures off their cameras, one at a time and in order, and deletes cameras that
// are gone.
#pragma once

#include <deque>
#include <memory>

#include "HomeThread.h"
#include "Locks.h"
#include "RunLoop.h"
#include "Wrappers.h"

class NikonDownloadThread : public HomeThread {
 public:
  NikonDownloadThread();

  // The body of the thread; returns half a second at the latest after the thread was cancelled. A transfer in progress
  // ends first, items still queued are not transferred.
  void threadMain();

  // On the thread itself.
  void addToDownloadQueue(std::shared_ptr<ContentContainerWrapper> wrapper);
  void removeAllCameraContent(CameraWrapper& wrapper);

 private:
  void timerTask(platform::Timer& timer);
  void processNextTask();
  bool takeAccessLock() NO_THREAD_SAFETY_ANALYSIS;  // handed on to a guard

  std::deque<std::shared_ptr<ContentContainerWrapper>> _downloadTaskQueue;
  platform::RecursiveTimedLock& _asyncLock;
};
