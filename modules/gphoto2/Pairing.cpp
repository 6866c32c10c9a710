#include "Pairing.h"

#include <algorithm>
#include <cctype>

namespace gphoto2camera {
namespace {

using std::chrono::milliseconds;
constexpr milliseconds kUnknown{300}, kBoth{2000}, kOne{0};

bool holdsAny(const std::string& text, std::initializer_list<const char*> words) {
  return std::any_of(words.begin(), words.end(),
                     [&](const char* word) { return text.find(word) != std::string::npos; });
}

}  // namespace

void Pairing::setQuality(const std::optional<std::string>& text) {
  _patience = kUnknown;
  if (!text || text->empty() || text->starts_with("Unknown")) return;
  std::string lower = *text;
  for (char& letter : lower) letter = static_cast<char>(std::tolower(static_cast<unsigned char>(letter)));
  const bool raw = holdsAny(lower, {"raw", "nef", "dng", "orf", "rw2"});
  const bool other = holdsAny(lower, {"jp", "+", "hei", "fine", "norm", "basic", "large"});
  _patience = raw && other ? kBoth : kOne;
}

void Pairing::add(File file, Time now) {
  const auto partner = std::find_if(_shots.begin(), _shots.end(), [&](const Waiting& shot) {
    const File& first = shot.files.front();
    const bool together = (first.kind() == File::Kind::Raw) != (file.kind() == File::Kind::Raw);
    return shot.files.size() == 1 && together && first.base() == file.base();
  });
  if (partner != _shots.end())
    partner->files.push_back(std::move(file));
  else
    _shots.push_back({{std::move(file)}, now + _patience});
}

std::vector<File> Pairing::next(Time now) {
  if (_shots.empty() || (_shots.front().files.size() < 2 && now < _shots.front().until)) return {};
  std::vector<File> files = std::move(_shots.front().files);
  _shots.pop_front();
  return files;
}

bool Pairing::holds(const File& file) const {
  return std::any_of(_shots.begin(), _shots.end(), [&](const Waiting& shot) {
    return std::any_of(shot.files.begin(), shot.files.end(),
                       [&](const File& waiting) { return waiting.path() == file.path(); });
  });
}

}  // namespace gphoto2camera
