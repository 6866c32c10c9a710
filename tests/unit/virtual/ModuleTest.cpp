// The loadable module: each copy is a module of its own, found by its one symbol.
#include <dlfcn.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>

#include "Client.h"

namespace virtualcamera::test {
namespace {

namespace fs = std::filesystem;

// A copy of the module under a name of its own, so that every test starts with an untouched one. It stays loaded.
NkMAIDEntryPoint* load() {
  static int copies = 0;
  const std::string name = "module-" + std::to_string(getpid()) + "-" + std::to_string(++copies);
  const fs::path copy = fs::path(testing::TempDir()) / name;
  fs::copy_file(VIRTUAL_CAMERA_MODULE, copy, fs::copy_options::overwrite_existing);
  void* module = dlopen(copy.c_str(), RTLD_NOW | RTLD_LOCAL);
  EXPECT_NE(module, nullptr) << dlerror();
  fs::remove(copy);
  return module ? reinterpret_cast<NkMAIDEntryPoint*>(dlsym(module, "MAIDEntryPoint")) : nullptr;
}

TEST(ModuleTest, WithoutAFolderThereIsOneCameraThatMakesItsOwnPictures) {
  unsetenv("TETHER_VIRTUAL_CAMERAS");
  NkMAIDEntryPoint* entry = load();
  ASSERT_NE(entry, nullptr);
  tagNkMAIDObject never{};
  EXPECT_EQ(entry(&never, kNkMAIDCommand_Async, 0, 0, 0, nullptr, nullptr), kNkMAIDResult_MissingComponent);
  Client module(entry, nullptr, 0);
  ASSERT_EQ(module.opened, kNkMAIDResult_NoError);
  EXPECT_EQ(module.children(), (std::vector<uint32_t>{1}));
  Client device(module, 1);
  EXPECT_EQ(device.getString(kNkMAIDCapability_Name), "Virtual Camera");
  device.start(kNkMAIDCapability_Capture);
  ASSERT_EQ(device.finish(), kNkMAIDResult_NoError);
  Opened open(device, static_cast<uint32_t>(device.events.front().second));
  open.data.start(kNkMAIDCapability_Acquire);
  EXPECT_EQ(open.data.finish(), kNkMAIDResult_NoError);
  EXPECT_EQ(open.data.received().size(), open.data.getUnsigned(kNkMAIDCapability_StoredBytes));
}

TEST(ModuleTest, CopiesShareNothingAndAModuleCanBeOpenedAgain) {
  const fs::path root = fs::path(testing::TempDir()) / ("module-cameras-" + std::to_string(getpid()));
  fs::create_directories(root / "7-Seven");
  setenv("TETHER_VIRTUAL_CAMERAS", root.c_str(), 1);
  NkMAIDEntryPoint* one = load();
  NkMAIDEntryPoint* two = load();
  ASSERT_TRUE(one != nullptr && two != nullptr && one != two);
  setenv("TETHER_VIRTUAL_CAMERAS", root.c_str(), 1);
  {
    Client first(one, nullptr, 0);
    unsetenv("TETHER_VIRTUAL_CAMERAS");
    Client second(two, nullptr, 0);
    EXPECT_EQ(first.children(), (std::vector<uint32_t>{7}));
    EXPECT_EQ(second.children(), (std::vector<uint32_t>{1}));
  }
  Client again(one, nullptr, 0);
  fs::remove_all(root);
  const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (again.events.empty() && std::chrono::steady_clock::now() < end) again.poll();
  EXPECT_EQ(again.events, (Client::Events{{kNkMAIDEvent_RemoveChild, 7}}));
}

}  // namespace
}  // namespace virtualcamera::test
