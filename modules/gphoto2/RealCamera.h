// A camera as the kit sees it. What the helper asks of it is handed on to its thread.
#pragma once

#include <memory>
#include <string>

#include "CameraKit.h"
#include "Memory.h"
#include "Shutter.h"
#include "Transfer.h"

namespace gphoto2camera {

class RealCamera final : public camerakit::Camera {
 public:
  RealCamera(const camerakit::Model& model, uint32_t id, const std::string& name, std::shared_ptr<Shutter> shutter,
             std::shared_ptr<Memory> memory)
      : Camera(model, id, name), _shutter(std::move(shutter)), _memory(std::move(memory)) {
    setTransfer({.deliveryBytes = static_cast<uint32_t>(kPieceBytes)});
  }

  // Before a poll of the camera.
  void poll() const { _shutter->poll(); }

 private:
  int32_t fire(const camerakit::Exposure& exposure) override {
    _shutter->fire(exposure);
    return kNkMAIDResult_Pending;
  }
  void transferred(uint32_t /*item*/, const camerakit::Picture& picture, int32_t result) override {
    const auto* source = dynamic_cast<const RemotePicture*>(picture.source.get());
    if (source == nullptr) return;
    if (result == kNkMAIDResult_NoError) _memory->finish(source->transfer()->file());
    source->transfer()->end();
  }

  const std::shared_ptr<Shutter> _shutter;
  const std::shared_ptr<Memory> _memory;
};

}  // namespace gphoto2camera
