#include "NikonDownloadThread.h"

#include <chrono>
#include <utility>

#include "ContentContainer.h"
#include "ContentData.h"
#include "NikonCamera.h"

namespace {

using namespace std::chrono_literals;

constexpr auto kQueueInterval = 0.4s;
constexpr auto kRunLoopSlice = 500ms;
constexpr auto kAccessLockWait = 30s;

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

// Guards what items and wrappers know of each other. The innermost lock: nothing else is taken under it.
std::mutex& linkLock() {
  static auto* const lock = new std::mutex;
  return *lock;
}

}  // namespace

NikonDownloadThread::NikonDownloadThread() : _asyncLock(getAsyncLock()) {}

void NikonDownloadThread::threadMain() {
  platform::Thread::setCurrentName("Nikon Download Thread");
  {
    const std::lock_guard guard(_homeLock);
    _homeThread = platform::Thread::current();
    _homeKnown.notify_all();
  }
  platform::Timer timer;
  timer = platform::Timer::repeating(kQueueInterval, [&] { timerTask(timer); });
  while (!platform::Thread::current()->isCancelled()) {
    platform::RunLoop::current()->runOnce(platform::Clock::now() + kRunLoopSlice);
  }
}

std::shared_ptr<platform::Thread> NikonDownloadThread::homeThread() {
  std::unique_lock guard(_homeLock);
  _homeKnown.wait(guard, [this] { return _homeThread != nullptr; });
  return _homeThread;
}

void NikonDownloadThread::timerTask(platform::Timer& timer) {
  if (platform::Thread::current()->isCancelled()) {
    timer.invalidate();
  } else {
    processNextTask();
    CContentData::giveRestedBufferBack();
  }
}

void NikonDownloadThread::processNextTask() {
  if (_downloadTaskQueue.empty()) return;
  const auto wrapper = std::move(_downloadTaskQueue.front());
  _downloadTaskQueue.pop_front();
  if (wrapper->contentContainer() == nullptr) return;
  const std::unique_lock access(_asyncLock, kAccessLockWait);
  if (!access) return;
  // The item may have gone with its module while the lock was waited for.
  if (CContentContainer* const item = wrapper->contentContainer()) {
    const InUse inUse(*item);
    item->beginDownload();
  }
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

// Wrappers.

std::shared_ptr<ContentContainerWrapper> ContentContainerWrapper::wrapperForContentContainer(CContentContainer* item) {
  return std::make_shared<ContentContainerWrapper>(item);
}

ContentContainerWrapper::ContentContainerWrapper(CContentContainer* item) : _contentContainer(item) {
  const std::lock_guard guard(linkLock());
  if (item != nullptr) item->setWrapper(this);
}

ContentContainerWrapper::~ContentContainerWrapper() {
  // Under the lock of all deletions: the item's camera may be about to delete it too.
  const std::lock_guard deletion(gNikonObjectLock);
  delete contentContainer();
}

CContentContainer* ContentContainerWrapper::contentContainer() const {
  const std::lock_guard guard(linkLock());
  return _contentContainer;
}

void ContentContainerWrapper::clearContentContainer() {
  const std::lock_guard guard(linkLock());
  if (_contentContainer != nullptr) _contentContainer->setWrapper(nullptr);
  _contentContainer = nullptr;
}

void ContentContainerWrapper::clearWrapperOf(const CContentContainer& item) {
  const std::lock_guard guard(linkLock());
  if (item.wrapper() != nullptr) item.wrapper()->_contentContainer = nullptr;
}

std::shared_ptr<CameraWrapper> CameraWrapper::wrapperForCamera(CCamera* camera) {
  return std::make_shared<CameraWrapper>(camera);
}

CameraWrapper::~CameraWrapper() { delete _camera; }
