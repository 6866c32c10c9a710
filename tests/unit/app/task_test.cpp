// The task's cadences and its busy flag. Nothing here waits: what is to happen later is called by hand.
#include "TetherTask.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include "Files.h"
#include "FrameWriter.h"
#include "VirtualCamera.h"

using platform::RunLoop;
using platform::Seconds;
using platform::Timer;

namespace {

struct Later {
  double seconds = 0;
  RunLoop::Call call;
};
const auto mainThread = std::this_thread::get_id();
Later once, repeating, after;  // the last that the main thread asked for

bool takes(Later& later, Seconds seconds, const RunLoop::Call& call) {
  if (std::this_thread::get_id() != mainThread) return false;
  later = {seconds.count(), call};
  return true;
}

}  // namespace

// What the forwarding module calls; and the platform's timers, under the names that the linker knows them by.
extern "C" {
__attribute__((visibility("default"))) std::int32_t testEntryPoint(tagNkMAIDObject* object, std::uint32_t command,
                                                                   std::uint32_t parameter, std::uint32_t dataType,
                                                                   std::uint64_t data, NkMAIDCompletionProc* completion,
                                                                   void* reference) {
  return virtualcamera::entryPoint(object, command, parameter, dataType, data, completion, reference);
}
Timer REAL_REPEATING(Seconds interval, RunLoop::Call call);
Timer ONCE(Seconds delay, RunLoop::Call call) {
  takes(once, delay, call);
  return {};
}
Timer REPEATING(Seconds interval, RunLoop::Call call) {
  return takes(repeating, interval, call) ? Timer() : REAL_REPEATING(interval, std::move(call));
}
void AFTER(RunLoop*, Seconds delay, RunLoop::Call call) { takes(after, delay, call); }
}

namespace {

class Task : public testing::Test {
 protected:
  Task() {
    setenv("TMPDIR", folder.path().c_str(), 1);
    int ends[2];
    EXPECT_EQ(pipe(ends), 0);
    dup2(ends[0], STDIN_FILENO);
    input = ends[1];
    model.addCamera(1, "One");
    model.beforeCall([this](const virtualcamera::Call& call) {
      if (call.target.level == virtualcamera::Level::Module) polls += call.command == kNkMAIDCommand_Async ? 1 : 0;
      if (call.parameter == kNkMAIDCapability_Capture) shots += call.command == kNkMAIDCommand_CapStart ? 1 : 0;
    });
    testing::internal::CaptureStdout();
    task.awakeFromNib();
  }
  // A request on its way; answers what the helper has written until it was carried out.
  std::string request(const std::string& name) {
    after = {};
    KtLuaTETable device;
    device.Set("device_id", new KtLuaTENumber(0x301));
    const std::string bytes = encodeFrame(7, name, &device);
    EXPECT_EQ(write(input, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    while (!after.call) RunLoop::current()->runOnce(platform::Clock::now() + std::chrono::seconds(5));
    EXPECT_EQ(after.seconds, 0.1) << "a request is carried out so much later";
    after.call();
    const std::string written = testing::internal::GetCapturedStdout();
    testing::internal::CaptureStdout();
    return written;
  }
  ~Task() override {
    const std::string written = testing::internal::GetCapturedStdout();
    if (HasFailure()) std::fputs(written.c_str(), stderr);
  }

  const testkit::Folder folder;
  int input = -1;
  int polls = 0, shots = 0;
  virtualcamera::Model model;
  TetherTask task;
};

TEST_F(Task, BeatsEveryTwoSecondsAndIsIdleOneSecondAfterItsStartAndThenTenTimesASecondButNotWhileBusy) {
  EXPECT_EQ(repeating.seconds, 2.0);
  EXPECT_EQ(once.seconds, 1.0);
  for (int tick = 1; tick <= 3; ++tick) {
    const auto call = std::exchange(once, {}).call;
    const std::unique_ptr<TetherTaskStatus> busy(tick == 2 ? new TetherTaskStatus : nullptr);
    call();
    EXPECT_EQ(polls, tick == 1 ? 1 : tick - 1);
    EXPECT_EQ(once.seconds, 0.1) << "the next one is always asked for";
  }
  EXPECT_FALSE(TetherTaskStatus::IsInProgress());
  repeating.call();
  EXPECT_NE(request("listDevices").find("heartbeat"), std::string::npos);
}

TEST_F(Task, DropsShotsAndSettingsRequestsWhileBusyAndNothingElse) {
  {
    const TetherTaskStatus busy;
    EXPECT_NE(request("connectDevice").find("ok"), std::string::npos);
    EXPECT_EQ(request("getCameraSettings"), "");
    request("doCapture");
    EXPECT_EQ(shots, 0);
  }
  EXPECT_NE(request("getCameraSettings").find("isoSpeed"), std::string::npos);
  request("doCapture");
  EXPECT_EQ(shots, 1);
  EXPECT_FALSE(TetherTaskStatus::IsInProgress());
}

}  // namespace
