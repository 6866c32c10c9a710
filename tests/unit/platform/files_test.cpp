#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <thread>

#include "Bundle.h"
#include "FileHandle.h"
#include "FileManager.h"
#include "Log.h"
#include "MemoryBlock.h"
#include "NotificationCenter.h"

namespace {

using namespace std::chrono_literals;
using platform::Clock;
using platform::FileHandle;
using platform::FileManager;
using platform::MemoryBlock;
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

TEST(FileHandle, ABackgroundReadReportsWhatThereIsAndThenTheEnd) {
  Pipe pipe;
  std::vector<std::string> chunks;
  auto observer = platform::NotificationCenter::defaultCenter().addObserver(
      std::string(platform::kFileHandleReadCompletionNotification), pipe.reading.get(), [&](const auto& notification) {
        chunks.emplace_back(notification.data->bytes(), notification.data->length());
        if (!chunks.back().empty()) pipe.reading->readInBackgroundAndNotify();
      });
  pipe.reading->readInBackgroundAndNotify();
  EXPECT_EQ(pipe.writing->write("one", 3), 0);
  while (chunks.empty()) RunLoop::current()->runOnce(Clock::now() + 1s);
  EXPECT_EQ(pipe.writing->write("two", 3), 0);
  pipe.writing.reset();
  while (chunks.size() < 3) RunLoop::current()->runOnce(Clock::now() + 1s);
  EXPECT_EQ(chunks, (std::vector<std::string>{"one", "two", ""}));
}

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

TEST_F(InFolder, RoomIsKeptWithoutChangingTheSizeAndItsLackIsTold) {
  const std::string path = folder + "/file";
  const int file = open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
  EXPECT_EQ(FileManager::reserve(file, 1U << 20), 0);
  EXPECT_NE(FileManager::reserve(file, std::uint64_t{1} << 60), 0);
  EXPECT_EQ(std::filesystem::file_size(path), 0U);
  close(file);
}

TEST(MemoryBlock, IsZeroAndMoves) {
  for (const std::size_t size : {std::size_t{100}, std::size_t{5} << 20}) {
    MemoryBlock block(size);
    EXPECT_TRUE(std::all_of(block.data(), block.data() + size, [](char byte) { return byte == 0; }));
    block.data()[size - 1] = 'x';
    const MemoryBlock moved = std::move(block);
    EXPECT_EQ(moved.data()[moved.size() - 1], 'x');
  }
  EXPECT_EQ(MemoryBlock(SIZE_MAX / 2).data(), nullptr);
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
