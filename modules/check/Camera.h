// Cameras and the module that lists them.
#pragma once

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <vector>

#include "Picture.h"

namespace modulecheck {

class Camera : public Object {
 public:
  // Pictures are opened on the thread that brings their event, and then handed over to be transferred.
  using HandOver = std::function<void(Item& item)>;
  Camera(Object& module, uint32_t id, HandOver handOver);

  // What is asked of a camera that has been found. After open(); false where it does not count as one.
  bool meet();
  // What is done when the host connects it.
  void connect();
  void checkSettings();
  // Asked when the cameras have changed.
  bool isAlive();
  bool canCapture() const { return announces(kNkMAIDCapability_Capture); }
  // Fires the shutter. False where it was refused or failed, which is no fault of the module.
  bool capture();
  uint32_t announced() const { return _announced; }
  // At the end: no half of a pair may be left over.
  void checkPairs();

 protected:
  void onEvent(uint32_t event, uint64_t data) override;
  std::vector<Object*> below() const override;

 private:
  void addItem(uint32_t id);
  void pairUp(const Item& item);

  const HandOver _handOver;
  std::atomic<uint32_t> _announced{0};
  mutable platform::Mutex _lock;
  std::vector<std::unique_ptr<Item>> _items GUARDED_BY(_lock);
  const Item* _half GUARDED_BY(_lock) = nullptr;  // whose other half has not come
};

class Module : public Object {
 public:
  explicit Module(Context& context) : Object(context, nullptr, 0, "module", "module") {}

  void examine();
  // Whether cameras came or went since the last time.
  bool hasNews() { return _hasNews.exchange(false); }
  // The cameras that are listed; those whose ids cannot be a camera's left out.
  std::vector<uint32_t> cameras();
  void add(Object* camera) { _cameras.push_back(camera); }

 protected:
  void onEvent(uint32_t event, uint64_t data) override;
  std::vector<Object*> below() const override { return _cameras; }

 private:
  std::atomic<bool> _hasNews{false};
  std::vector<Object*> _cameras;
};

}  // namespace modulecheck
