#include "FolderEvents.h"

namespace virtualcamera {

// What there is tells neither of names nor of writers.
std::unique_ptr<FolderEvents> systemFolderEvents() { return std::make_unique<FolderEvents>(); }

}  // namespace virtualcamera
