#include "NotificationCenter.h"

#include <algorithm>
#include <array>

namespace platform {
namespace {

// Of one notification: for no more than these, posting takes no memory.
constexpr std::size_t kUsualObservers = 2;

}  // namespace

struct Observer::Entry {
  Entry(NotificationCenter& by, std::string wanted, const void* of, std::function<void(const Notification&)> handle)
      : center(by), name(std::move(wanted)), object(of), handler(std::move(handle)) {}

  NotificationCenter& center;
  const std::string name;
  const void* const object;
  const std::function<void(const Notification&)> handler;
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
  entry->center.forget(entry);
  const Guard guard(entry->lock);
  entry->removed = true;
}

NotificationCenter& NotificationCenter::defaultCenter() {
  static NotificationCenter* const center = new NotificationCenter;
  return *center;
}

NotificationCenter& NotificationCenter::workspaceCenter() {
  static NotificationCenter* const center = new NotificationCenter;
  return *center;
}

Observer NotificationCenter::addObserver(std::string name, const void* object,
                                         std::function<void(const Notification&)> handler) {
  auto entry = std::make_shared<Observer::Entry>(*this, std::move(name), object, std::move(handler));
  const Guard guard(_lock);
  _entries.push_back(entry);
  return Observer(std::move(entry));
}

void NotificationCenter::forget(const std::shared_ptr<Observer::Entry>& entry) {
  const Guard guard(_lock);
  _entries.erase(std::remove(_entries.begin(), _entries.end(), entry), _entries.end());
}

void NotificationCenter::post(const Notification& notification) {
  std::array<std::shared_ptr<Observer::Entry>, kUsualObservers> addressed;
  std::vector<std::shared_ptr<Observer::Entry>> more;
  std::size_t count = 0;
  {
    const Guard guard(_lock);
    for (const auto& entry : _entries) {
      if (entry->object != nullptr && entry->object != notification.object) continue;
      if (!entry->name.empty() && entry->name != notification.name) continue;
      if (count < addressed.size()) {
        addressed[count++] = entry;
      } else {
        more.push_back(entry);
      }
    }
  }
  const auto deliver = [&](Observer::Entry& entry) {
    const Guard guard(entry.lock);
    if (!entry.removed) entry.handler(notification);
  };
  for (std::size_t index = 0; index < count; ++index) deliver(*addressed[index]);
  for (const auto& entry : more) deliver(*entry);
}

}  // namespace platform
