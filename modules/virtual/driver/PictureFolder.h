// Picture files in a folder: which of them are new, which have arrived whole, which belong together.
#pragma once

#include <sys/stat.h>

#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "FileState.h"
#include "FolderEvents.h"
#include "Pictures.h"

namespace virtualcamera {

// What a file with this name is: its file data type, or nothing when it is no picture. Extensions count in any case;
// hidden files are no pictures. The further extensions are in small letters, with their dot.
class FileTypes {
 public:
  std::optional<uint32_t> of(const std::string& name) const;
  std::map<std::string, uint32_t> further{};
};

// Tells cheaply, by one stat, whether the entries of a folder may have changed since it was last asked. A change right
// after another can leave the folder's time stamp as it was, so that it keeps saying yes for a second.
class FolderWatch {
 public:
  explicit FolderWatch(std::string path) : _path(std::move(path)) {}

  bool changed();
  // The entries could not be read this time: the next look finds them changed again.
  void retry() { _exists = false; }
  const std::string& path() const { return _path; }

 private:
  std::string _path;
  int64_t _modified = 0;
  std::chrono::steady_clock::time_point _since{};  // of the time stamp
  bool _exists = false;
};

struct FolderEntry {
  std::string name;
  struct stat status {};  // of what a link leads to
};
// In the order of their names, without hidden ones. Nothing where the folder cannot be opened. It may be moved away
// meanwhile: they are the entries of one folder all the same.
std::optional<std::vector<FolderEntry>> entriesOf(const std::string& path);

// The new pictures of a folder, each handed out once. New is a file that has appeared, or was written to; not a picture
// that was renamed within the folder after its transfer, or touched. While nobody looks, and where the system does not
// tell what happens, a file is known by its name, size and time stamp.
//
// A new file is handed out when it is there whole: when its writer has closed it or it was moved here. Where that was
// not seen it has to be at rest: its time stamp is so old, or has not changed for so long. An empty file is not there
// yet, and what is no regular file never is. One thread at a time.
class PictureFolder {
 public:
  using Clock = std::chrono::steady_clock;
  enum class First { Known, New };  // what is there when it is first looked at

  PictureFolder(std::string path, std::shared_ptr<FolderEvents> events, std::chrono::milliseconds rest, First first)
      : _path(std::move(path)), _events(std::move(events)), _rest(rest), _first(first) {}
  ~PictureFolder() { leave(); }
  PictureFolder(const PictureFolder&) = delete;
  PictureFolder& operator=(const PictureFolder&) = delete;

  void configure(FileTypes types, bool pairsExpected);
  // Where there are no events the folder is listed; not every time, unless it is to be now.
  void look(bool now = false);
  // So many shots at most of what is new and whole, in the order of their names, a RAW and a JPEG of one base name
  // together. A file waits for a partner that is on its way; when pairs are expected it waits a second for one to come
  // at all.
  std::vector<Shot> take(size_t most);
  // Nobody looks for a while. What is known of the files is kept.
  void leave();
  // Whether the folder is away, or has been since it was last left.
  bool wasAway() const { return _away; }

 private:
  struct File {
    FileState seen{};
    enum { Arriving, Whole, Known } state = Arriving;
    // Somebody may have it open; has written to it, or only set its time; has written to it; has closed it.
    enum { Unknown, Suspected, Writes, Done } writer = Unknown;
    Clock::time_point since{};  // it looks like this, then: it is whole
    std::weak_ptr<const PictureSource> handedOut{};
  };
  using Files = std::map<std::string, File>;
  using Gone = std::map<ino_t, File>;  // pictures that may be back under another name

  void list();
  void know(const std::vector<FolderEntry>& entries);
  void apply(const std::vector<FolderEvent>& events);
  void apply(const FolderEvent& event, Gone& gone);
  void forget(Files& files, Files::iterator file, Gone& gone) const;
  static bool wasRenamed(File& file, const Gone& gone);
  static bool see(File& file, const std::optional<FileState>& now);
  bool read(const std::string& name, File& file) const;
  static void becomeWhole(File& file);
  bool rested(const File& file) const;
  void settle();
  Files::iterator partnerOf(const std::string& name, uint32_t type);
  bool takes(const File& file, uint32_t type, Files::iterator partner) const;
  Shot handOut(Files::iterator file, Files::iterator partner);

  std::string _path;
  std::shared_ptr<FolderEvents> _events;
  std::chrono::milliseconds _rest;
  First _first;
  FileTypes _types{};
  bool _pairsExpected = false;
  int _watch = -1;
  ino_t _inode = 0;  // of the folder when it was last looked at, as is its time stamp
  int64_t _modified = 0;
  Clock::time_point _nextListing{};
  bool _away = false;
  bool _listed = false;
  bool _idle = false;  // there is nothing to take or to wait for
  Files _files{};
};

}  // namespace virtualcamera
