// A tether service with one module, "Type0003Module", behind which the virtual camera's model stands. One in a process:
// each case runs in its own.
#pragma once

#include <gtest/gtest.h>

#include "FileManager.h"
#include "Files.h"
#include "NikonTetherService.h"
#include "Recorder.h"
#include "RunLoop.h"

class ServiceTest : public ::testing::Test {
 protected:
  static constexpr int kModuleId = 0x300;

  ServiceTest() { setenv("TMPDIR", temporary.path().c_str(), 1); }
  ~ServiceTest() override {
    service.reset();
    EXPECT_EQ(model.openObjects(), 0U);
  }

  // Makes the service and announces the cameras, as the task does at start-up.
  void start() {
    service.reset(NikonTetherService::getSingleton());
    service->doInitialCameraScan();
  }
  void idle() { service->idle(); }
  void idleUntil(const std::function<bool()>& condition) {
    while (!condition()) {
      idle();
      std::this_thread::yield();
    }
  }
  // Idle passes until the n-th message of that name has come.
  Message idleUntil(const std::string& name, std::size_t n = 1) {
    idleUntil([&] { return recorder.count(name) >= n; });
    return recorder.await(name, n);
  }

  // A request's payload with this device id.
  static std::unique_ptr<KtLuaTETable> device(double deviceId) {
    auto table = std::make_unique<KtLuaTETable>();
    table->Set("device_id", new KtLuaTENumber(deviceId));
    return table;
  }
  void connect(int messageId, int cameraId) { service->connectDevice(messageId, device(kModuleId | cameraId).get()); }
  void askSettings(int messageId, double deviceId) { service->getCameraSettings(messageId, device(deviceId).get()); }

  using Bytes = std::vector<std::uint8_t>;
  static Bytes bytes(std::size_t size, int seed = 1) { return testkit::bytes(size, static_cast<unsigned>(seed)); }
  static Bytes read(const std::string& path) { return testkit::readFile<Bytes>(path); }
  std::vector<std::string> files() const { return platform::FileManager::contents(folder); }

  Recorder recorder;
  const testkit::Folder temporary;
  const std::string folder = temporary.path();
  virtualcamera::Model model;
  std::unique_ptr<NikonTetherService> service;
};
