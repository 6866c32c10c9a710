// The loadable module: its one exported function, in front of a model that a folder feeds.
//
// TETHER_VIRTUAL_CAMERAS names the folder (see FolderFeed.h). Where it is empty there is one camera, id 1, "Virtual
// Camera", that makes its own pictures; where it is not set there is none.
#include <cstdlib>
#include <optional>

#include "FolderFeed.h"
#include "OwnPicture.h"

#if defined(__GNUC__)
#define TETHER_EXPORT __attribute__((visibility("default")))
#else
#define TETHER_EXPORT
#endif

namespace virtualcamera {
namespace {

const char* const kName = "Virtual Camera";

struct Plugin {
  Plugin() {
    const char* folder = std::getenv("TETHER_VIRTUAL_CAMERAS");
    if (folder == nullptr) return;
    if (*folder == '\0') {
      model.addCamera(1, kName).setMaker([](uint32_t number) { return ownShot(number, kName, false); });
      return;
    }
    feed.emplace(model, folder);
    // The folder is looked at before the cameras are first listed, then in the module's polls.
    model.beforeCall([this](const Call& call) {
      const bool looks = call.command == kNkMAIDCommand_Open || call.command == kNkMAIDCommand_Async;
      if (looks && call.target.level == Level::Module) feed->look();
    });
  }

  Model model;
  std::optional<FolderFeed> feed;
};

// Made at the module's first open and never destroyed: the process may end while other threads are still inside, and
// a module that is opened again finds its cameras as they were.
void makePlugin() {
  static const Plugin* const made = new Plugin;
  static_cast<void>(made);
}

}  // namespace
}  // namespace virtualcamera

extern "C" TETHER_EXPORT int32_t MAIDEntryPoint(tagNkMAIDObject* object, uint32_t command, uint32_t parameter,
                                                uint32_t dataType, uint64_t data, NkMAIDCompletionProc* completion,
                                                void* reference) {
  try {
    if (object == nullptr && command == kNkMAIDCommand_Open) virtualcamera::makePlugin();
    return virtualcamera::entryPoint(object, command, parameter, dataType, data, completion, reference);
  } catch (...) {  // making the model ran out of memory
    return kNkMAIDResult_OutOfMemory;
  }
}
