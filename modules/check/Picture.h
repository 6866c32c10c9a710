// A picture: its item, and the data object that delivers its bytes.
#pragma once

#include <memory>
#include <mutex>

#include "Object.h"

namespace modulecheck {

class Item;

class Data : public Object {
 public:
  explicit Data(Item& item);

  // What is read before the transfer. After open().
  void examine();
  // One half of a RAW and JPEG pair.
  bool isHalf() const { return isHalf_; }
  // Transfers the picture and closes data object and item. On the thread for transfers.
  void transfer();

 protected:
  void onDelivery(const tagNkMAIDFileInfo& info, const uint8_t* bytes) override;
  void onCompletion(uint32_t capability, int32_t result) override;

 private:
  void checkFirst(const tagNkMAIDFileInfo& info);
  void checkPlace(const tagNkMAIDFileInfo& info);
  void checkWhole(const Outcome& outcome);

  Item& item_;
  std::optional<uint32_t> storedBytes_;
  bool isHalf_ = false;
  bool isTransferred_ = false;

  std::mutex mutex_;  // deliveries come on any thread
  uint32_t count_ = 0;
  uint32_t total_ = 0;
  uint64_t received_ = 0;
  bool isWhole_ = false;
  std::atomic<uint32_t> sum_{0};
};

class Item : public Object {
 public:
  Item(Object& camera, uint32_t id);

  // Opens it with its data object, as it is done inside the event that announces it. False where there is no picture.
  bool openAll();
  Data* data() const { return data_.get(); }
  bool isHalf() const { return data_ && data_->isHalf(); }

 protected:
  std::vector<Object*> below() const override;

 private:
  std::unique_ptr<Data> data_;
};

}  // namespace modulecheck
