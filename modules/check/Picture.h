// A picture: its item, and the data object that delivers its bytes.
#pragma once

#include <memory>

#include "Object.h"

namespace modulecheck {

class Item;

class Data : public Object {
 public:
  explicit Data(Item& item);

  // What is read before the transfer. After open().
  void examine();
  // One half of a RAW and JPEG pair.
  bool isHalf() const { return _isHalf; }
  // Transfers the picture and closes data object and item. On the thread for transfers.
  void transfer();

 protected:
  void onDelivery(const tagNkMAIDFileInfo& info, const uint8_t* bytes) override;
  void onCompletion(uint32_t capability, int32_t result) override;

 private:
  void checkFirst(const tagNkMAIDFileInfo& info) REQUIRES(_lock);
  void checkPlace(const tagNkMAIDFileInfo& info) REQUIRES(_lock);
  void checkWhole(const Outcome& outcome);

  Item& _item;
  std::optional<uint32_t> _storedBytes;
  bool _isHalf = false;
  bool _isTransferred = false;

  platform::Mutex _lock;  // deliveries come on any thread
  uint32_t _count GUARDED_BY(_lock) = 0;
  uint32_t _total GUARDED_BY(_lock) = 0;
  uint64_t _received GUARDED_BY(_lock) = 0;
  bool _isWhole GUARDED_BY(_lock) = false;
  std::atomic<uint32_t> _sum{0};
};

class Item : public Object {
 public:
  Item(Object& camera, uint32_t id);

  // Opens it with its data object, as it is done inside the event that announces it. False where there is no picture.
  bool openAll();
  Data* data() const { return _data.get(); }
  bool isHalf() const { return _data && _data->isHalf(); }

 protected:
  std::vector<Object*> below() const override;

 private:
  std::unique_ptr<Data> _data;
};

}  // namespace modulecheck
