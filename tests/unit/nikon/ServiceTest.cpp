#include "ServiceTest.h"

#include <stdlib.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include "FileManager.h"

// What the forwarding module calls.
extern "C" __attribute__((visibility("default"))) std::int32_t testEntryPoint(
    tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter, std::uint32_t dataType, std::uint64_t data,
    NkMAIDCompletionProc* completion, void* reference) {
  return virtualcamera::entryPoint(object, command, parameter, dataType, data, completion, reference);
}

ServiceTest::ServiceTest() {
  std::string pattern = ::testing::TempDir() + "tether-service-XXXXXX";
  folder = mkdtemp(pattern.data());
  setenv("TMPDIR", folder.c_str(), 1);
}

ServiceTest::~ServiceTest() {
  service.reset();
  EXPECT_EQ(model.openObjects(), 0U);
  std::filesystem::remove_all(folder);
}

void ServiceTest::start() {
  service.reset(NikonTetherService::getSingleton());
  service->doInitialCameraScan();
}

void ServiceTest::idleUntil(const std::function<bool()>& condition) {
  while (!condition()) {
    idle();
    std::this_thread::yield();
  }
}

Message ServiceTest::idleUntil(const std::string& name, std::size_t n) {
  idleUntil([&] {
    std::size_t seen = 0;
    for (const Message& message : recorder.messages()) seen += message.name == name ? 1 : 0;
    return seen >= n;
  });
  return recorder.await(name, n);
}

std::unique_ptr<KtLuaTETable> ServiceTest::device(double deviceId) {
  auto table = std::make_unique<KtLuaTETable>();
  table->Set("device_id", new KtLuaTENumber(deviceId));
  return table;
}

std::vector<std::uint8_t> ServiceTest::bytes(std::size_t size, int seed) {
  std::vector<std::uint8_t> made(size);
  for (std::size_t index = 0; index < size; ++index) made[index] = static_cast<std::uint8_t>(index * 7 + seed);
  return made;
}

std::vector<std::uint8_t> ServiceTest::read(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), {}};
}

std::vector<std::string> ServiceTest::files() const { return platform::FileManager::contents(folder); }
