// One captured picture on a camera: the SDK's item, with its image data object.
#pragma once

#include <string>

#include "ContentData.h"

// Who holds an item, and is told when it goes.
class ItemHolder {
 public:
  ItemHolder(const ItemHolder&) = delete;
  ItemHolder& operator=(const ItemHolder&) = delete;

 protected:
  ItemHolder() = default;
  virtual ~ItemHolder() = default;

 private:
  friend class CContentContainer;
  virtual void forgetItem() = 0;  // with the lock of the holders held
};

class CContentContainer : public ContentDataOwner {
 public:
  // Opens the item and its image data object. Throws the SDK's result when the item cannot be opened; without a data
  // object it stays usable. The items of a pair get the same download id.
  CContentContainer(CNikonObject* camera, std::int32_t itemId, std::int32_t downloadId);
  // The item must not be in use. Whoever still holds it lets go of it.
  ~CContentContainer() override;

  void completionCallback_thread(std::int32_t command, std::int32_t result, void* context) override;

  // Transfers the picture and returns when that has ended, well or not. -1 when there is no data object to be had. On
  // the download thread, with the SDK access lock held.
  std::int32_t beginDownload();
  // The data object has come to its end: closes the item.
  void contentFinishedDownloading(CContentData* data) override;
  // Whether the picture is one file of a RAW and JPEG pair.
  bool isRawPlusJPEG() const;
  // Gives the item another download id, before it is queued.
  void setDownloadId(std::int32_t downloadId);
  // For the description, before the item is queued.
  void setCameraName(const std::string& name) { _cameraName = name; }
  std::string description() const override;

  // Guards what items and their holders know of each other. The innermost lock: nothing else is taken under it.
  static platform::Mutex& holderLock();
  // Null for none.
  void setHolder(ItemHolder* holder) REQUIRES(holderLock()) { _holder = holder; }

 private:
  void init(std::int32_t downloadId);
  std::int32_t openDataType(std::int32_t dataType);

  std::int32_t _dataTypes = 0;
  std::string _name;  // items have none
  std::string _cameraName;
  CContentData* _dataObject = nullptr;  // a child, which goes with the item
  std::int32_t _downloadId = 0;
  ItemHolder* _holder GUARDED_BY(holderLock()) = nullptr;
};
