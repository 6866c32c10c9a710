#include "FolderEvents.h"

namespace virtualcamera {

int FolderEvents::watch(const std::string&) { return -1; }

void FolderEvents::unwatch(int) {}

std::optional<std::vector<FolderEvent>> FolderEvents::take(int) { return std::nullopt; }

}  // namespace virtualcamera
