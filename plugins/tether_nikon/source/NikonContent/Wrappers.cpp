#include "Wrappers.h"

#include <mutex>

#include "NikonCamera.h"

std::shared_ptr<ContentContainerWrapper> ContentContainerWrapper::wrapperForContentContainer(CContentContainer* item) {
  return std::make_shared<ContentContainerWrapper>(item);
}

ContentContainerWrapper::ContentContainerWrapper(CContentContainer* item)
    : _contentContainer(item), _description(item == nullptr ? "" : item->description()) {
  const platform::Guard guard(CContentContainer::holderLock());
  if (item != nullptr) item->setHolder(this);
}

ContentContainerWrapper::~ContentContainerWrapper() {
  // Under the lock of all deletions: the item's camera may be about to delete it too.
  const std::lock_guard deletion(gNikonObjectLock);
  delete contentContainer();
}

CContentContainer* ContentContainerWrapper::contentContainer() const {
  const platform::Guard guard(CContentContainer::holderLock());
  return _contentContainer;
}

void ContentContainerWrapper::clearContentContainer() {
  const platform::Guard guard(CContentContainer::holderLock());
  if (_contentContainer != nullptr) _contentContainer->setHolder(nullptr);
  _contentContainer = nullptr;
}

std::shared_ptr<CameraWrapper> CameraWrapper::wrapperForCamera(CCamera* camera) {
  return std::make_shared<CameraWrapper>(camera);
}

CameraWrapper::~CameraWrapper() { delete _camera; }
