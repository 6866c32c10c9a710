// Picture files in a folder: which are there, which have arrived whole, which belong together.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "Picture.h"

namespace virtualcamera {

struct timespec modificationTime(const struct stat& status);
bool sameTime(const struct timespec& a, const struct timespec& b);

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
  explicit FolderWatch(std::string path) : path_(std::move(path)) {}

  bool changed();
  // The entries could not be read this time: the next look finds them changed again.
  void retry() { settled_ = false; }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
  struct timespec last_ {};
  bool exists_ = false;
  bool settled_ = false;
};

struct FolderEntry {
  std::string name;
  ino_t inode;
};
// In the order of their names, without hidden ones; none where there is no such folder. Nothing where it cannot be read
// at the moment.
std::optional<std::vector<FolderEntry>> entriesOf(const std::string& path);

// A camera's folder. A file is taken once, by its name and inode, and when it is there whole: its time stamp is more
// than a second old (it was there before, or was written elsewhere and moved here), or its size and time stamp have
// been the same for 100 ms. Programs that pause longer while they write do so under a hidden name. An empty file is
// not there yet. One thread at a time.
class PictureFolder {
 public:
  using Clock = std::chrono::steady_clock;

  explicit PictureFolder(std::string path) : watch_(std::move(path)) {}

  // What has been shot since the last look: files in the order of their names, a RAW and a JPEG of one base name
  // together. A file waits for a partner that is there but not whole yet; when pairs are expected it waits a second
  // for one to come at all.
  std::vector<Shot> look(const FileTypes& types, bool pairsExpected);

 private:
  struct File {
    ino_t inode = 0;
    uint32_t type = 0;
    enum { Arriving, Whole, Taken } state = Arriving;
    off_t size = -1;
    struct timespec modified {};
    Clock::time_point since{};  // of the size and time stamp, then of being whole
  };
  using Files = std::map<std::string, File>;

  void list(const FileTypes& types);
  void watchArrival(const std::string& name, File& file) const;
  Files::iterator partnerOf(const std::string& name, const File& file);
  bool takes(const File& file, Files::iterator partner, bool pairsExpected) const;
  Picture picture(Files::iterator file) const;

  FolderWatch watch_;
  Files files_;
  size_t untaken_ = 0;
};

// What the shutter takes next: the pictures in a folder, each once, in the order of their names. The files have to be
// whole when the shutter is fired. One thread at a time.
class Roll {
 public:
  explicit Roll(std::string path) : path_(std::move(path)) {}
  Shot next(const FileTypes& types);  // empty when nothing is left

 private:
  std::string path_;
  std::set<std::pair<std::string, ino_t>> taken_;
};

}  // namespace virtualcamera
