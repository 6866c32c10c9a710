#include "NikonDownloadThread.h"

#include <chrono>
#include <utility>

#include "ContentContainer.h"
#include "Log.h"
#include "NikonCamera.h"
#include "PictureFile.h"

namespace {

using namespace std::chrono_literals;

constexpr auto kQueueInterval = 0.4s;
constexpr auto kRunLoopSlice = 500ms;
constexpr auto kAccessLockWait = 30s;
constexpr auto kAccessLockSlice = 20ms;

// An item in use is not deleted.
class InUse {
 public:
  explicit InUse(CContentContainer& item) : _item(item) { _item.setInUse(true); }
  InUse(const InUse&) = delete;
  InUse& operator=(const InUse&) = delete;
  ~InUse() { _item.setInUse(false); }

 private:
  CContentContainer& _item;
};

}  // namespace

NikonDownloadThread::NikonDownloadThread() : _asyncLock(getAsyncLock()) {}

void NikonDownloadThread::threadMain() {
  platform::Thread::setCurrentName("Nikon Download Thread");
  comeHome();
  platform::Timer timer;
  timer = platform::Timer::repeating(kQueueInterval, [&] { timerTask(timer); });
  while (!platform::Thread::current()->isCancelled()) {
    platform::RunLoop::current()->runOnce(platform::Clock::now() + kRunLoopSlice);
  }
}

void NikonDownloadThread::timerTask(platform::Timer& timer) {
  if (platform::Thread::current()->isCancelled()) {
    timer.invalidate();
  } else {
    processNextTask();
    PictureFile::giveRestedBufferBack();
  }
}

void NikonDownloadThread::processNextTask() {
  if (_downloadTaskQueue.empty() || platform::Thread::current()->isCancelled()) return;
  const auto wrapper = std::move(_downloadTaskQueue.front());
  _downloadTaskQueue.pop_front();
  if (wrapper->contentContainer() == nullptr) return;
  if (!takeAccessLock()) {
    platform::log("Dropped %s: the camera modules were busy for 30 seconds", wrapper->description().c_str());
    return;
  }
  const std::unique_lock access(_asyncLock, std::adopt_lock);
  // The item may have gone with its module while the lock was waited for.
  if (CContentContainer* const item = wrapper->contentContainer()) {
    const InUse inUse(*item);
    item->beginDownload();
  }
}

// Whoever holds the lock may be waiting for a callback that is carried here.
bool NikonDownloadThread::takeAccessLock() {
  const auto until = platform::Clock::now() + kAccessLockWait;
  while (!_asyncLock.try_lock_for(kAccessLockSlice)) {
    if (platform::Clock::now() >= until) return false;
    platform::RunLoop::runUrgentCalls();
  }
  return true;
}

void NikonDownloadThread::addToDownloadQueue(std::shared_ptr<ContentContainerWrapper> wrapper) {
  _downloadTaskQueue.push_back(std::move(wrapper));
  processNextTask();
}

void NikonDownloadThread::removeAllCameraContent(CameraWrapper& wrapper) {
  // Items of the camera that are still queued go with it and clear their wrappers, which are skipped later.
  delete wrapper.camera();
  wrapper.setCamera(nullptr);
}
