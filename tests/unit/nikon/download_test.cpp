// The download thread: its queue, callbacks carried to it, and cameras that go meanwhile.

#include <future>

#include "CompletionRecords.h"
#include "ContentContainer.h"
#include "NikonThreadedObject.h"
#include "ServiceTest.h"

namespace {

using namespace std::chrono_literals;
using virtualcamera::Level;
using virtualcamera::Picture;

// A download thread of the test's own.
class DownloadThreadTest : public ServiceTest {
 protected:
  DownloadThreadTest() {
    thread->start();
    loop = thread->runLoop();
    root = std::make_unique<SpyObject>(virtualcamera::Model::entryPoint());
  }
  ~DownloadThreadTest() override {
    root.reset();
    thread->cancel();
    thread->join();
  }

  // Answers from wherever it runs.
  class Carried : public CNikonThreadedObject {
   public:
    Carried(CNikonObject* parentObject, std::int32_t id)
        : CNikonThreadedObject(parentObject, static_cast<unsigned>(id), "carried") {
      parentObject->addChild(id, this);
      openGate();
    }
    ~Carried() override { closeGate(); }
    std::int32_t dataCallback_thread(void*, void*) override {
      thread = std::this_thread::get_id();
      return 5;
    }
    void eventNotification_thread(std::int32_t event, void*) override {
      thread = std::this_thread::get_id();
      lastEvent = event;
    }
    void completionCallback_thread(std::int32_t command, std::int32_t result, void* context) override {
      thread = std::this_thread::get_id();
      lastEvent = command + result;
      EXPECT_EQ(context, this);
    }
    void* reference() { return static_cast<CNikonCallbackReceiver*>(this); }
    std::thread::id thread;
    std::int32_t lastEvent = -1;
  };

  NikonDownloadThread downloads;
  std::shared_ptr<platform::Thread> thread = platform::Thread::make([this] { downloads.threadMain(); });
  std::shared_ptr<platform::RunLoop> loop;
  virtualcamera::Camera& camera = model.addCamera(1, "One");
  std::unique_ptr<SpyObject> root;
};

TEST_F(DownloadThreadTest, CallbacksAreCarriedToItOnceTheObjectBelongsToIt) {
  auto* const object = new Carried(root.get(), 1);
  EXPECT_EQ(MAIDDataHandler(object->reference(), nullptr, nullptr), 5);
  EXPECT_EQ(object->thread, std::this_thread::get_id());

  object->setDownloadThread(&downloads);
  EXPECT_EQ(MAIDDataHandler(object->reference(), nullptr, nullptr), 1);
  EXPECT_NE(object->thread, std::this_thread::get_id());
  MAIDEventHandler(object->reference(), 4, 0);
  EXPECT_EQ(object->lastEvent, 4);
  EXPECT_EQ(recorder.traced("Event Notification"), 0U);
  object->thread = {};
  std::atomic<std::uint32_t> counter{0};
  CommandCompletionProc(nullptr, kNkMAIDCommand_CapStart, 0, 0, 0, addCompletionRecord({object, object, &counter}),
                        100);
  EXPECT_EQ(object->lastEvent, kNkMAIDCommand_CapStart + 100);
  EXPECT_TRUE(object->thread != std::thread::id() && object->thread != std::this_thread::get_id());
  EXPECT_EQ(counter, 1U);
  loop->perform([&] { EXPECT_EQ(MAIDDataHandler(object->reference(), nullptr, nullptr), 5); });
  // It may be in a call into a module that waits for the callback.
  loop->perform([&] { std::async(std::launch::async, [&] { MAIDEventHandler(object->reference(), 6, 0); }).get(); });
  EXPECT_EQ(object->lastEvent, 6);
  // Or it may be waiting for the lock.
  const std::lock_guard access(getAsyncLock());
  EXPECT_EQ(MAIDDataHandler(object->reference(), nullptr, nullptr), 1);
  EXPECT_EQ(object->thread, std::this_thread::get_id());
}

TEST_F(DownloadThreadTest, ACallbackOnItsWayWhenTheObjectIsDeletedThereFindsNothing) {
  auto* const object = new Carried(root.get(), 1);
  object->setDownloadThread(&downloads);
  std::promise<void> mayGoOn;
  ASSERT_TRUE(loop->post([&] {
    mayGoOn.get_future().wait();
    delete object;  // the delivering thread is waiting for this one
  }));
  std::promise<void> started;
  auto deliverer = std::async(std::launch::async, [&started, reference = object->reference()] {
    started.set_value();
    return MAIDDataHandler(reference, nullptr, nullptr);
  });
  started.get_future().wait();
  mayGoOn.set_value();
  EXPECT_EQ(deliverer.get(), 0);
}

TEST_F(DownloadThreadTest, AnItemIsDeletedWithItsWrapperAndAWrapperEmptiedWithItsItem) {
  camera.shoot(Picture::jpeg(bytes(5)));
  CNikonObject* const device = root->openChild(1, "camera");
  {
    const auto wrapper = ContentContainerWrapper::wrapperForContentContainer(new CContentContainer(device, 1, 1));
    EXPECT_EQ(model.openObjects(), 4U);
  }
  EXPECT_EQ(model.openObjects(), 2U);
  const auto wrapper = ContentContainerWrapper::wrapperForContentContainer(new CContentContainer(device, 1, 1));
  delete device;
  EXPECT_EQ(wrapper->contentContainer(), nullptr);
  loop->perform([&] { downloads.addToDownloadQueue(wrapper); });  // skipped
}

TEST_F(ServiceTest, ACameraThatIsJudgedGoneFinishesItsTransfersFirstAndHoldsNobodyUp) {
  auto& camera = model.addCamera(1, "One");
  camera.setTransfer({.deliveryBytes = 10, .bytesPerSecond = 1});
  start();
  for (int shot = 0; shot < 2; ++shot) camera.shoot(Picture::jpeg(bytes(300, shot)));
  idleUntil("objectWasAdded");
  camera.setAlive(false);
  service->doCameraScanOnIdle();
  idle();
  EXPECT_EQ(recorder.names(), "deviceAdded objectWasAdded deviceRemoved");
  camera.setTransfer({});
  idleUntil([&] { return model.openObjects() == 1U; });
  EXPECT_EQ(read(recorder.await("fileDownloadComplete", 2).strings.at("file_path")), bytes(300, 1));
}

// In polls of the main thread, and from a thread of the module.
TEST_F(ServiceTest, DeliveriesArriveWholeWhicheverThreadBringsThem) {
  auto& camera = model.addCamera(1, "One");
  camera.setTransfer({.deliveryBytes = 10, .inModulePolls = true});
  start();
  for (int shot = 1; shot <= 40; ++shot) {
    camera.shoot(Picture::jpeg(bytes(995, shot)));
    if (shot == 20) idleUntil("fileDownloadComplete", 20);
    if (shot == 20) model.faults().add({.level = Level::Data, .command = kNkMAIDCommand_CapStart, .ownThread = true});
  }
  idleUntil("fileDownloadComplete", 40);
  for (std::size_t n = 1; n <= 40; ++n) {
    const Message complete = recorder.await("fileDownloadComplete", n);
    EXPECT_EQ(read(complete.strings.at("file_path")), bytes(995, static_cast<int>(n)));
  }
}

// A module may take seconds for a poll: on the main thread, while a picture comes in on the other; then there.
TEST_F(ServiceTest, APollThatDoesNotReturnHoldsUpItsOwnThreadOnly) {
  model.addCamera(1, "One").setTransfer({.deliveryBytes = 100, .pollsPerDelivery = 10});
  start();
  model.camera(1)->shoot(Picture::jpeg(bytes(10000)));
  idleUntil("objectWasAdded");
  model.faults().add({.level = Level::Module, .command = kNkMAIDCommand_Async, .times = 1, .delay = 1h});
  auto release = std::async(std::launch::async, [this] {
    recorder.await("fileDownloadComplete");
    model.faults().release();
  });
  idle();
  release.get();

  model.faults().add({.level = Level::Data, .command = kNkMAIDCommand_Async, .skip = 15, .times = 1, .delay = 1h});
  model.camera(1)->shoot(Picture::jpeg(bytes(1000)));
  idleUntil("objectWasAdded", 2);
  model.addCamera(2, "Two");
  idleUntil("deviceAdded", 2);
  connect(7, 2);
  askSettings(8, kModuleId | 2);  // not to be had during a transfer
  EXPECT_NE(recorder.names().find("ok#7"), std::string::npos);
  EXPECT_EQ(recorder.names().find("#8"), std::string::npos);
  model.faults().release();
  EXPECT_EQ(read(idleUntil("fileDownloadComplete", 2).strings.at("file_path")), bytes(1000));
}

TEST_F(ServiceTest, TheEndOfTheServiceWaitsForTheTransferAndGivesTheQueueUp) {
  auto& camera = model.addCamera(1, "One");
  camera.setTransfer({.deliveryBytes = 1000, .pollsPerDelivery = 10});
  start();
  for (int shot = 0; shot < 3; ++shot) camera.shoot(Picture::jpeg(bytes(200000)));
  idleUntil("objectWasAdded");
  service.reset();
  EXPECT_EQ(model.openObjects(), 0U);
  const auto sent = recorder.messages();
  ASSERT_GE(sent.size(), 3U);
  EXPECT_EQ(sent.back().name, "fileDownloadComplete") << "what had begun was brought to its end";
}

}  // namespace
