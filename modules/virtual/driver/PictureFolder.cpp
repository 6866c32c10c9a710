#include "PictureFolder.h"

#include <dirent.h>

#include <algorithm>
#include <cerrno>
#include <ctime>
#include <memory>

namespace virtualcamera {
namespace {

constexpr std::chrono::milliseconds kStill{100};
constexpr std::chrono::seconds kPairGrace{1};
constexpr time_t kSettledSeconds = 1;

bool olderThanASecond(const struct timespec& time) {
  struct timespec now {};
  clock_gettime(CLOCK_REALTIME, &now);
  const time_t seconds = now.tv_sec - time.tv_sec;
  return seconds > kSettledSeconds || (seconds == kSettledSeconds && now.tv_nsec > time.tv_nsec);
}

std::string baseOf(const std::string& name) { return name.substr(0, name.rfind('.')); }

bool arePair(uint32_t a, uint32_t b) {
  return (a == kNkMAIDFileDataType_NEF && b == kNkMAIDFileDataType_JPEG) ||
         (a == kNkMAIDFileDataType_JPEG && b == kNkMAIDFileDataType_NEF);
}

// The RAW comes first, as cameras send it.
Shot pairOf(Picture a, Picture b) {
  if (a.fileDataType != kNkMAIDFileDataType_NEF) std::swap(a, b);
  Shot shot;
  shot.push_back(std::move(a));
  shot.push_back(std::move(b));
  return shot;
}

}  // namespace

struct timespec modificationTime(const struct stat& status) {
#ifdef __APPLE__
  return status.st_mtimespec;
#else
  return status.st_mtim;
#endif
}

bool sameTime(const struct timespec& a, const struct timespec& b) {
  return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
}

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
  if (stat(path_.c_str(), &status) != 0) {
    settled_ = false;
    return std::exchange(exists_, false);
  }
  const struct timespec modified = modificationTime(status);
  if (exists_ && settled_ && sameTime(modified, last_)) return false;
  exists_ = true;
  last_ = modified;
  settled_ = olderThanASecond(modified);
  return true;
}

std::optional<std::vector<FolderEntry>> entriesOf(const std::string& path) {
  std::vector<FolderEntry> entries;
  const std::unique_ptr<DIR, int (*)(DIR*)> folder(opendir(path.c_str()), closedir);
  if (!folder) return errno == ENOENT || errno == ENOTDIR ? std::optional(entries) : std::nullopt;
  while (const dirent* entry = readdir(folder.get()))
    if (entry->d_name[0] != '.') entries.push_back({entry->d_name, entry->d_ino});
  std::sort(entries.begin(), entries.end(), [](const FolderEntry& a, const FolderEntry& b) { return a.name < b.name; });
  return entries;
}

std::vector<Shot> PictureFolder::look(const FileTypes& types, bool pairsExpected) {
  std::vector<Shot> shots;
  if (watch_.changed()) list(types);
  if (untaken_ == 0) return shots;
  for (auto& [name, file] : files_)
    if (file.state == File::Arriving) watchArrival(name, file);
  for (auto file = files_.begin(); file != files_.end(); ++file) {
    if (file->second.state != File::Whole) continue;
    const auto partner = partnerOf(file->first, file->second);
    if (!takes(file->second, partner, pairsExpected)) continue;
    file->second.state = File::Taken;
    --untaken_;
    if (partner == files_.end()) {
      shots.push_back({picture(file)});
    } else {
      partner->second.state = File::Taken;
      --untaken_;
      shots.push_back(pairOf(picture(file), picture(partner)));
    }
  }
  return shots;
}

void PictureFolder::list(const FileTypes& types) {
  std::optional<std::vector<FolderEntry>> entries = entriesOf(watch_.path());
  if (!entries) return watch_.retry();
  Files now;
  untaken_ = 0;
  for (FolderEntry& entry : *entries) {
    const std::optional<uint32_t> type = types.of(entry.name);
    if (!type) continue;
    const auto known = files_.find(entry.name);
    File file;
    if (known != files_.end() && known->second.inode == entry.inode) {
      file = known->second;
    } else {
      file.inode = entry.inode;
      file.type = *type;
    }
    if (file.state != File::Taken) ++untaken_;
    now.emplace(std::move(entry.name), file);
  }
  files_.swap(now);
}

void PictureFolder::watchArrival(const std::string& name, File& file) const {
  struct stat status {};
  if (stat((watch_.path() + "/" + name).c_str(), &status) != 0 || !S_ISREG(status.st_mode) || status.st_size == 0)
    return;
  const auto now = Clock::now();
  const struct timespec modified = modificationTime(status);
  if (status.st_size != file.size || !sameTime(modified, file.modified)) {
    file.size = status.st_size;
    file.modified = modified;
    file.since = now;
  }
  if (now - file.since < kStill && !olderThanASecond(modified)) return;
  file.state = File::Whole;
  file.since = now;
}

// The other half, as long as it has not been taken by itself.
PictureFolder::Files::iterator PictureFolder::partnerOf(const std::string& name, const File& file) {
  const std::string base = baseOf(name);
  for (auto other = files_.lower_bound(base + "."); other != files_.end(); ++other) {
    if (other->first.compare(0, base.size() + 1, base + ".") != 0) break;
    if (baseOf(other->first) == base && other->second.state != File::Taken && arePair(file.type, other->second.type))
      return other;
  }
  return files_.end();
}

bool PictureFolder::takes(const File& file, Files::iterator partner, bool pairsExpected) const {
  if (partner != files_.end()) return partner->second.state == File::Whole;
  const bool half = file.type == kNkMAIDFileDataType_NEF || file.type == kNkMAIDFileDataType_JPEG;
  return !pairsExpected || !half || Clock::now() - file.since >= kPairGrace;
}

Picture PictureFolder::picture(Files::iterator file) const {
  return Picture::file(file->second.type, watch_.path() + "/" + file->first);
}

Shot Roll::next(const FileTypes& types) {
  const std::vector<FolderEntry> entries = entriesOf(path_).value_or(std::vector<FolderEntry>());
  const auto isLeft = [&](const FolderEntry& entry) {
    return types.of(entry.name) && !taken_.contains({entry.name, entry.inode});
  };
  const auto take = [&](const FolderEntry& entry) {
    taken_.emplace(entry.name, entry.inode);
    return Picture::file(*types.of(entry.name), path_ + "/" + entry.name);
  };
  const auto first = std::find_if(entries.begin(), entries.end(), isLeft);
  if (first == entries.end()) return {};
  const auto second = std::find_if(first + 1, entries.end(), [&](const FolderEntry& entry) {
    return isLeft(entry) && baseOf(entry.name) == baseOf(first->name) &&
           arePair(*types.of(first->name), *types.of(entry.name));
  });
  Picture picture = take(*first);
  return second == entries.end() ? Shot{std::move(picture)} : pairOf(std::move(picture), take(*second));
}

}  // namespace virtualcamera
