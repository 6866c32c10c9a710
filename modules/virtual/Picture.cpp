#include "Picture.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <mutex>
#include <utility>

#include "FileState.h"

namespace virtualcamera {
namespace {

class MemorySource final : public PictureSource {
 public:
  explicit MemorySource(std::vector<uint8_t> bytes) : bytes_(std::move(bytes)) {}

  uint64_t size() const override { return bytes_.size(); }
  const uint8_t* piece(uint64_t offset, uint32_t, std::vector<uint8_t>&) const override {
    static constexpr uint8_t kNothing = 0;  // an empty picture has bytes to point to as well
    return bytes_.empty() ? &kNothing : bytes_.data() + offset;
  }

 private:
  std::vector<uint8_t> bytes_;
};

class FileSource final : public PictureSource {
 public:
  explicit FileSource(std::string path) : path_(std::move(path)), state_(FileState::of(path_)) {}
  ~FileSource() override { FileSource::rest(); }
  FileSource(const FileSource&) = delete;
  FileSource& operator=(const FileSource&) = delete;

  uint64_t size() const override { return state_ ? static_cast<uint64_t>(state_->size) : 0; }
  bool isThere() const override {
    const std::optional<FileState> now = FileState::of(path_);
    return now && state_ && now->looksLike(*state_);
  }

  void rest() const override {
    const std::lock_guard lock(mutex_);
    if (descriptor_ >= 0) close(descriptor_);
    descriptor_ = -1;
  }

  const uint8_t* piece(uint64_t offset, uint32_t length, std::vector<uint8_t>& scratch) const override {
    const std::lock_guard lock(mutex_);
    if (!openOnce()) return nullptr;
    if (scratch.size() <= length) scratch.resize(size_t{length} + 1);
    for (size_t done = 0; done < length;) {
      const ssize_t got = pread(descriptor_, scratch.data() + done, length - done, static_cast<off_t>(offset + done));
      if (got < 0 && errno == EINTR) continue;
      if (got <= 0) return nullptr;
      done += static_cast<size_t>(got);
    }
    // Nobody is to get the beginning of one picture and the end of another.
    const bool whole = offset + length < size() || FileState::of(descriptor_) == opened_;
    return whole ? scratch.data() : nullptr;
  }

 private:
  bool openOnce() const {
    if (descriptor_ >= 0) return true;
    descriptor_ = open(path_.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
    opened_ = FileState::of(descriptor_);
    if (opened_ && state_ && opened_->size == state_->size) return true;
    if (descriptor_ >= 0) close(descriptor_);
    descriptor_ = -1;
    return false;
  }

  std::string path_;
  std::optional<FileState> state_;  // when the picture was made
  mutable std::mutex mutex_;
  mutable int descriptor_ = -1;
  mutable std::optional<FileState> opened_{};
};

class PatternSource final : public PictureSource {
 public:
  explicit PatternSource(uint64_t size) : size_(size) {}

  uint64_t size() const override { return size_; }

  // One buffer, a period longer than a delivery, serves every offset.
  const uint8_t* piece(uint64_t offset, uint32_t length, std::vector<uint8_t>& scratch) const override {
    const size_t needed = size_t{length} + Picture::kPatternPeriod;
    if (scratch.size() < needed) {
      scratch.resize(needed);
      for (size_t i = 0; i < needed; ++i) scratch[i] = Picture::patternByte(i);
    }
    return scratch.data() + offset % Picture::kPatternPeriod;
  }

 private:
  uint64_t size_;
};

Picture withSource(uint32_t fileDataType, std::shared_ptr<const PictureSource> source) {
  Picture picture;
  picture.fileDataType = fileDataType;
  picture.source = std::move(source);
  return picture;
}

}  // namespace

Picture Picture::memory(uint32_t fileDataType, std::vector<uint8_t> bytes) {
  return withSource(fileDataType, std::make_shared<MemorySource>(std::move(bytes)));
}

Picture Picture::file(uint32_t fileDataType, const std::string& path) {
  Picture picture = withSource(fileDataType, std::make_shared<FileSource>(path));
  picture.name = path.substr(path.rfind('/') + 1);
  return picture;
}

Picture Picture::pattern(uint32_t fileDataType, uint64_t size) {
  return withSource(fileDataType, std::make_shared<PatternSource>(size));
}

}  // namespace virtualcamera
