// What happens in folders, as far as the operating system tells.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace virtualcamera {

struct FolderEvent {
  enum What {
    Appeared,  // made, or linked here
    Opened,    // by anybody
    Changed,   // written to, cut, or only given another time stamp
    Closed,    // by somebody who could write to it
    Touched,   // its time stamps, its owner, its permissions
    MovedIn,
    Gone,  // removed, or moved away
  };
  What what;
  std::string name;  // empty: the folder itself
};

// This one tells of nothing: folders have to be listed again and again. Safe to use from any thread.
class FolderEvents {
 public:
  FolderEvents() = default;
  virtual ~FolderEvents() = default;
  FolderEvents(const FolderEvents&) = delete;
  FolderEvents& operator=(const FolderEvents&) = delete;

  // From now on, keeps what happens to the entries of the folder. Answers a number for it, negative where nothing will
  // be told.
  virtual int watch(const std::string& path);
  virtual void unwatch(int watch);
  // What has happened since the last time, oldest first. Nothing where that is not known: the number is negative, some
  // events were lost, or the folder has been removed. It has to be watched anew then, and listed.
  virtual std::optional<std::vector<FolderEvent>> take(int watch);
};

// One that tells, if the system lets us have it.
std::unique_ptr<FolderEvents> systemFolderEvents();

}  // namespace virtualcamera
