// What a process that was killed left behind: pictures in its private directory, hidden copies in a folder. Pictures
// that were whole are brought to the folder they were meant for, the rest is removed; what belongs to a process that
// lives is left alone.
//
// A picture was whole when its helper said so, or when it has the size that was announced; empty files never were. One
// that was never announced, as far as is known, is taken for whole: a helper writes a file in one piece, and without a
// host it ends by itself and leaves none that is not.
#pragma once

#include <deque>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "FileMover.h"
#include "PrivateDirectory.h"

namespace tether {

struct Leftover {
  enum class Fate {
    kSaved,    // is in its folder now
    kRemoved,  // was of no use
    kLeft,     // stays; one that could not be saved is tried again by the next process
  };
  Fate fate = Fate::kLeft;
  std::string found;  // where it lay
  MovedFile file;     // where it is now, and why where there is something to say
};

class Leftovers {
 public:
  // Pictures whose folder is not known, or gone, go to `folder`. `calls` as FileMover has them.
  Leftovers(std::string folder, FileCalls* calls);

  // Deals with the next one; nothing when there are no more. Blocks as moving a file does, and up to 3 seconds for a
  // helper that still ends.
  std::optional<Leftover> next();

 private:
  bool openNext();
  void removeCopies(const std::string& folder);
  Leftover dealWith(const AbandonedDirectory::File& file);
  MovedFile save(const AbandonedDirectory::File& file);

  const std::string _folder;
  FileCalls* _calls;
  std::deque<std::string> _paths;  // of directories still to be looked at
  std::deque<Leftover> _toBeTold;  // done already
  bool _begun = false;

  // Of the directory that is being looked at.
  std::unique_ptr<AbandonedDirectory> _directory;
  std::unique_ptr<FileMover> _mover;
  std::size_t _next = 0;
  std::map<std::string, std::string> _bases;  // of pairs: announced, and given
  bool _settled = true;
};

}  // namespace tether
