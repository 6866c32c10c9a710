#include "Bundle.h"

#include <dlfcn.h>

#include "FileManager.h"
#include "Log.h"

namespace platform {
namespace {

const std::string kPlatformFolder = TETHER_BUNDLE_PLATFORM;

std::string findMainBundlePath() {
  const std::string executable = executablePath();
  const std::string_view folder = deletingLastPathComponent(executable);
  const std::string_view contents = deletingLastPathComponent(folder);
  if (lastPathComponent(folder) == kPlatformFolder && lastPathComponent(contents) == "Contents") {
    return std::string(deletingLastPathComponent(contents));
  }
  return std::string(folder);
}

}  // namespace

// Found once: it stays where it is, and finding it takes a system call for every folder above it.
std::string Bundle::mainBundlePath() {
  static const auto* const path = new std::string(findMainBundlePath());
  return *path;
}

std::unique_ptr<Bundle> Bundle::create(const std::string& path) {
  const std::string folder = appendingPathComponent(appendingPathComponent(path, "Contents"), kPlatformFolder);
  std::string executable = appendingPathComponent(folder, deletingPathExtension(lastPathComponent(path)));
  if (!FileManager::exists(executable)) {
    const auto names = FileManager::contents(folder);
    if (names.size() != 1) return nullptr;
    executable = appendingPathComponent(folder, names.front());
  }
  return std::unique_ptr<Bundle>(new Bundle(std::move(executable)));
}

Bundle::~Bundle() {
  if (_image != nullptr && !_stays) dlclose(_image);
}

bool Bundle::loadExecutable() {
  if (!libraryFileIsWhole(_executable)) {
    log("Loading %s failed: it is no whole library", _executable.c_str());
    return false;
  }
  _image = dlopen(_executable.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (_image == nullptr) log("Loading %s failed: %s", _executable.c_str(), dlerror());
  return _image != nullptr;
}

void* Bundle::functionPointer(const char* name) const { return _image == nullptr ? nullptr : dlsym(_image, name); }

}  // namespace platform
