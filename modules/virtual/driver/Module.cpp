// The loadable module: its one exported function, in front of a model that a folder feeds.
//
// TETHER_VIRTUAL_CAMERAS names the folder (see FolderFeed.h). Without it there is one camera, id 1, "Virtual Camera",
// that makes its own pictures.
#include <atomic>
#include <cstdlib>
#include <mutex>

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
  Plugin() : model() {
    const char* folder = std::getenv("TETHER_VIRTUAL_CAMERAS");
    if (folder != nullptr && *folder != '\0') {
      feed.emplace(model, folder);
      return;
    }
    model.addCamera(1, kName).setMaker([](uint32_t number) { return ownShot(number, kName, false); });
  }

  Model model;
  std::optional<FolderFeed> feed;
};

// Made at the module's first open and never destroyed: the process may end while other threads are still inside, and
// a module that is opened again finds its cameras as they were.
std::atomic<Plugin*> plugin{nullptr};
std::atomic<tagNkMAIDObject*> openModule{nullptr};

Plugin* makePlugin() {
  static std::mutex making;
  const std::lock_guard lock(making);
  if (plugin == nullptr) plugin = new Plugin;
  return plugin;
}

int32_t call(tagNkMAIDObject* object, uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
             NkMAIDCompletionProc* completion, void* reference) {
  const bool opensModule = object == nullptr && command == kNkMAIDCommand_Open;
  Plugin* made = opensModule ? makePlugin() : plugin.load();
  // The folder is looked at before the cameras are first listed, then in the module's polls.
  const bool pollsModule = object != nullptr && command == kNkMAIDCommand_Async && object == openModule;
  if (made != nullptr && made->feed && (opensModule || pollsModule)) made->feed->look();
  const int32_t result = entryPoint(object, command, parameter, dataType, data, completion, reference);
  if (opensModule && result == kNkMAIDResult_NoError) openModule = reinterpret_cast<tagNkMAIDObject*>(data);
  return result;
}

}  // namespace
}  // namespace virtualcamera

extern "C" TETHER_EXPORT int32_t MAIDEntryPoint(tagNkMAIDObject* object, uint32_t command, uint32_t parameter,
                                                uint32_t dataType, uint64_t data, NkMAIDCompletionProc* completion,
                                                void* reference) {
  try {
    return virtualcamera::call(object, command, parameter, dataType, data, completion, reference);
  } catch (...) {  // making the model ran out of memory
    return kNkMAIDResult_OutOfMemory;
  }
}
