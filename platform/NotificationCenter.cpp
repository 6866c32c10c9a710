#include "NotificationCenter.h"

#include <algorithm>

namespace platform {

struct Observer::Entry {
  std::string name;
  const void* object;
  std::function<void(const Notification&)> handler;
  RecursiveMutex lock;  // held during a delivery
  bool removed GUARDED_BY(lock) = false;
};

Observer& Observer::operator=(Observer&& other) noexcept {
  if (this != &other) {
    remove();
    _entry = std::move(other._entry);
  }
  return *this;
}

void Observer::remove() {
  if (!_entry) return;
  const auto entry = std::move(_entry);
  const Guard guard(entry->lock);
  entry->removed = true;
}

NotificationCenter& NotificationCenter::defaultCenter() {
  static NotificationCenter* const center = new NotificationCenter;  // outlives every thread
  return *center;
}

NotificationCenter& NotificationCenter::workspaceCenter() {
  static NotificationCenter* const center = new NotificationCenter;
  return *center;
}

Observer NotificationCenter::addObserver(std::string name, const void* object,
                                         std::function<void(const Notification&)> handler) {
  auto entry = std::make_shared<Observer::Entry>();
  entry->name = std::move(name);
  entry->object = object;
  entry->handler = std::move(handler);
  const Guard guard(_lock);
  _entries.erase(std::remove_if(_entries.begin(), _entries.end(), [](const auto& weak) { return weak.expired(); }),
                 _entries.end());
  _entries.push_back(entry);
  return Observer(std::move(entry));
}

void NotificationCenter::post(const Notification& notification) {
  std::vector<std::shared_ptr<Observer::Entry>> addressed;
  {
    const Guard guard(_lock);
    for (const auto& weak : _entries) {
      auto entry = weak.lock();
      if (!entry) continue;
      if (!entry->name.empty() && entry->name != notification.name) continue;
      if (entry->object != nullptr && entry->object != notification.object) continue;
      addressed.push_back(std::move(entry));
    }
  }
  for (const auto& entry : addressed) {
    const Guard guard(entry->lock);
    if (!entry->removed) entry->handler(notification);
  }
}

}  // namespace platform
