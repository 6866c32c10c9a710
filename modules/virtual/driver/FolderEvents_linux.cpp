#include <sys/inotify.h>
#include <unistd.h>

#include <cstddef>
#include <map>
#include <mutex>
#include <utility>

#include "FolderEvents.h"

namespace virtualcamera {
namespace {

constexpr std::size_t kReadBytes = 16384;
constexpr std::size_t kLongestEvent = sizeof(inotify_event) + 256;

constexpr std::pair<uint32_t, FolderEvent::What> kMeanings[] = {
    {IN_CREATE, FolderEvent::Appeared},    {IN_OPEN, FolderEvent::Opened},    {IN_MODIFY, FolderEvent::Changed},
    {IN_CLOSE_WRITE, FolderEvent::Closed}, {IN_ATTRIB, FolderEvent::Touched}, {IN_MOVED_TO, FolderEvent::MovedIn},
    {IN_MOVED_FROM, FolderEvent::Gone},    {IN_DELETE, FolderEvent::Gone},    {IN_MOVE_SELF, FolderEvent::Gone},
};

class Inotify final : public FolderEvents {
 public:
  explicit Inotify(int descriptor) : descriptor_(descriptor) {}
  ~Inotify() override { close(descriptor_); }

  int watch(const std::string& path) override {
    uint32_t wanted = IN_ONLYDIR;
    for (const auto& [bit, what] : kMeanings) wanted |= bit;
    const std::lock_guard lock(mutex_);
    const int watch = inotify_add_watch(descriptor_, path.c_str(), wanted);
    // A folder that is watched under another name has the same number: its events are the other's.
    return watch >= 0 && happened_.try_emplace(watch).second ? watch : -1;
  }

  void unwatch(int watch) override {
    if (watch < 0) return;
    const std::lock_guard lock(mutex_);
    happened_.erase(watch);
    inotify_rm_watch(descriptor_, watch);
  }

  std::optional<std::vector<FolderEvent>> take(int watch) override {
    const std::lock_guard lock(mutex_);
    readEvents();
    const auto found = happened_.find(watch);
    if (found == happened_.end()) return std::nullopt;
    return std::exchange(found->second, {});
  }

 private:
  void readEvents() {
    alignas(inotify_event) char bytes[kReadBytes];
    for (ssize_t got = kReadBytes; got + kLongestEvent > kReadBytes;) {
      got = read(descriptor_, bytes, sizeof bytes);
      if (got <= 0) return;
      for (ssize_t at = 0; at < got;) {
        const auto* const event = reinterpret_cast<const inotify_event*>(bytes + at);
        note(*event, event->len > 0 ? event->name : "");
        at += static_cast<ssize_t>(sizeof *event + event->len);
      }
    }
  }

  void note(const inotify_event& event, const char* name) {
    if (event.mask & IN_Q_OVERFLOW) return happened_.clear();
    const auto found = happened_.find(event.wd);
    if (found == happened_.end()) return;
    if (event.mask & IN_IGNORED) {
      happened_.erase(found);
      return;
    }
    for (const auto& [bit, what] : kMeanings)
      if (event.mask & bit) found->second.push_back({what, name});
  }

  const int descriptor_;
  std::mutex mutex_;
  std::map<int, std::vector<FolderEvent>> happened_;  // by the number of the watch
};

}  // namespace

std::unique_ptr<FolderEvents> systemFolderEvents() {
  const int descriptor = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  if (descriptor < 0) return std::make_unique<FolderEvents>();
  return std::make_unique<Inotify>(descriptor);
}

}  // namespace virtualcamera
