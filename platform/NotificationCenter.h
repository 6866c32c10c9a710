// Notifications: a poster tells whoever listens, by name and by the object it concerns. Any thread.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "Data.h"
#include "Locks.h"

namespace platform {

struct Notification {
  std::string_view name;
  const void* object = nullptr;      // whom it concerns
  std::shared_ptr<const Data> data;  // what comes with it, or null
};

// Keeps an observer registered while it lives. Destroying it on another thread waits for a delivery in progress; inside
// its own delivery it does not.
class Observer {
 public:
  Observer() = default;
  Observer(Observer&&) noexcept = default;
  Observer& operator=(Observer&& other) noexcept;
  ~Observer() { remove(); }
  void remove();

 private:
  friend class NotificationCenter;
  struct Entry;
  explicit Observer(std::shared_ptr<Entry> entry) : _entry(std::move(entry)) {}
  std::shared_ptr<Entry> _entry;
};

// Outlives its observers; these two outlive every thread.
class NotificationCenter {
 public:
  static NotificationCenter& defaultCenter();
  // Where the system tells of itself.
  static NotificationCenter& workspaceCenter();

  // An empty name means every notification of the object, a null object every poster.
  [[nodiscard]] Observer addObserver(std::string name, const void* object,
                                     std::function<void(const Notification&)> handler);
  // Runs the handlers before it returns, on the calling thread, in order of registration. A handler added meanwhile
  // hears the next one.
  void post(const Notification& notification);

 private:
  friend class Observer;
  void forget(const std::shared_ptr<Observer::Entry>& entry);

  Mutex _lock;
  std::vector<std::shared_ptr<Observer::Entry>> _entries GUARDED_BY(_lock);
};

// Names.
inline constexpr std::string_view kApplicationWillTerminateNotification = "NSApplicationWillTerminateNotification";
inline constexpr std::string_view kWorkspaceDidWakeNotification = "NSWorkspaceDidWakeNotification";
inline constexpr std::string_view kFileHandleReadCompletionNotification = "NSFileHandleReadCompletionNotification";

}  // namespace platform
