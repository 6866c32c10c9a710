#include "Memory.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>

#include "Log.h"

namespace gphoto2camera {
namespace {

using camerakit::Guard;

constexpr int kMostAnnouncements = 3;
constexpr int64_t kRoughly = 60;  // seconds
const char* const kMarks[] = {"seen", "new", "done"};

// <folder>/<model>-<serial>.txt, of letters and figures.
std::string pathOf(const std::string& model, const std::string& serial) {
  const char* folder = std::getenv("TETHER_STATE");
  if (folder == nullptr || *folder == '\0' || serial.empty()) return {};
  std::string name = model + "-" + serial;
  for (char& letter : name)
    if (std::isalnum(static_cast<unsigned char>(letter)) == 0 && letter != '-') letter = '_';
  return std::string(folder) + "/" + name + ".txt";
}

bool writeAll(int descriptor, const std::string& text) {
  for (size_t at = 0; at < text.size();) {
    const ssize_t written = write(descriptor, text.data() + at, text.size() - at);
    if (written < 0 && errno == EINTR) continue;
    if (written <= 0) return false;
    at += static_cast<size_t>(written);
  }
  return true;
}

}  // namespace

Memory::Memory(const std::string& model, const std::string& serial) : _model(model), _path(pathOf(model, serial)) {
  const Guard guard(_mutex);
  if (!_path.empty()) load();
}

bool Memory::knowsCamera() const {
  const Guard guard(_mutex);
  return _known;
}

std::optional<std::string> Memory::newestFolder(const std::string& parent) const {
  const Guard guard(_mutex);
  const auto found = _folders.find(parent);
  return found != _folders.end() ? std::optional<std::string>(found->second) : std::nullopt;
}

void Memory::setNewestFolder(const std::string& parent, const std::string& folder) {
  const Guard guard(_mutex);
  _folders[parent] = folder;
  _known = true;
}

void Memory::see(const File& file) {
  const Guard guard(_mutex);
  _entries[file.path()] = {.file = file};
}

bool Memory::knows(const File& file) const {
  const Guard guard(_mutex);
  const auto found = _entries.find(file.path());
  return found != _entries.end() && found->second.file.size == file.size;
}

// Cameras may tell of a file twice, and the library may know its time only roughly. One of the same name and size, but
// of quite another time, is another one: the card was formatted, and its numbers begin anew.
bool Memory::isNew(const File& file) const {
  const Guard guard(_mutex);
  const auto found = _entries.find(file.path());
  if (found == _entries.end() || found->second.mark == Mark::Seen) return true;
  const File& known = found->second.file;
  return known.size != file.size || std::abs(known.time - file.time) > kRoughly;
}

bool Memory::announce(const File& file) {
  const Guard guard(_mutex);
  put(Mark::Announced, file);
  append(lineOf(Mark::Announced, file));
  return ++_entries[file.path()].announced <= kMostAnnouncements;
}

void Memory::finish(const File& file) {
  const Guard guard(_mutex);
  put(Mark::Finished, file);
  append(lineOf(Mark::Finished, file));
}

std::vector<File> Memory::owed() const {
  const Guard guard(_mutex);
  std::vector<const Entry*> entries;
  for (const auto& [path, entry] : _entries)
    if (entry.mark == Mark::Announced) entries.push_back(&entry);
  std::sort(entries.begin(), entries.end(), [](auto* one, auto* other) { return one->order < other->order; });
  std::vector<File> files;
  files.reserve(entries.size());
  for (const Entry* entry : entries) files.push_back(entry->file);
  return files;
}

// A line: the mark, size, time and path, with tabs in between. Of a folder: its parent and its name.
std::string Memory::lineOf(Mark mark, const File& file) {
  return std::string(kMarks[static_cast<int>(mark)]) + '\t' + std::to_string(file.size) + '\t' +
         std::to_string(file.time) + '\t' + file.folder + '\t' + file.name + '\n';
}

void Memory::put(Mark mark, const File& file) {
  Entry& entry = _entries[file.path()];
  const bool another = entry.file.size != file.size || std::abs(entry.file.time - file.time) > kRoughly;
  if (another) entry.announced = 0;
  if (mark == Mark::Announced && (another || entry.mark != mark)) entry.order = ++_lastOrder;
  entry.file = file;
  entry.mark = mark;
}

void Memory::take(const std::string& line) {
  std::vector<std::string> parts;
  std::istringstream stream(line);
  for (std::string part; std::getline(stream, part, '\t');) parts.push_back(part);
  if (parts.size() > 1 && parts[0] == "folder") {
    _folders[parts[1]] = parts.size() > 2 ? parts[2] : std::string();
    _known = true;
    return;
  }
  const auto* const mark = std::find(std::begin(kMarks), std::end(kMarks), parts.empty() ? "" : parts[0]);
  if (parts.size() != 5 || mark == std::end(kMarks)) return;  // the line in which an earlier process died
  File file{.folder = parts[3], .name = parts[4]};
  file.size = std::strtoull(parts[1].c_str(), nullptr, 10);
  file.time = std::strtoll(parts[2].c_str(), nullptr, 10);
  put(static_cast<Mark>(mark - std::begin(kMarks)), file);
}

void Memory::load() {
  std::ifstream file(_path);
  for (std::string line; std::getline(file, line) && !file.eof();) take(line);
}

void Memory::complain() {
  if (!_complained) log(_model, "cannot remember its pictures in " + _path + ": " + std::strerror(errno));
  _complained = true;
}

void Memory::append(const std::string& line) {
  if (_path.empty()) return;
  const int descriptor = open(_path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
  if (descriptor < 0 || !writeAll(descriptor, line)) complain();
  if (descriptor >= 0) close(descriptor);
}

void Memory::save() {
  const Guard guard(_mutex);
  if (_path.empty()) return;
  std::string text;
  for (const auto& [parent, folder] : _folders) text.append("folder\t" + parent).append('\t' + folder).append("\n");
  std::vector<const Entry*> entries;
  for (const auto& [path, entry] : _entries) entries.push_back(&entry);
  std::sort(entries.begin(), entries.end(), [](auto* one, auto* other) { return one->order < other->order; });
  for (const Entry* entry : entries) text += lineOf(entry->mark, entry->file);
  const std::string beside = _path + ".new";
  const int descriptor = open(beside.c_str(), O_WRONLY | O_TRUNC | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
  const bool written = descriptor >= 0 && writeAll(descriptor, text) && fsync(descriptor) == 0;
  if (descriptor >= 0) close(descriptor);
  if (!written || rename(beside.c_str(), _path.c_str()) != 0) complain();
}

}  // namespace gphoto2camera
