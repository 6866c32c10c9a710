// A camera module with pictures that are stored nowhere: TETHER_BENCH_PICTURES="COUNT BYTES" says how many its first
// camera holds from the start, and how large each is; TETHER_BENCH_CAMERAS, how many cameras there are, one unless
// told. Every byte that comes through the named pipe TETHER_BENCH_SHUTTER is one more picture.
#include <fcntl.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <thread>
#include <utility>
#include <vector>

#include "VirtualCamera.h"

namespace {

// Any piece of it is the same block: making it costs nothing.
class Blank final : public virtualcamera::PictureSource {
 public:
  explicit Blank(std::uint64_t size) : _size(size) {}
  std::uint64_t size() const override { return _size; }
  camerakit::Piece piece(std::uint64_t /*offset*/, std::uint32_t length,
                         std::vector<std::uint8_t>& /*scratch*/) const override {
    static const std::vector<std::uint8_t> block(std::size_t{1} << 20, 'x');
    return length <= block.size() ? block.data() : nullptr;
  }

 private:
  std::uint64_t _size;
};

virtualcamera::Model* makeModel() {
  auto* const model = new virtualcamera::Model;  // lives as long as the process
  virtualcamera::Camera& camera = model->addCamera(1, "Pattern");
  const char* const cameras = std::getenv("TETHER_BENCH_CAMERAS");
  const unsigned long last = cameras == nullptr ? 1 : std::strtoul(cameras, nullptr, 10);
  for (unsigned long id = 2; id <= last; ++id) model->addCamera(static_cast<std::uint32_t>(id), "Pattern");
  const char* const pictures = std::getenv("TETHER_BENCH_PICTURES");
  if (pictures == nullptr) return model;
  char* end = nullptr;
  const auto count = std::strtoul(pictures, &end, 10);
  const auto bytes = std::strtoul(end, nullptr, 10);
  const auto shoot = [&camera, bytes] {
    virtualcamera::Picture picture;
    picture.source = std::make_shared<Blank>(bytes);
    camera.shoot(std::move(picture));
  };
  for (unsigned long number = 0; number < count; ++number) shoot();
  const char* const shutter = std::getenv("TETHER_BENCH_SHUTTER");
  const int pipe = shutter == nullptr ? -1 : open(shutter, O_RDONLY | O_CLOEXEC);
  if (pipe < 0) return model;
  std::thread([pipe, shoot] {
    for (char press = 0; read(pipe, &press, 1) == 1;) shoot();
  }).detach();
  return model;
}

}  // namespace

extern "C" __attribute__((visibility("default"))) int32_t MAIDEntryPoint(tagNkMAIDObject* object, uint32_t command,
                                                                         uint32_t parameter, uint32_t dataType,
                                                                         uint64_t data,
                                                                         NkMAIDCompletionProc* completion,
                                                                         void* reference) {
  static virtualcamera::Model* const model = makeModel();
  static_cast<void>(model);
  return virtualcamera::entryPoint(object, command, parameter, dataType, data, completion, reference);
}
