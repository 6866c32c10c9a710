#include "Leftovers.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "FileManager.h"

namespace tether {

Leftovers::Leftovers(std::string folder, FileCalls* calls) : _folder(std::move(folder)), _calls(calls) {}

std::optional<Leftover> Leftovers::next() {
  if (!std::exchange(_begun, true)) {
    for (std::string& path : possiblyAbandonedDirectories()) _paths.push_back(std::move(path));
    removeCopies(_folder);
  }
  for (;;) {
    if (!_toBeTold.empty()) {
      Leftover done = std::move(_toBeTold.front());
      _toBeTold.pop_front();
      return done;
    }
    if (_directory && _next < _directory->files().size()) return dealWith(_directory->files()[_next++]);
    if (_directory && _settled) _directory->settle();
    _directory.reset();
    if (!openNext()) return {};
  }
}

// False when there are no more directories; one of somebody's that lives is passed over.
bool Leftovers::openNext() {
  if (_paths.empty()) return false;
  _directory = AbandonedDirectory::take(_paths.front());
  _paths.pop_front();
  if (!_directory) return true;
  const bool known = platform::FileManager::isDirectory(_directory->folder());
  _mover = std::make_unique<FileMover>(known ? _directory->folder() : _folder, _calls);
  if (known) removeCopies(_directory->folder());
  _next = 0;
  _bases.clear();
  _settled = true;
  return true;
}

void Leftovers::removeCopies(const std::string& folder) {
  for (std::string& path : removeDeadCopies(folder)) {
    Leftover removed{Leftover::Fate::kRemoved, std::move(path), {}};
    removed.file.description = "a copy that was not finished";
    _toBeTold.push_back(std::move(removed));
  }
}

Leftover Leftovers::dealWith(const AbandonedDirectory::File& file) {
  Leftover leftover;
  leftover.found = file.path;
  struct stat status {};
  const bool regular = lstat(file.path.c_str(), &status) == 0 && S_ISREG(status.st_mode);
  const bool otherSize = file.size && *file.size != status.st_size;
  const bool useless = regular && (status.st_size == 0 || (otherSize && !file.complete));
  if (useless) {
    leftover.file.size = status.st_size;
    leftover.file.description = "not received";
    leftover.fate = unlink(file.path.c_str()) == 0 ? Leftover::Fate::kRemoved : Leftover::Fate::kLeft;
    return leftover;
  }
  leftover.file = save(file);
  if (leftover.file.moved) leftover.fate = Leftover::Fate::kSaved;
  // What is refused for what it is would be refused again.
  _settled = _settled && (leftover.file.moved || !regular || otherSize);
  return leftover;
}

MovedFile Leftovers::save(const AbandonedDirectory::File& file) {
  if (file.moving) {
    if (auto finished = _mover->finish(file.path, file.name)) return *finished;
  }
  _directory->noteMove(file.path);
  const std::string base(platform::deletingPathExtension(platform::lastPathComponent(file.name)));
  const auto pair = file.has_sidecar ? _bases.find(base) : _bases.end();
  const bool second = pair != _bases.end();
  MovedFile moved = _mover->move(file.path, file.name, file.size, file.has_sidecar && !second,
                                 second ? std::optional(pair->second) : std::nullopt);
  if (moved.moved && file.has_sidecar) _bases[base] = moved.base;
  if (moved.moved && !file.size) moved.description = "its size was not known: it may not be whole";
  return moved;
}

}  // namespace tether
