#include "Card.h"

#include <algorithm>
#include <map>
#include <string>

namespace gphoto2camera {
namespace {

using Names = std::vector<std::string>;

const char* const kPictures = "DCIM";

std::string inside(const std::string& folder, const std::string& name) {
  return folder + (folder.ends_with('/') ? "" : "/") + name;
}

bool holds(const Names& names, const std::string& name) {
  return std::find(names.begin(), names.end(), name) != names.end();
}

// The folders that hold folders of pictures, one of each storage, and those that hold pictures themselves.
int findParents(Device& device, Names& parents, Names& plain) {
  const std::string root = "/";
  Names storages;
  if (const int result = device.list(root, true, storages); result != GP_OK) return result;
  plain.push_back(root);
  if (holds(storages, kPictures)) {
    parents.push_back(inside(root, kPictures));
    return GP_OK;
  }
  for (const std::string& storage : storages) {
    Names folders;
    if (const int result = device.list(root + storage, true, folders); result != GP_OK) return result;
    if (holds(folders, kPictures))
      parents.push_back(inside(root + storage, kPictures));
    else
      plain.push_back(root + storage);
  }
  return GP_OK;
}

// Its files, by name, with what the camera says of them.
int filesIn(Device& device, const std::string& folder, std::vector<File>& files) {
  Names names;
  if (const int result = device.list(folder, false, names); result != GP_OK) return result;
  std::sort(names.begin(), names.end());
  for (std::string& name : names) {
    File file{.folder = folder, .name = std::move(name)};
    if (device.describe(file) == GP_OK) files.push_back(std::move(file));
  }
  return GP_OK;
}

class Looking {
 public:
  Looking(Device& device, Memory& memory, std::vector<File>& added)
      : _device(device), _memory(memory), _added(added), _isKnown(memory.knowsCamera()) {}

  int parent(const std::string& parent) {
    Names folders;
    if (const int result = _device.list(parent, true, folders); result != GP_OK) return result;
    std::sort(folders.begin(), folders.end());
    const std::optional<std::string> newest = _memory.newestFolder(parent);
    for (const std::string& name : folders) {
      const bool isNewer = newest && name >= *newest;
      if (!isNewer && name != folders.back()) continue;
      if (const int result = folder(inside(parent, name), newest.has_value()); result != GP_OK) return result;
    }
    _memory.setNewestFolder(parent, folders.empty() ? std::string() : folders.back());
    return GP_OK;
  }

  int plain(const std::string& name) {
    const bool wasHere = _memory.newestFolder(name).has_value();
    const int result = folder(name, wasHere);
    if (result == GP_OK) _memory.setNewestFolder(name, name);
    return result;
  }

 private:
  // A card that was not there before holds nothing new.
  int folder(const std::string& name, bool wasHere) {
    std::vector<File> files;
    if (const int result = filesIn(_device, name, files); result != GP_OK) return result;
    for (File& file : files) {
      if (_memory.knows(file)) continue;
      if (_isKnown && wasHere)
        _added.push_back(std::move(file));
      else
        _memory.see(file);
    }
    return GP_OK;
  }

  Device& _device;
  Memory& _memory;
  std::vector<File>& _added;
  const bool _isKnown;
};

}  // namespace

int look(Device& device, Memory& memory, std::vector<File>& added) {
  Names parents, plain;
  if (const int result = findParents(device, parents, plain); result != GP_OK) return result;
  Looking looking(device, memory, added);
  for (const std::string& parent : parents)
    if (const int result = looking.parent(parent); result != GP_OK) return result;
  for (const std::string& name : plain)
    if (const int result = looking.plain(name); result != GP_OK) return result;
  memory.save();
  return GP_OK;
}

}  // namespace gphoto2camera
