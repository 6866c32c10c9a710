#include "File.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <string_view>

#include "MAID.h"

namespace gphoto2camera {
namespace {

constexpr uint32_t kOtherData = 0;

constexpr std::array<std::string_view, 27> kRaw{"3fr", "arw", "cr2", "cr3", "crw", "dcr", "dng", "erf", "fff",
                                                "gpr", "iiq", "kdc", "mef", "mos", "mrw", "nef", "nrw", "orf",
                                                "ori", "pef", "raf", "raw", "rw2", "rwl", "sr2", "srw", "x3f"};
constexpr std::array<std::string_view, 9> kPictures{"avif", "bmp", "heic", "heif", "hif", "jpeg", "jpg", "tif", "tiff"};

std::string extensionOf(const std::string& name) {
  const size_t dot = name.rfind('.');
  std::string extension = dot == std::string::npos ? std::string() : name.substr(dot + 1);
  for (char& letter : extension) letter = static_cast<char>(std::tolower(static_cast<unsigned char>(letter)));
  return extension;
}

}  // namespace

std::string File::base() const { return folder + "/" + name.substr(0, name.rfind('.')); }

File::Kind File::kind() const {
  const std::string extension = extensionOf(name);
  if (std::find(kRaw.begin(), kRaw.end(), extension) != kRaw.end()) return Kind::Raw;
  return std::find(kPictures.begin(), kPictures.end(), extension) != kPictures.end() ? Kind::Picture : Kind::Other;
}

uint32_t File::dataType() const {
  const std::string extension = extensionOf(name);
  if (extension == "jpg" || extension == "jpeg") return kNkMAIDFileDataType_JPEG;
  if (extension == "tif" || extension == "tiff") return kNkMAIDFileDataType_TIFF;
  return extension == "nef" ? uint32_t{kNkMAIDFileDataType_NEF} : kOtherData;
}

}  // namespace gphoto2camera
