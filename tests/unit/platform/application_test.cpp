#include "Application.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <thread>

#include "FileHandle.h"
#include "NotificationCenter.h"
#include "RunLoop.h"

namespace {

using namespace std::chrono_literals;
using platform::Application;
using platform::FileHandle;

TEST(Application, TerminateIsNotifiedEndsWithStatusZeroAndLeavesNoHalfFrameOfAnotherThread) {
  constexpr std::size_t kFrame = 300000;  // more than a pipe holds
  std::array<int, 2> ends{};
  ASSERT_EQ(pipe(ends.data()), 0);
  const pid_t child = fork();
  if (child == 0) {
    dup2(ends[1], STDOUT_FILENO);
    close(ends[0]);
    close(ends[1]);
    platform::applicationMain(0, nullptr, [&] {
      static const auto observer = platform::NotificationCenter::defaultCenter().addObserver(
          std::string(platform::kApplicationWillTerminateNotification), nullptr,
          [](const auto&) { FileHandle::standardOutput()->write("t", 1); });
      std::thread([] {
        const std::string frame(kFrame, 'f');
        for (;;) FileHandle::standardOutput()->write(frame.data(), frame.size());
      }).detach();
      platform::RunLoop::current()->performAfter(0.05s, [] { Application::shared().terminate(); });
      return std::make_shared<int>(0);
    });
    _exit(99);
  }
  close(ends[1]);
  std::string all;
  std::array<char, 4096> chunk{};
  for (ssize_t count = 0; (count = read(ends[0], chunk.data(), chunk.size())) > 0;) {
    all.append(chunk.data(), static_cast<std::size_t>(count));
  }
  close(ends[0]);
  EXPECT_EQ(all.size() % kFrame, 1U);
  EXPECT_EQ(all.find('t') % kFrame, 0U);
  int status = -1;
  EXPECT_EQ(waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
}

}  // namespace
