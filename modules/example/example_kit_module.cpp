// A camera module in C++, on the kit: one camera, two settings, and a shutter that takes a tenth of a second.
#include <chrono>
#include <memory>
#include <thread>

#include "CameraKit.h"

namespace {

using camerakit::Capability;

class ExampleCamera final : public camerakit::Camera, public std::enable_shared_from_this<ExampleCamera> {
 public:
  explicit ExampleCamera(const camerakit::Model& model) : Camera(model, 1, "Example") {
    set(Capability::packedStrings(kNkMAIDCapability_Aperture, {"f/4", "f/5.6"}, 1));
    set(Capability::unsignedInteger(kNkMAIDCapability_SaveMedia, 1));
  }

 private:
  // Whatever takes time is done on a thread of the module's own.
  int32_t fire(const camerakit::Exposure& exposure) override {
    std::thread([self = shared_from_this(), exposure] {
      std::this_thread::sleep_for(std::chrono::milliseconds(100));
      self->add({camerakit::Picture::jpeg(std::vector<uint8_t>(1000, 'x'))});
      exposure.end();
    }).detach();
    return kNkMAIDResult_Pending;
  }
  int32_t change(uint32_t /*capability*/, uint32_t value) override {
    return value <= 1 ? kNkMAIDResult_NoError : kNkMAIDResult_ValueOutOfBounds;
  }
};

camerakit::Model* makeModel() {
  auto* const model = new camerakit::Model({.name = "Example"});  // lives as long as the process
  model->plug(std::make_shared<ExampleCamera>(*model));
  return model;
}

}  // namespace

extern "C" __attribute__((visibility("default"))) int32_t MAIDEntryPoint(tagNkMAIDObject* object, uint32_t command,
                                                                         uint32_t parameter, uint32_t dataType,
                                                                         uint64_t data,
                                                                         NkMAIDCompletionProc* completion,
                                                                         void* reference) {
  static camerakit::Model* const model = makeModel();
  static_cast<void>(model);
  return camerakit::entryPoint(object, command, parameter, dataType, data, completion, reference);
}
