#include "PictureType.h"

#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstring>
#include <memory>
#include <string_view>

#if defined(TETHER_LIBMAGIC)
#include <magic.h>
#endif

namespace tether {
namespace {

constexpr std::string_view kUnknown = ".dat";
constexpr std::size_t kHead = 64 * 1024;

bool has(std::string_view bytes, std::size_t offset, std::string_view what) {
  return bytes.size() >= offset + what.size() && bytes.compare(offset, what.size(), what) == 0;
}

// The tags of a TIFF's first directory. Raw files of many makers are TIFFs, told apart by these.
class TiffHead {
 public:
  explicit TiffHead(std::string_view bytes) : _bytes(bytes), _big(has(bytes, 0, {"MM\0*", 4})) {
    if (!_big && !has(bytes, 0, {"II*\0", 4})) return;
    const std::uint32_t directory = number(4, 4);
    const std::uint32_t entries = number(directory, 2);
    for (std::uint32_t entry = 0; entry < entries; ++entry) {
      const std::size_t at = std::size_t{directory} + 2 + std::size_t{entry} * 12;
      const std::uint32_t tag = number(at, 2);
      if (tag == kDngVersion) _isDng = true;
      if (tag == kMake && number(at + 4, 4) > 4)
        _make = _bytes.substr(std::min(std::size_t{number(at + 8, 4)}, _bytes.size()));
    }
  }

  bool isDng() const { return _isDng; }
  // The maker's name begins so.
  bool isOf(std::string_view maker) const { return has(_make, 0, maker); }

 private:
  static constexpr std::uint32_t kMake = 0x010F;
  static constexpr std::uint32_t kDngVersion = 0xC612;

  // 0 beyond the end.
  std::uint32_t number(std::size_t offset, std::size_t size) const {
    std::uint32_t value = 0;
    if (offset + size > _bytes.size()) return 0;
    for (std::size_t i = 0; i < size; ++i) {
      const auto byte = static_cast<unsigned char>(_bytes[offset + (_big ? i : size - 1 - i)]);
      value = value << 8 | byte;
    }
    return value;
  }

  std::string_view _bytes;
  const bool _big;
  bool _isDng = false;
  std::string_view _make;
};

// What libmagic does not know, or takes for any TIFF.
std::string_view rawExtension(std::string_view head) {
  if (has(head, 4, "ftypcrx")) return ".cr3";
  if (has(head, 0, {"IIU\0", 4})) return ".rw2";
  const TiffHead tiff(head);
  if (tiff.isDng()) return ".dng";
  if (tiff.isOf("SONY")) return ".arw";
  if (tiff.isOf("PENTAX") || tiff.isOf("RICOH")) return ".pef";
  return {};
}

#if defined(TETHER_LIBMAGIC)
struct Kind {
  std::string_view type;
  std::string_view extension;
};
constexpr std::array kKinds{
    Kind{"image/jpeg", ".jpg"},          Kind{"image/heic", ".heic"},       Kind{"image/heif", ".heif"},
    Kind{"image/x-canon-cr2", ".cr2"},   Kind{"image/x-canon-crw", ".crw"}, Kind{"image/x-fuji-raf", ".raf"},
    Kind{"image/x-olympus-orf", ".orf"}, Kind{"image/x-x3f", ".x3f"},       Kind{"image/tiff", ".tif"}};

std::string_view knownExtension(std::string_view head) {
  const std::unique_ptr<magic_set, decltype(&magic_close)> magic(magic_open(MAGIC_MIME_TYPE), &magic_close);
  if (!magic || magic_load(magic.get(), nullptr) != 0) return {};
  const char* const type = magic_buffer(magic.get(), head.data(), head.size());
  for (const Kind& kind : kKinds) {
    if (type != nullptr && kind.type == type) return kind.extension;
  }
  return {};
}
#else
std::string_view knownExtension(std::string_view /*head*/) { return {}; }
#endif

}  // namespace

std::string nameByContent(const std::string& name, int descriptor) {
  if (name.size() <= kUnknown.size() || !name.ends_with(kUnknown)) return name;
  std::string head(kHead, '\0');
  const ssize_t got = pread(descriptor, head.data(), head.size(), 0);
  head.resize(static_cast<std::size_t>(std::max<ssize_t>(got, 0)));
  std::string_view extension = rawExtension(head);
  if (extension.empty()) extension = knownExtension(head);
  if (extension.empty()) return name;
  return name.substr(0, name.size() - kUnknown.size()).append(extension);
}

}  // namespace tether
