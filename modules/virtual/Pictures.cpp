#include "Pictures.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <optional>
#include <utility>

#include "FileState.h"
#include "Mutex.h"

namespace virtualcamera {
namespace {

using camerakit::Guard;
using camerakit::Piece;

constexpr uint64_t kPatternPeriod = 251;

class FileSource final : public PictureSource {
 public:
  explicit FileSource(std::string path) : _path(std::move(path)), _state(FileState::of(_path)) {}
  ~FileSource() override { rest(); }
  FileSource(const FileSource&) = delete;
  FileSource& operator=(const FileSource&) = delete;

  uint64_t size() const override { return _state ? static_cast<uint64_t>(_state->size) : 0; }
  bool isThere() const {
    const std::optional<FileState> now = FileState::of(_path);
    return now && _state && now->looksLike(*_state);
  }

  void rest() const KIT_EXCLUDES(_mutex) {
    const Guard guard(_mutex);
    if (_descriptor >= 0) close(_descriptor);
    _descriptor = -1;
  }

  Piece piece(uint64_t offset, uint32_t length, std::vector<uint8_t>& scratch) const override {
    const Guard guard(_mutex);
    if (!openOnce()) return nullptr;
    if (scratch.size() <= length) scratch.resize(size_t{length} + 1);
    for (size_t done = 0; done < length;) {
      const ssize_t got = pread(_descriptor, scratch.data() + done, length - done, static_cast<off_t>(offset + done));
      if (got < 0 && errno == EINTR) continue;
      if (got <= 0) return nullptr;
      done += static_cast<size_t>(got);
    }
    // Nobody is to get the beginning of one picture and the end of another.
    const bool whole = offset + length < size() || FileState::of(_descriptor) == _opened;
    return Piece(whole ? scratch.data() : nullptr);
  }

 private:
  bool openOnce() const KIT_REQUIRES(_mutex) {
    if (_descriptor >= 0) return true;
    _descriptor = open(_path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
    _opened = FileState::of(_descriptor);
    if (_opened && _state && _opened->size == _state->size) return true;
    if (_descriptor >= 0) close(_descriptor);
    _descriptor = -1;
    return false;
  }

  std::string _path;
  std::optional<FileState> _state;  // when the picture was made
  mutable camerakit::Mutex _mutex;
  mutable int _descriptor KIT_GUARDED_BY(_mutex) = -1;
  mutable std::optional<FileState> _opened KIT_GUARDED_BY(_mutex){};
};

class PatternSource final : public PictureSource {
 public:
  explicit PatternSource(uint64_t size) : _size(size) {}

  uint64_t size() const override { return _size; }

  // One buffer, a period longer than a delivery, serves every offset.
  Piece piece(uint64_t offset, uint32_t length, std::vector<uint8_t>& scratch) const override {
    const size_t needed = size_t{length} + kPatternPeriod;
    if (scratch.size() < needed) {
      scratch.resize(needed);
      for (size_t i = 0; i < needed; ++i) scratch[i] = static_cast<uint8_t>(i % kPatternPeriod);
    }
    return scratch.data() + offset % kPatternPeriod;
  }

 private:
  uint64_t _size;
};

Picture withSource(uint32_t fileDataType, std::shared_ptr<const PictureSource> source) {
  Picture picture;
  picture.fileDataType = fileDataType;
  picture.source = std::move(source);
  return picture;
}

}  // namespace

Picture filePicture(uint32_t fileDataType, const std::string& path) {
  Picture picture = withSource(fileDataType, std::make_shared<FileSource>(path));
  picture.name = path.substr(path.rfind('/') + 1);
  return picture;
}

bool isThere(const Picture& picture) {
  const auto* file = dynamic_cast<const FileSource*>(picture.source.get());
  return file == nullptr || file->isThere();
}

void rest(const Picture& picture) {
  if (const auto* file = dynamic_cast<const FileSource*>(picture.source.get())) file->rest();
}

Picture patternPicture(uint32_t fileDataType, uint64_t size) {
  return withSource(fileDataType, std::make_shared<PatternSource>(size));
}

}  // namespace virtualcamera
