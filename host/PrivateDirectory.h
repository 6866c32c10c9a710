// A fresh directory under the system's temporary directory that only this user can enter: where one helper leaves its
// pictures, so that nothing collides with another's.
//
// It is locked for as long as its owner lives, and holds a record of what the helper says. So the directory of an owner
// that was killed can be told from others, and what was whole in it from what was not. An end in order removes the
// record: what stays then has been told of and is the user's.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Descriptors.h"
#include "Messages.h"

namespace tether {

class PrivateDirectory {
 public:
  // Makes it. Its pictures are meant for `folder`, an absolute path, or "" where that is not known. Throws
  // std::system_error when that cannot be done.
  explicit PrivateDirectory(const std::string& folder = "");
  PrivateDirectory(const PrivateDirectory&) = delete;
  PrivateDirectory& operator=(const PrivateDirectory&) = delete;
  // As tidy().
  ~PrivateDirectory();

  const std::string& path() const { return _path; }
  // The directory, open and locked. A child that inherits it keeps it locked too: as long as it may write there.
  int descriptor() const { return _directory.get(); }

  // Whether a path leads to something of the helper's directly in it.
  bool holds(const std::string& path) const;
  // Adds to the record. Any thread.
  void noteAnnounced(const ObjectWasAdded& object) const;
  void noteComplete(const FileDownloadComplete& complete) const;
  // `file` is about to be moved out of it.
  void noteMove(const std::string& file) const;

  // Removes empty files and the record, and the directory if nothing else is in it. Returns the paths of what stays.
  // Nobody may be about to take something out of it.
  std::vector<std::string> tidy() const;

 private:
  std::string _path;
  Descriptor _directory;
  Descriptor _record;
};

// The directory of an owner that was killed; while this lives nobody else takes it.
class AbandonedDirectory {
 public:
  struct File {
    std::string path;
    std::string name;             // as announced, else the file's
    std::int32_t capture_id = 0;  // 0: never announced, as far as is known
    bool has_sidecar = false;
    bool complete = false;             // the helper said so
    bool moving = false;               // a move of it had begun
    std::optional<std::int64_t> size;  // in bytes, as announced
  };

  // Takes over what is at `path`. Waits up to 3 seconds for a helper that still ends there. Null when it is none of
  // ours, or someone who lives has it.
  static std::unique_ptr<AbandonedDirectory> take(const std::string& path);

  // Where the pictures were meant to go; "" where that is not known.
  const std::string& folder() const { return _folder; }
  // What is in it besides the record, in the order of announcement.
  const std::vector<File>& files() const { return _files; }
  // As PrivateDirectory::noteMove().
  void noteMove(const std::string& file) const;
  // Removes the record: nobody will take what stays for left behind. And the directory if it is empty.
  void settle() const;

 private:
  AbandonedDirectory() = default;
  void read();

  std::string _path;
  Descriptor _directory;
  Descriptor _record;
  std::string _folder;
  std::vector<File> _files;
};

// The directories of this user's that an owner may have left, by name; take() tells.
std::vector<std::string> possiblyAbandonedDirectories();

}  // namespace tether
