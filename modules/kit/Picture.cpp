#include "Picture.h"

#include <utility>

namespace camerakit {
namespace {

class MemorySource final : public PictureSource {
 public:
  explicit MemorySource(std::vector<uint8_t> bytes) : _bytes(std::move(bytes)) {}

  uint64_t size() const override { return _bytes.size(); }
  Piece piece(uint64_t offset, uint32_t /*length*/, std::vector<uint8_t>& /*scratch*/) const override {
    static constexpr uint8_t kNothing = 0;  // an empty picture has bytes to point to as well
    return _bytes.empty() ? &kNothing : _bytes.data() + offset;
  }

 private:
  std::vector<uint8_t> _bytes;
};

}  // namespace

Picture Picture::memory(uint32_t fileDataType, std::vector<uint8_t> bytes) {
  Picture picture;
  picture.fileDataType = fileDataType;
  picture.source = std::make_shared<MemorySource>(std::move(bytes));
  return picture;
}

}  // namespace camerakit
