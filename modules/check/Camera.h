// Cameras and the module that lists them.
#pragma once

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
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
  uint32_t announced() const { return announced_; }
  // At the end: no half of a pair may be left over.
  void checkPairs();

 protected:
  void onEvent(uint32_t event, uint64_t data) override;
  std::vector<Object*> below() const override;

 private:
  void addItem(uint32_t id);
  void pairUp(const Item& item);

  const HandOver handOver_;
  std::atomic<uint32_t> announced_{0};
  mutable std::mutex mutex_;
  std::vector<std::unique_ptr<Item>> items_;
  const Item* half_ = nullptr;  // whose other half has not come
};

class Module : public Object {
 public:
  explicit Module(Context& context) : Object(context, nullptr, 0, "module", "module") {}

  void examine();
  // Whether cameras came or went since the last time.
  bool hasNews() { return hasNews_.exchange(false); }
  // The cameras that are listed; those whose ids cannot be a camera's left out.
  std::vector<uint32_t> cameras();
  void add(Object* camera) { cameras_.push_back(camera); }

 protected:
  void onEvent(uint32_t event, uint64_t data) override;
  std::vector<Object*> below() const override { return cameras_; }

 private:
  std::atomic<bool> hasNews_{false};
  std::vector<Object*> cameras_;
};

}  // namespace modulecheck
