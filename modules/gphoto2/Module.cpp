// The loadable module: its one exported function, in front of a model that the finder fills. It looks for cameras from
// the time the module is opened until it is closed.
#include "CameraKit.h"
#include "Finder.h"
#include "RealCamera.h"

namespace gphoto2camera {
namespace {

class Plugin final : public camerakit::Hooks {
 public:
  std::optional<int32_t> before(camerakit::Call& call) override {
    if (call.command == kNkMAIDCommand_Async && call.target.level == camerakit::Level::Camera) {
      const auto camera = std::dynamic_pointer_cast<RealCamera>(_model.camera(call.target.camera));
      if (camera) camera->poll();
    }
    return std::nullopt;
  }

  void after(camerakit::Call& call) override {
    if (call.target.level != camerakit::Level::Module || call.result != kNkMAIDResult_NoError) return;
    if (call.command == kNkMAIDCommand_Open) _finder.start();
    if (call.command == kNkMAIDCommand_Close) _finder.stop();
  }

 private:
  camerakit::Model _model{{.name = "libgphoto2"}, this};
  Finder _finder{_model};
};

// Never destroyed: the process may end while other threads are still inside.
void makePlugin() {
  static const Plugin* const made = new Plugin;
  static_cast<void>(made);
}

}  // namespace
}  // namespace gphoto2camera

extern "C" __attribute__((visibility("default"))) int32_t MAIDEntryPoint(tagNkMAIDObject* object, uint32_t command,
                                                                         uint32_t parameter, uint32_t dataType,
                                                                         uint64_t data,
                                                                         NkMAIDCompletionProc* completion,
                                                                         void* reference) {
  try {
    if (object == nullptr && command == kNkMAIDCommand_Open) gphoto2camera::makePlugin();
    return camerakit::entryPoint(object, command, parameter, dataType, data, completion, reference);
  } catch (...) {  // making the model ran out of memory
    return kNkMAIDResult_OutOfMemory;
  }
}
