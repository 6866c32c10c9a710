#include "Application.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <csignal>
#include <thread>

#include "FileHandle.h"
#include "NotificationCenter.h"
#include "RunLoop.h"

namespace {

using namespace std::chrono_literals;
using platform::Application;
using platform::RunLoop;

// Runs `load` as an application in a child whose output comes back through a pipe.
class ChildApplication {
 public:
  explicit ChildApplication(const std::function<void()>& load) {
    std::array<int, 2> ends{};
    EXPECT_EQ(pipe(ends.data()), 0);
    _child = fork();
    if (_child == 0) {
      dup2(ends[1], STDOUT_FILENO);
      close(ends[0]);
      close(ends[1]);
      platform::applicationMain(0, nullptr, [&] {
        load();
        return std::make_shared<int>(0);
      });
      _exit(99);
    }
    close(ends[1]);
    _output = ends[0];
  }
  ~ChildApplication() { close(_output); }

  pid_t pid() const { return _child; }
  char readByte() const {
    char byte = 0;
    return read(_output, &byte, 1) == 1 ? byte : '\0';
  }
  std::string readAll() const {
    std::string all;
    std::array<char, 4096> chunk{};
    for (ssize_t count = 0; (count = read(_output, chunk.data(), chunk.size())) > 0;) {
      all.append(chunk.data(), static_cast<std::size_t>(count));
    }
    return all;
  }
  int status() const {
    int status = 0;
    EXPECT_EQ(waitpid(_child, &status, 0), _child);
    return status;
  }

 private:
  pid_t _child = 0;
  int _output = -1;
};

void sayWhenTerminating() {
  static auto observer = platform::NotificationCenter::defaultCenter().addObserver(
      std::string(platform::kApplicationWillTerminateNotification), nullptr,
      [](const auto&) { EXPECT_EQ(write(STDOUT_FILENO, "t", 1), 1); });
}

TEST(Application, TerminateDeliversTheNotificationAndEndsWithStatusZero) {
  ChildApplication child([] {
    sayWhenTerminating();
    RunLoop::current()->performAfter(0s, [] { Application::shared().terminate(); });
  });
  EXPECT_EQ(child.readAll(), "t");
  EXPECT_EQ(child.status(), 0);
}

TEST(Application, SignalsEndItTheSameWay) {
  for (const int signal : {SIGTERM, SIGINT}) {
    ChildApplication child([] {
      sayWhenTerminating();
      RunLoop::current()->performAfter(0s, [] { EXPECT_EQ(write(STDOUT_FILENO, "r", 1), 1); });
    });
    EXPECT_EQ(child.readByte(), 'r');
    kill(child.pid(), signal);
    EXPECT_EQ(child.readAll(), "t");
    EXPECT_EQ(child.status(), 0);
  }
}

TEST(Application, TheLastFrameOfAnotherThreadIsWhole) {
  constexpr std::size_t kFrame = 300000;  // more than a pipe holds
  ChildApplication child([] {
    std::thread([] {
      const std::string frame(kFrame, 'f');
      for (;;) platform::FileHandle::standardOutput()->write(frame.data(), frame.size());
    }).detach();
    RunLoop::current()->performAfter(0.05s, [] { Application::shared().terminate(); });
  });
  EXPECT_EQ(child.readAll().size() % kFrame, 0U);
  EXPECT_EQ(child.status(), 0);
}

}  // namespace
