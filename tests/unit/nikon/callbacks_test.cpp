#include <gtest/gtest.h>

#include <future>
#include <stdexcept>

#include "CompletionRecords.h"
#include "Recorder.h"

namespace {

using virtualcamera::Model;

class Callbacks : public ::testing::Test {
 protected:
  Callbacks() {
    model.addCamera(1, "Camera");
    root = std::make_unique<SpyObject>(Model::entryPoint());
  }
  ~Callbacks() override { SpyObject::onConstruction = nullptr; }

  Recorder recorder;
  Model model;
  std::unique_ptr<SpyObject> root;
};

TEST_F(Callbacks, ReachTheMostDerivedObjectOrNothingAtAllAndThrowNothingIntoTheSdk) {
  std::int32_t heard = -1;
  root->onEvent = [&](std::int32_t event, void* data) {
    heard = event + static_cast<std::int32_t>(reinterpret_cast<std::uintptr_t>(data));
  };
  root->onData = [](void*, void*) { return 5; };
  MAIDEventHandler(root->reference(), 4, 100);
  EXPECT_EQ(heard, 104);
  EXPECT_EQ(MAIDDataHandler(root->reference(), nullptr, nullptr), 5);
  root->onEvent = [](std::int32_t, void*) { throw std::int32_t{-116}; };
  root->onData = [](void*, void*) -> std::int32_t { throw std::runtime_error("broken"); };
  EXPECT_NO_THROW(MAIDEventHandler(root->reference(), 0, 0));
  EXPECT_EQ(MAIDDataHandler(root->reference(), nullptr, nullptr), 0);
  EXPECT_EQ(recorder.logged("MAIDEventHandler: -116"), 1U);
  EXPECT_EQ(recorder.logged("MAIDDataHandler: broken"), 1U);

  const CNikonObject* const camera = root->openChild(1, "camera");
  auto* const plain = const_cast<CNikonCallbackReceiver*>(static_cast<const CNikonCallbackReceiver*>(camera));
  MAIDEventHandler(plain, 2, 0);
  EXPECT_EQ(recorder.traced("Unhandled event: kNkMAIDEvent_WarmingUp"), 1U);
  EXPECT_EQ(MAIDDataHandler(plain, nullptr, nullptr), 0);
  EXPECT_EQ(recorder.traced("Unhandled data callback"), 1U);

  void* const gone = root->reference();
  root.reset();
  for (void* const reference : {gone, static_cast<void*>(nullptr)}) {
    MAIDEventHandler(reference, 5, 100);
    EXPECT_EQ(MAIDDataHandler(reference, nullptr, nullptr), 0);
  }
  EXPECT_EQ(recorder.traced("Event Notification: "), 1U);
}

TEST_F(Callbacks, AnEventDuringTheOpenWaitsUntilTheObjectIsWhole) {
  std::vector<std::int32_t> heard;
  bool whole = false;
  SpyObject::onConstruction = [&](SpyObject& object) {
    MAIDEventHandler(object.reference(), 0, 7);
    EXPECT_TRUE(heard.empty());
    whole = true;
    object.onEvent = [&](std::int32_t event, void*) {
      EXPECT_TRUE(whole);
      heard.push_back(event);
      if (heard.size() > 1) throw std::int32_t{-116};
      MAIDEventHandler(object.reference(), 1, 8);
    };
  };
  EXPECT_NO_THROW(new SpyObject(root.get(), 1));
  EXPECT_EQ(heard, (std::vector<std::int32_t>{0, 1}));
  EXPECT_EQ(recorder.logged("MAIDEventHandler: -116"), 1U);

  const auto plain = CNikonObject::openModule(Model::entryPoint(), "module");
  MAIDEventHandler(static_cast<CNikonCallbackReceiver*>(plain.get()), 3, 0);
  EXPECT_EQ(recorder.traced("Unhandled event: kNkMAIDEvent_WarmedUp"), 1U);
}

TEST_F(Callbacks, ADeletionWaitsForACallbackInsideOnAnotherThread) {
  std::promise<void> entered;
  std::promise<void> leave;
  std::atomic<bool> left{false};
  root->onEvent = [&](std::int32_t, void*) {
    entered.set_value();
    leave.get_future().wait();
    left = true;
  };
  auto deliverer = std::async(std::launch::async, [&] { MAIDEventHandler(root->reference(), 0, 0); });
  entered.get_future().wait();
  auto releaser = std::async(std::launch::async, [&] { leave.set_value(); });
  root.reset();
  EXPECT_TRUE(left);

  // One that was kept until the object was whole is inside like any other.
  std::promise<void> keptEntered;
  std::promise<void> keptMayLeave;
  const auto gate = CallbackGate::make(this);
  gate->keepForLater([&] {
    keptEntered.set_value();
    keptMayLeave.get_future().wait();
    left = false;
  });
  auto opener = std::async(std::launch::async, [&] { gate->open(); });
  keptEntered.get_future().wait();
  auto keptReleaser = std::async(std::launch::async, [&] { keptMayLeave.set_value(); });
  gate->close();
  EXPECT_FALSE(left);
}

TEST_F(Callbacks, ACompletionCountsOnceAndReachesItsReceiverWithItsContext) {
  std::atomic<std::uint32_t> counter{0};
  int context = 0;
  int calls = 0;
  root->onCompletion = [&](std::int32_t command, std::int32_t result, void* given) {
    EXPECT_EQ(command, kNkMAIDCommand_CapStart);
    EXPECT_EQ(result, -123);
    EXPECT_EQ(given, &context);
    EXPECT_EQ(counter, 1U);
    ++calls;
  };
  void* const reference = addCompletionRecord({root.get(), &context, &counter});
  const auto complete = [](void* record) {
    CommandCompletionProc(nullptr, kNkMAIDCommand_CapStart, 0, 0, 0, record, -123);
  };
  complete(reference);
  complete(reference);  // once more
  complete(nullptr);
  EXPECT_EQ(counter, 1U);
  EXPECT_EQ(calls, 1);

  void* const detached = addCompletionRecord({root.get(), &context, &counter});
  detachCompletionRecord(detached);
  complete(detached);
  void* const orphaned = addCompletionRecord({root.get(), &context, &counter});
  root.reset();
  complete(orphaned);
  EXPECT_EQ(counter, 2U) << "the waiting caller still counts";
  EXPECT_EQ(calls, 1);
}

}  // namespace
