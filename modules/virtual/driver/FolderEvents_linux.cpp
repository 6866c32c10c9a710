#include <sys/inotify.h>
#include <unistd.h>

#include <cstddef>
#include <map>
#include <utility>

#include "FolderEvents.h"
#include "Mutex.h"

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
  explicit Inotify(int descriptor) : _descriptor(descriptor) {}
  ~Inotify() override { close(_descriptor); }

  int watch(const std::string& path) override {
    uint32_t wanted = IN_ONLYDIR;
    for (const auto& [bit, what] : kMeanings) wanted |= bit;
    const camerakit::Guard guard(_mutex);
    const int watch = inotify_add_watch(_descriptor, path.c_str(), wanted);
    // A folder that is watched under another name has the same number: its events are the other's.
    return watch >= 0 && _happened.try_emplace(watch).second ? watch : -1;
  }

  void unwatch(int watch) override {
    if (watch < 0) return;
    const camerakit::Guard guard(_mutex);
    _happened.erase(watch);
    inotify_rm_watch(_descriptor, watch);
  }

  std::optional<std::vector<FolderEvent>> take(int watch) override {
    const camerakit::Guard guard(_mutex);
    readEvents();
    const auto found = _happened.find(watch);
    if (found == _happened.end()) return std::nullopt;
    return std::exchange(found->second, {});
  }

 private:
  void readEvents() KIT_REQUIRES(_mutex) {
    alignas(inotify_event) char bytes[kReadBytes];
    for (ssize_t got = kReadBytes; got + kLongestEvent > kReadBytes;) {
      got = read(_descriptor, bytes, sizeof bytes);
      if (got <= 0) return;
      for (ssize_t at = 0; at < got;) {
        const auto* const event = reinterpret_cast<const inotify_event*>(bytes + at);
        note(*event, event->len > 0 ? event->name : "");
        at += static_cast<ssize_t>(sizeof *event + event->len);
      }
    }
  }

  void note(const inotify_event& event, const char* name) KIT_REQUIRES(_mutex) {
    if (event.mask & IN_Q_OVERFLOW) return _happened.clear();
    const auto found = _happened.find(event.wd);
    if (found == _happened.end()) return;
    if (event.mask & IN_IGNORED) {
      _happened.erase(found);
      return;
    }
    for (const auto& [bit, what] : kMeanings)
      if (event.mask & bit) found->second.push_back({what, name});
  }

  const int _descriptor;
  camerakit::Mutex _mutex;
  // By the number of the watch.
  std::map<int, std::vector<FolderEvent>> _happened KIT_GUARDED_BY(_mutex);
};

}  // namespace

std::unique_ptr<FolderEvents> systemFolderEvents() {
  const int descriptor = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  if (descriptor < 0) return std::make_unique<FolderEvents>();
  return std::make_unique<Inotify>(descriptor);
}

}  // namespace virtualcamera
