#include "PictureFolder.h"

#include <dirent.h>

#include <algorithm>
#include <ctime>
#include <memory>

namespace virtualcamera {
namespace {

constexpr std::chrono::seconds kPairGrace{1};
constexpr std::chrono::hours kLongAgo{1};
constexpr std::chrono::seconds kCoarsestTimeStamp{1};
// Of a folder that has to be listed again and again. A large one takes one part in fifty of a processor at most.
constexpr std::chrono::milliseconds kListingInterval{250};
constexpr int kListingShare = 50;

bool isOlder(int64_t time, std::chrono::milliseconds age) {
  return std::chrono::system_clock::now().time_since_epoch() - std::chrono::nanoseconds(time) > age;
}

std::string baseOf(const std::string& name) { return name.substr(0, name.rfind('.')); }

bool arePair(uint32_t a, uint32_t b) {
  return (a == kNkMAIDFileDataType_NEF && b == kNkMAIDFileDataType_JPEG) ||
         (a == kNkMAIDFileDataType_JPEG && b == kNkMAIDFileDataType_NEF);
}

}  // namespace

std::optional<uint32_t> FileTypes::of(const std::string& name) const {
  static const std::map<std::string, uint32_t> kKnown = {{".jpg", kNkMAIDFileDataType_JPEG},
                                                         {".jpeg", kNkMAIDFileDataType_JPEG},
                                                         {".tif", kNkMAIDFileDataType_TIFF},
                                                         {".tiff", kNkMAIDFileDataType_TIFF},
                                                         {".nef", kNkMAIDFileDataType_NEF},
                                                         {".ndf", kNkMAIDFileDataType_NDF},
                                                         {".dat", 3}};
  const size_t dot = name.rfind('.');
  if (dot == std::string::npos || name.front() == '.') return std::nullopt;
  std::string extension = name.substr(dot);
  for (char& c : extension)
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  if (const auto found = further.find(extension); found != further.end()) return found->second;
  if (const auto found = kKnown.find(extension); found != kKnown.end()) return found->second;
  return std::nullopt;
}

bool FolderWatch::changed() {
  struct stat status {};
  if (stat(_path.c_str(), &status) != 0) return std::exchange(_exists, false);
  const int64_t modified = modificationTime(status);
  const auto now = std::chrono::steady_clock::now();
  if (_exists && modified == _modified) return now - _since < kCoarsestTimeStamp;
  _exists = true;
  _modified = modified;
  _since = now;
  return true;
}

std::optional<std::vector<FolderEntry>> entriesOf(const std::string& path) {
  std::vector<FolderEntry> entries;
  const std::unique_ptr<DIR, int (*)(DIR*)> folder(opendir(path.c_str()), closedir);
  if (!folder) return std::nullopt;
  while (const dirent* entry = readdir(folder.get())) {
    struct stat status {};
    if (entry->d_name[0] == '.' || fstatat(dirfd(folder.get()), entry->d_name, &status, 0) != 0) continue;
    entries.push_back({entry->d_name, status});
  }
  std::sort(entries.begin(), entries.end(), [](const FolderEntry& a, const FolderEntry& b) { return a.name < b.name; });
  return entries;
}

void PictureFolder::configure(FileTypes types, bool pairsExpected) {
  _types = std::move(types);
  _pairsExpected = pairsExpected;
}

void PictureFolder::leave() {
  _events->unwatch(_watch);
  _watch = -1;
  _nextListing = {};
  _away = false;
  for (auto& [name, file] : _files) file.writer = File::Unknown;
}

// What there is.

void PictureFolder::look(bool now) {
  const std::optional<std::vector<FolderEvent>> events = _events->take(_watch);
  if (events) apply(*events);
  struct stat status {};
  if (stat(_path.c_str(), &status) != 0 || !S_ISDIR(status.st_mode)) {
    leave();
    _away = true;
    return;
  }
  const bool sameFolder = events && status.st_ino == _inode;
  // The system may tell nothing of what another computer does in a shared folder.
  const bool untold = sameFolder && events->empty() && modificationTime(status) != _modified;
  _modified = modificationTime(status);
  if (sameFolder) return untold ? list() : void();
  if (_watch < 0 && !now && Clock::now() < _nextListing) return;
  _inode = status.st_ino;
  leave();
  _watch = _events->watch(_path);
  list();
}

// What happens to a file before it is listed is told afterwards. That makes no difference: nothing is handed out in
// between.
void PictureFolder::list() {
  const auto start = Clock::now();
  if (const std::optional<std::vector<FolderEntry>> entries = entriesOf(_path)) {
    know(*entries);
  } else {
    leave();
  }
  const auto end = Clock::now();
  _nextListing = end + std::max<Clock::duration>(kListingInterval, kListingShare * (end - start));
  if (const auto events = _events->take(_watch)) apply(*events);
}

void PictureFolder::know(const std::vector<FolderEntry>& entries) {
  Files before;
  before.swap(_files);
  for (const auto& [name, status] : entries) {
    File file;
    if (!see(file, FileState::of(status))) continue;
    const auto known = before.find(name);
    if (known != before.end() && (known->second.writer == File::Writes || known->second.seen.looksLike(file.seen))) {
      known->second.seen = file.seen;
      file = known->second;
      before.erase(known);
    } else if (!_listed) {
      _first == First::New ? becomeWhole(file) : void(file.state = File::Known);
    }
    _files.emplace(name, file);
  }
  Gone gone;
  while (!before.empty()) forget(before, before.begin(), gone);
  for (auto& [name, file] : _files)
    if (file.state == File::Arriving) wasRenamed(file, gone);
  _listed = true;
  _idle = false;
}

// False: it has gone, or is no regular file.
bool PictureFolder::read(const std::string& name, File& file) const {
  return see(file, FileState::of(_path + "/" + name));
}

bool PictureFolder::see(File& file, const std::optional<FileState>& now) {
  if (!now) return false;
  if (*now == file.seen) return true;
  file.seen = *now;
  file.since = Clock::now();
  return true;
}

void PictureFolder::forget(Files& files, Files::iterator file, Gone& gone) const {
  if (_types.of(file->first)) gone.insert_or_assign(file->second.seen.inode, file->second);
  files.erase(file);
}

bool PictureFolder::wasRenamed(File& file, const Gone& gone) {
  const auto found = gone.find(file.seen.inode);
  if (found == gone.end() || !(found->second.seen == file.seen)) return false;
  file = found->second;
  // Under its old name it cannot be transferred any more.
  if (!file.handedOut.expired()) becomeWhole(file);
  return true;
}

// What happens.

void PictureFolder::apply(const std::vector<FolderEvent>& events) {
  Gone gone;
  for (const FolderEvent& event : events) {
    if (event.name.empty()) _away = _away || event.what == FolderEvent::Gone;
    if (!event.name.empty() && event.name.front() != '.') apply(event, gone);
  }
  if (!events.empty()) _idle = false;
}

void PictureFolder::apply(const FolderEvent& event, Gone& gone) {
  const auto known = _files.find(event.name);
  const bool isKnown = known != _files.end();
  if (event.what == FolderEvent::Gone) return isKnown ? forget(_files, known, gone) : void();
  if (event.what == FolderEvent::Appeared && isKnown) return;
  File file = isKnown && event.what != FolderEvent::MovedIn ? known->second : File();
  const FileState before = file.seen;
  if (!read(event.name, file)) {
    // What happened to its contents does. Otherwise it may only be out of sight, together with its folder.
    if (event.what == FolderEvent::Changed || event.what == FolderEvent::MovedIn) _files.erase(event.name);
    return;
  }
  switch (event.what) {
    case FolderEvent::Opened:
      if (file.writer == File::Done) file.writer = File::Unknown;
      break;
    case FolderEvent::Changed:
      // Nobody can write to what nobody has opened, but cut it, or set its time; nor write now and long ago.
      if (file.writer != File::Done)
        file.writer = isOlder(file.seen.modified, kLongAgo) ? File::Suspected : File::Writes;
      if (file.writer == File::Writes || file.seen.size != before.size) file.state = File::Arriving;
      break;
    case FolderEvent::Closed:
      if (file.state == File::Arriving || file.writer == File::Suspected) becomeWhole(file);
      file.writer = File::Done;
      break;
    case FolderEvent::MovedIn:
      file.writer = File::Done;
      if (!wasRenamed(file, gone)) becomeWhole(file);
      break;
    default:
      break;
  }
  _files.insert_or_assign(event.name, file);
}

void PictureFolder::becomeWhole(File& file) {
  if (file.seen.size == 0) return;
  file.state = File::Whole;
  file.since = Clock::now();
}

bool PictureFolder::rested(const File& file) const {
  return Clock::now() - file.since >= _rest || (file.seen.size > 0 && isOlder(file.seen.modified, _rest));
}

// Of what nobody told that it is whole.
void PictureFolder::settle() {
  for (auto& [name, file] : _files) {
    if (file.state != File::Arriving || file.writer == File::Writes || !rested(file)) continue;
    if (!read(name, file) || !rested(file)) continue;
    file.since = Clock::now();
    becomeWhole(file);
  }
}

// What is handed out.

std::vector<Shot> PictureFolder::take(size_t most) {
  std::vector<Shot> shots;
  if (_idle) return shots;
  settle();
  _idle = true;
  for (auto file = _files.begin(); file != _files.end() && shots.size() < most; ++file) {
    if (file->second.state == File::Known) continue;
    _idle = false;
    if (file->second.state != File::Whole) continue;
    const std::optional<uint32_t> type = _types.of(file->first);
    if (!type) {
      file->second.state = File::Known;
      continue;
    }
    const auto partner = partnerOf(file->first, *type);
    if (!takes(file->second, *type, partner)) continue;
    if (Shot shot = handOut(file, partner); !shot.empty()) shots.push_back(std::move(shot));
  }
  return shots;
}

// The other half, as long as it has not been taken by itself.
PictureFolder::Files::iterator PictureFolder::partnerOf(const std::string& name, uint32_t type) {
  const std::string base = baseOf(name);
  for (auto other = _files.lower_bound(base + "."); other != _files.end(); ++other) {
    if (other->first.compare(0, base.size() + 1, base + ".") != 0) break;
    const File& file = other->second;
    const bool comes = file.state == File::Whole ||
                       (file.state == File::Arriving && (file.writer == File::Writes || file.seen.size > 0));
    const std::optional<uint32_t> otherType = _types.of(other->first);
    if (comes && baseOf(other->first) == base && otherType && arePair(type, *otherType)) return other;
  }
  return _files.end();
}

bool PictureFolder::takes(const File& file, uint32_t type, Files::iterator partner) const {
  if (partner != _files.end()) return partner->second.state == File::Whole;
  const bool half = type == kNkMAIDFileDataType_NEF || type == kNkMAIDFileDataType_JPEG;
  return !_pairsExpected || !half || Clock::now() - file.since >= kPairGrace;
}

// Nothing where one of them is out of sight all of a sudden; with its folder, perhaps.
Shot PictureFolder::handOut(Files::iterator file, Files::iterator partner) {
  Shot shot;
  for (const auto& half : {file, partner}) {
    if (half == _files.end()) continue;
    shot.push_back(filePicture(*_types.of(half->first), _path + "/" + half->first));
    if (!isThere(shot.back())) return {};
  }
  file->second.state = File::Known;
  file->second.handedOut = shot.front().source;
  if (partner == _files.end()) return shot;
  partner->second.state = File::Known;
  partner->second.handedOut = shot.back().source;
  // The RAW comes first, as cameras send it.
  if (shot.front().fileDataType != kNkMAIDFileDataType_NEF) std::swap(shot.front(), shot.back());
  return shot;
}

}  // namespace virtualcamera
