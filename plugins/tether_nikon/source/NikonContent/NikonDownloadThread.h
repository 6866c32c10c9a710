// The download thread: takes captured pictures off their cameras, one at a time and in order, and deletes cameras that
// are gone.
#pragma once

#include <condition_variable>
#include <deque>
#include <memory>
#include <mutex>

#include "Locks.h"
#include "RunLoop.h"
#include "Thread.h"

class CCamera;
class CContentContainer;

// Owns a queued item until the item goes: deleted by anyone, it clears its wrapper first.
class ContentContainerWrapper {
 public:
  static std::shared_ptr<ContentContainerWrapper> wrapperForContentContainer(CContentContainer* item);
  explicit ContentContainerWrapper(CContentContainer* item);
  ContentContainerWrapper(const ContentContainerWrapper&) = delete;
  ContentContainerWrapper& operator=(const ContentContainerWrapper&) = delete;
  // Deletes the item that it still holds.
  ~ContentContainerWrapper();

  CContentContainer* contentContainer() const;
  // Forgets the item without deleting it.
  void clearContentContainer();
  // The item goes: its wrapper, if it has one, forgets it.
  static void clearWrapperOf(const CContentContainer& item);

 private:
  CContentContainer* _contentContainer;
};

// Owns a camera that is to be deleted.
class CameraWrapper {
 public:
  static std::shared_ptr<CameraWrapper> wrapperForCamera(CCamera* camera);
  explicit CameraWrapper(CCamera* camera) : _camera(camera) {}
  CameraWrapper(const CameraWrapper&) = delete;
  CameraWrapper& operator=(const CameraWrapper&) = delete;
  ~CameraWrapper();

  CCamera* camera() const { return _camera; }
  void setCamera(CCamera* camera) { _camera = camera; }

 private:
  CCamera* _camera;
};

class NikonDownloadThread {
 public:
  NikonDownloadThread();

  // The body of the thread; returns half a second at the latest after the thread was cancelled. A transfer in progress
  // ends first, items still queued are not transferred.
  void threadMain();
  // The thread that runs threadMain; waits for it to start. Any thread.
  std::shared_ptr<platform::Thread> homeThread();

  // On the thread itself.
  void addToDownloadQueue(std::shared_ptr<ContentContainerWrapper> wrapper);
  void removeAllCameraContent(CameraWrapper& wrapper);

 private:
  void timerTask(platform::Timer& timer);
  void processNextTask();

  std::deque<std::shared_ptr<ContentContainerWrapper>> _downloadTaskQueue;
  platform::RecursiveTimedLock& _asyncLock;
  std::mutex _homeLock;
  std::condition_variable _homeKnown;
  std::shared_ptr<platform::Thread> _homeThread;
};
