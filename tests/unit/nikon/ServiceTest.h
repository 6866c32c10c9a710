// A tether service with one module, "Type0003Module", behind which the virtual camera's model stands. One in a process:
// each case runs in its own.
#pragma once

#include <gtest/gtest.h>

#include <fstream>
#include <memory>
#include <string>

#include "NikonTetherService.h"
#include "Recorder.h"
#include "RunLoop.h"

class ServiceTest : public ::testing::Test {
 protected:
  static constexpr int kModuleId = 0x300;

  ServiceTest();
  ~ServiceTest() override;

  // Makes the service and announces the cameras, as the task does at start-up.
  void start();
  // Idle passes until the n-th message of that name has come.
  Message idleUntil(const std::string& name, std::size_t n = 1);
  void idleUntil(const std::function<bool()>& condition);
  void idle() { service->idle(); }

  // A request's payload with this device id.
  static std::unique_ptr<KtLuaTETable> device(double deviceId);
  void connect(int messageId, int cameraId) { service->connectDevice(messageId, device(kModuleId | cameraId).get()); }
  void askSettings(int messageId, double deviceId) { service->getCameraSettings(messageId, device(deviceId).get()); }

  static std::vector<std::uint8_t> bytes(std::size_t size, int seed = 1);
  static std::vector<std::uint8_t> read(const std::string& path);
  std::vector<std::string> files() const;

  Recorder recorder;
  std::string folder;  // the temporary directory
  virtualcamera::Model model;
  std::unique_ptr<NikonTetherService> service;
};
