#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <array>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <thread>

#include "Bundle.h"
#include "FileHandle.h"
#include "FileManager.h"
#include "Log.h"
#include "NotificationCenter.h"

namespace {

using namespace std::chrono_literals;
using platform::Clock;
using platform::FileHandle;
using platform::FileManager;
using platform::RunLoop;

struct Pipe {
  Pipe() {
    std::array<int, 2> ends{};
    EXPECT_EQ(pipe(ends.data()), 0);
    reading = std::make_unique<FileHandle>(ends[0]);
    writing = std::make_unique<FileHandle>(ends[1]);
  }
  std::unique_ptr<FileHandle> reading;
  std::unique_ptr<FileHandle> writing;
};

TEST(FileHandle, WritesFromTwoThreadsStayWholeThroughAFullNonBlockingPipeAndFailWhenItIsClosed) {
  Pipe pipe;
  fcntl(pipe.writing->descriptor(), F_SETFL, O_NONBLOCK);
  constexpr std::size_t kLength = 200000;
  const auto send = [&](char letter) {
    const std::string bytes(kLength, letter);
    EXPECT_EQ(pipe.writing->write(bytes.data(), bytes.size()), 0);
  };
  std::thread first(send, 'a');
  std::thread second(send, 'b');
  std::string got;
  std::array<char, 4096> chunk{};
  while (got.size() < 2 * kLength) {
    const ssize_t count = read(pipe.reading->descriptor(), chunk.data(), chunk.size());
    ASSERT_GT(count, 0);
    got.append(chunk.data(), static_cast<std::size_t>(count));
  }
  first.join();
  second.join();
  EXPECT_EQ(got.find_first_not_of(got.front()), kLength);
  std::signal(SIGPIPE, SIG_IGN);
  pipe.reading.reset();
  EXPECT_EQ(pipe.writing->write("x", 1), EPIPE);
}

class InFolder : public ::testing::Test {
 protected:
  ~InFolder() override { std::filesystem::remove_all(folder); }
  std::string pattern = ::testing::TempDir() + "tether-platform-XXXXXX";
  std::string folder = mkdtemp(pattern.data());
};

TEST_F(InFolder, ADanglingLinkIsSomethingAndATemporaryDirectoryThatIsNotThereIsNone) {
  const std::string link = folder + "/link";
  ASSERT_EQ(symlink("/nowhere/at/all", link.c_str()), 0);
  EXPECT_TRUE(FileManager::exists(link));
  EXPECT_TRUE(FileManager::remove(link));
  EXPECT_FALSE(FileManager::exists(link));
  EXPECT_FALSE(FileManager::remove(link));
  setenv("TMPDIR", (folder + "/").c_str(), 1);
  EXPECT_EQ(platform::temporaryDirectory(), folder);
  std::string logged;
  platform::setLogSink([&](const std::string& line) { logged = line; });
  setenv("TMPDIR", (folder + "/missing").c_str(), 1);
  EXPECT_TRUE(FileManager::isDirectory(platform::temporaryDirectory()));
  platform::setLogSink(nullptr);
  EXPECT_NE(logged.find(folder + "/missing cannot be used: No such file or directory; using "), std::string::npos);
}

TEST_F(InFolder, ABundleNeedsAFolderWithAnExecutableThatLoads) {
  using platform::Bundle;
  EXPECT_EQ(Bundle::create(folder + "/Missing.bundle"), nullptr);
  const std::string code = folder + "/Broken.bundle/Contents/" TETHER_BUNDLE_PLATFORM;
  std::filesystem::create_directories(code);
  EXPECT_EQ(Bundle::create(folder + "/Broken.bundle"), nullptr);
  ASSERT_NE(std::fclose(std::fopen((code + "/AnyName").c_str(), "w")), EOF);
  const auto broken = Bundle::create(folder + "/Broken.bundle");
  ASSERT_NE(broken, nullptr);
  EXPECT_FALSE(broken->loadExecutable());
  EXPECT_EQ(broken->functionPointer("MAIDEntryPoint"), nullptr);
  // An executable outside a bundle has its own folder as main bundle.
  EXPECT_EQ(Bundle::mainBundlePath(), std::filesystem::canonical("/proc/self/exe").parent_path().string());
}

}  // namespace
