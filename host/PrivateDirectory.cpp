#include "PrivateDirectory.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <set>
#include <sstream>
#include <system_error>
#include <thread>

#include "FileManager.h"

namespace tether {
namespace {

using namespace std::chrono_literals;

constexpr std::string_view kPrefix = "tether.";
constexpr std::string_view kSuffix = "XXXXXX";
constexpr const char* kRecord = ".record";
// Under this name until it is locked: nobody may take it for an abandoned one.
constexpr const char* kNewRecord = ".record.new";
constexpr off_t kLongestRecord = off_t{64} << 20;
// A helper that finds its input at an end is gone within two seconds.
constexpr auto kHelperEnds = 3s;
constexpr auto kLookAgain = 20ms;

// Paths in it are told to others, who may be elsewhere.
std::string temporaryDirectory() {
  std::error_code ignored;
  return std::filesystem::absolute(platform::temporaryDirectory(), ignored).string();
}

std::string recordIn(const std::string& directory) { return platform::appendingPathComponent(directory, kRecord); }

Descriptor openDirectory(const std::string& path) {
  return Descriptor(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
}

bool isPrivate(const Descriptor& directory) {
  struct stat status {};
  return fstat(directory.get(), &status) == 0 && status.st_uid == geteuid() && (status.st_mode & 0777U) == 0700U;
}

bool isEmptyFile(const std::string& path) {
  struct stat status {};
  return lstat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode) && status.st_size == 0;
}

// A record is lines of words; what is no line is not recorded, and a helper that announces for ever fills no disk.
void addTo(const Descriptor& record, std::string line) {
  struct stat status {};
  const bool full = fstat(record.get(), &status) != 0 || status.st_size > kLongestRecord;
  if (full || line.find('\n') != std::string::npos) return;
  line += '\n';
  [[maybe_unused]] const ssize_t ignored = write(record.get(), line.data(), line.size());
}

void noteMoveIn(const Descriptor& record, const std::string& file) {
  addTo(record, "moving " + std::string(platform::lastPathComponent(file)));
}

}  // namespace

PrivateDirectory::PrivateDirectory(const std::string& folder)
    : _path(platform::appendingPathComponent(temporaryDirectory(), std::string(kPrefix).append(kSuffix))) {
  const auto failed = [this] { return std::system_error(errno, std::generic_category(), _path); };
  if (mkdtemp(_path.data()) == nullptr) throw failed();
  try {
    const std::string fresh = platform::appendingPathComponent(_path, kNewRecord);
    _directory = openDirectory(_path);
    if (!_directory) throw failed();
    _directory = aboveStandardError(std::move(_directory));
    _record = Descriptor(open(fresh.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600));
    if (!_record) throw failed();
    // Where the file system knows no locks nobody else gets one either: the directory is never taken.
    for (const int descriptor : {_directory.get(), _record.get()}) flock(descriptor, LOCK_EX | LOCK_NB);
    addTo(_record, "folder " + folder);
    if (rename(fresh.c_str(), recordIn(_path).c_str()) != 0) throw failed();
  } catch (...) {
    tidy();
    throw;
  }
}

PrivateDirectory::~PrivateDirectory() { tidy(); }

bool PrivateDirectory::holds(const std::string& path) const {
  struct stat parent {};
  struct stat own {};
  const std::string directory(platform::deletingLastPathComponent(path));
  return platform::lastPathComponent(path) != kRecord && stat(directory.c_str(), &parent) == 0 &&
         fstat(_directory.get(), &own) == 0 && parent.st_dev == own.st_dev && parent.st_ino == own.st_ino;
}

void PrivateDirectory::noteAnnounced(const ObjectWasAdded& object) const {
  addTo(_record, "added " + std::to_string(object.capture_id) + (object.has_sidecar ? " 1 " : " 0 ") +
                     std::to_string(object.file_size) + " " + object.file_name);
}

void PrivateDirectory::noteComplete(const FileDownloadComplete& complete) const {
  addTo(_record, "complete " + std::to_string(complete.capture_id) + " " +
                     std::string(platform::lastPathComponent(complete.file_path)));
}

void PrivateDirectory::noteMove(const std::string& file) const { noteMoveIn(_record, file); }

std::vector<std::string> PrivateDirectory::tidy() const {
  std::vector<std::string> left;
  for (const std::string& name : platform::FileManager::contents(_path)) {
    std::string path = platform::appendingPathComponent(_path, name);
    const bool goes = name == kRecord || name == kNewRecord || isEmptyFile(path);
    if (!goes || unlink(path.c_str()) != 0) left.push_back(std::move(path));
  }
  if (left.empty()) rmdir(_path.c_str());
  return left;
}

std::vector<std::string> possiblyAbandonedDirectories() {
  std::vector<std::string> paths;
  const std::string temporary = temporaryDirectory();
  for (const std::string& name : platform::FileManager::contents(temporary)) {
    if (name.size() != kPrefix.size() + kSuffix.size() || !name.starts_with(kPrefix)) continue;
    paths.push_back(platform::appendingPathComponent(temporary, name));
  }
  return paths;
}

std::unique_ptr<AbandonedDirectory> AbandonedDirectory::take(const std::string& path) {
  std::unique_ptr<AbandonedDirectory> taken(new AbandonedDirectory);
  taken->_path = path;
  taken->_directory = openDirectory(path);
  if (!taken->_directory || !isPrivate(taken->_directory)) return nullptr;
  taken->_record = Descriptor(open(recordIn(path).c_str(), O_RDWR | O_APPEND | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!taken->_record || flock(taken->_record.get(), LOCK_EX | LOCK_NB) != 0) return nullptr;
  struct stat status {};
  // Someone may have settled it meanwhile.
  if (fstat(taken->_record.get(), &status) != 0 || status.st_nlink == 0) return nullptr;
  // Its helper is the last that may write there.
  for (const auto until = std::chrono::steady_clock::now() + kHelperEnds;
       flock(taken->_directory.get(), LOCK_EX | LOCK_NB) != 0;) {
    if (errno != EWOULDBLOCK || std::chrono::steady_clock::now() > until) return nullptr;
    std::this_thread::sleep_for(kLookAgain);
  }
  taken->read();
  return taken;
}

void AbandonedDirectory::read() {
  std::map<std::int32_t, File> announced;
  std::map<std::string, std::int32_t> ids;  // of file names
  std::set<std::string> moving;
  std::ifstream record(recordIn(_path));
  for (std::string line; std::getline(record, line);) {
    std::istringstream words(line);
    std::string kind;
    File file;
    std::int64_t size = 0;
    words >> kind;
    if (kind == "folder") {
      std::getline(words >> std::ws, _folder);
    } else if (kind == "added" && words >> file.capture_id >> file.has_sidecar >> size) {
      std::getline(words.ignore(), file.name);
      file.size = size;
      ids[file.name] = file.capture_id;
      announced[file.capture_id] = std::move(file);
    } else if (kind == "complete" && words >> file.capture_id) {
      std::getline(words.ignore(), file.name);
      ids[file.name] = file.capture_id;
      announced[file.capture_id].complete = true;
    } else if (kind == "moving") {
      std::getline(words.ignore(), file.name);
      moving.insert(file.name);
    }
  }
  for (const std::string& name : platform::FileManager::contents(_path)) {
    if (name == kRecord) continue;
    const auto id = ids.find(name);
    File file = id == ids.end() ? File() : announced[id->second];
    file.path = platform::appendingPathComponent(_path, name);
    if (file.name.empty()) file.name = name;
    file.moving = moving.count(name) != 0;
    _files.push_back(std::move(file));
  }
  // Whoever was not announced, as far as is known, came last.
  const auto order = [](const File& file) { return file.capture_id == 0 ? INT32_MAX : file.capture_id; };
  std::stable_sort(_files.begin(), _files.end(),
                   [&](const File& one, const File& other) { return order(one) < order(other); });
}

void AbandonedDirectory::noteMove(const std::string& file) const { noteMoveIn(_record, file); }

void AbandonedDirectory::settle() const {
  unlink(recordIn(_path).c_str());
  rmdir(_path.c_str());
}

}  // namespace tether
