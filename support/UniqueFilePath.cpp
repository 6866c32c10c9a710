#include "UniqueFilePath.h"

#include "FileManager.h"

namespace {

// The unnumbered name counts as the first.
constexpr long kFirstNumber = 2;
constexpr long kEndOfNumbers = 99999;

}  // namespace

std::string KtFileUtils_ensureFileNameIsUnique(const std::string& path) {
  if (!platform::FileManager::exists(path)) return path;

  const std::string_view directory = platform::deletingLastPathComponent(path);
  const std::string_view name = platform::lastPathComponent(path);
  const std::string_view extension = platform::pathExtension(name);
  const std::string base(platform::deletingPathExtension(name));
  std::string candidate;
  for (long number = kFirstNumber; number < kEndOfNumbers; ++number) {
    candidate = platform::appendingPathComponent(directory, base + '-' + std::to_string(number));
    if (!extension.empty()) candidate.append(1, '.').append(extension);
    if (!platform::FileManager::exists(candidate)) break;
  }
  return candidate;
}

// NOLINTNEXTLINE(performance-unnecessary-value-param): the signature is given
std::string MakeUniqueFilePath(std::string& directory, std::string name) {
  return KtFileUtils_ensureFileNameIsUnique(platform::appendingPathComponent(directory, name));
}
