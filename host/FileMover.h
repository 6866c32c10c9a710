// Takes finished pictures out of the helper's temporary directory into a folder.
//
// Nothing that is in the folder is ever overwritten, and no link in it followed: where a name is taken the file becomes
// "name-2.jpg", "name-3.jpg" and so on. A ".dat" gets the extension that its content says (PictureType.h). A file is
// renamed where that is possible. Into another file system it is copied under a hidden name in the folder, checked for
// its size, given its name, and only then the first copy removed.
//
// Whichever way it goes, its bytes are flushed to the disk before it has its name, and the folder after: what is said
// to be moved outlasts a loss of power. Whatever goes wrong, a flush too, leaves the file where it was and nothing half
// in the folder. Only a process that is killed meanwhile may leave the hidden name there; removeDeadCopies() finds
// those.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "Descriptors.h"

namespace tether {

// What moving asks of the system. Each answers 0 or an error number; write() as the system's, with errno. Tests put
// failures in its place.
class FileCalls {
 public:
  virtual ~FileCalls() = default;
  virtual int renameExclusively(const std::string& from, const std::string& to);
  virtual int link(const std::string& from, const std::string& to);
  virtual ssize_t write(int descriptor, const void* bytes, std::size_t count);
  virtual int flush(int descriptor);
  virtual int remove(const std::string& path);
};

struct MovedFile {
  bool moved = false;
  std::string path;         // where the file is now: the new place, or the old one when it was not moved
  std::string base;         // the name it got, without its extension
  std::int64_t size = 0;    // in bytes, as found on disk
  std::string description;  // what went wrong; of a moved file, that the first copy could not be removed
};

// Removes the hidden copies in a folder whose makers were killed; those of processes that live are left alone. Returns
// the paths of what it removed.
std::vector<std::string> removeDeadCopies(const std::string& folder);

class FileMover {
 public:
  // Files go to `folder`, which must exist by then. `calls` must outlive the mover; null for the system's own. Reads
  // the process's file mode mask, once.
  explicit FileMover(std::string folder, FileCalls* calls = nullptr);
  FileMover(const FileMover&) = delete;
  FileMover& operator=(const FileMover&) = delete;

  // Moves the regular file `source` (a link is refused, and a file of another `size` than the one given) under `name`,
  // of which only what follows the last slash counts. What is refused is left as it is. The first of two files that
  // belong together is given a base that no file in the folder has, whatever its extension
  // (`firstOfPair`); the second is asked for under that base and gets it unless its name has been taken since. Blocks
  // for as long as a copy takes. Never throws for what happens in the file system.
  MovedFile move(const std::string& source, const std::string& name, std::optional<std::int64_t> size = std::nullopt,
                 bool firstOfPair = false, const std::optional<std::string>& base = std::nullopt);

  // Ends a move that was cut off: where the folder has the same bytes already, under a name that move() would give,
  // they are flushed and the first copy is removed. Nothing where there is no such file.
  std::optional<MovedFile> finish(const std::string& source, const std::string& name);

  const std::string& folder() const { return _folder; }

 private:
  struct Name;
  int rename(const Descriptor& file, MovedFile& result, Name& name);
  int copy(const Descriptor& file, MovedFile& result, Name& name);
  int place(const std::string& from, Name& name);
  int placeAs(const std::string& from, const std::string& to);
  int copyBytes(int from, int to, std::int64_t size);
  int flushFolder();
  void flushFoldersAbove();
  std::string pathOf(const Name& name) const;
  MovedFile& removeFirst(MovedFile& moved, const std::string& to);

  std::string _folder;
  FileCalls _system;
  FileCalls* _calls;
  mode_t _mode;
  bool _flushedAbove = false;
};

}  // namespace tether
