// What is handed to the download thread: queued items, and cameras that are to be deleted.
#pragma once

#include <memory>
#include <string>

#include "ContentContainer.h"

class CCamera;

// Owns a queued item until the item goes: deleted by anyone, it clears its wrapper first.
class ContentContainerWrapper : public ItemHolder {
 public:
  static std::shared_ptr<ContentContainerWrapper> wrapperForContentContainer(CContentContainer* item);
  explicit ContentContainerWrapper(CContentContainer* item);
  // Deletes the item that it still holds.
  ~ContentContainerWrapper() override;

  CContentContainer* contentContainer() const;
  // The item's, also when that has gone.
  const std::string& description() const { return _description; }
  // Forgets the item without deleting it.
  void clearContentContainer();

 private:
  void forgetItem() override REQUIRES(CContentContainer::holderLock()) { _contentContainer = nullptr; }

  CContentContainer* _contentContainer GUARDED_BY(CContentContainer::holderLock());
  const std::string _description;
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
