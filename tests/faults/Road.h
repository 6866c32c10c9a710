// A helper's life from its start to its shutdown, with two cameras, and what must hold of it whatever goes wrong once:
// every call into the camera module, every delivery out of it and every call of the system that a picture's file needs
// is a place, and at one place of a run things go another way.
#pragma once

#include <atomic>
#include <condition_variable>
#include <memory>
#include <set>
#include <thread>
#include <tuple>

#include "FaultyModule.h"
#include "NikonTetherService.h"
#include "Recorder.h"

inline constexpr std::size_t kLargeBlock = 8 << 10;  // so much is a picture's
inline constexpr std::uint32_t kDeliveries = 4;      // of every picture

// What is no command of the SDK's.
enum : std::uint32_t { kDelivery = 1000 };
enum SystemCall : std::uint32_t { kOpen = 2000, kFdopen, kFwrite, kFclose, kReserve, kMemory, kThread };

// The n-th of its kind, so that a place is the same one in every run, whatever the threads are doing.
struct Place {
  virtualcamera::Target target{};
  std::uint32_t command = 0;
  std::uint32_t parameter = 0;
  std::uint32_t nth = 0;

  bool isOfSystem() const { return command >= kOpen; }
  auto kind() const { return std::tuple(target.level, target.camera, target.item, command, parameter); }
  bool operator==(const Place& other) const = default;
};

enum Way : int {
  kRefused,
  kBusy,
  kBufferSize,
  kDoneButRefused,
  kNothingDone,  // but answered as done
  kNonsense,     // the first of as many
  kStormBefore = kNonsense + 7,
  kStormAfter,
  kStormElsewhere,  // on a thread of the module's own, meanwhile
};

enum class Course {
  kShooting,    // connect, settings, a shot, a pair, pictures of the other camera, another connect
  kUnplugging,  // a camera goes with a picture in transfer and two queued
  kShutdown     // comes with a picture in transfer and two queued
};

// One in a process.
class Road {
 public:
  Road(const std::string& folder, Course course, std::optional<Place> place, Way way);
  ~Road();
  // Fails the test where something does not hold.
  void run();
  std::vector<Place> places();  // all of the run
  // What is to go wrong with this call of the system, if anything.
  std::optional<Way> systemCall(SystemCall which);

 private:
  using Operation = void (NikonTetherService::*)(int, KtLuaTE*);

  bool arrive(Place& place);
  testkit::Deed decide(const virtualcamera::Call& call);
  void breakDelivery();
  void storm(bool fromDelivery = false);
  void startStorm();
  void endStorms();

  void shooting();
  void unplugging();
  void leaveQueued();
  void expectUnhurtCamerasToWork();
  bool isHurt(std::uint32_t camera) const;
  void verify();

  void idleUntil(const std::function<bool()>& condition);  // which is looked at under the lock
  std::shared_ptr<bool> queueFence();                      // true once what was queued before it has been dealt with
  void settle();                                           // everything that was queued has been dealt with
  void plugIn(std::uint32_t camera);
  void request(Operation operation, std::uint32_t camera, bool answered = true);
  virtualcamera::Picture picture(std::uint32_t camera, std::uint32_t fileDataType = kNkMAIDFileDataType_JPEG);
  void shoot(std::uint32_t camera, bool pair = false);
  std::vector<std::vector<std::uint8_t>> completeFiles();
  // Until the place is reached, or it will not be; then on.
  void holdUpAt(const Place& at);
  void goOn();

  const std::string _folder;
  const Course _course;
  const std::optional<Place> _place;
  const Way _way;
  Recorder _recorder;
  testkit::Input _nonsense;
  std::unique_ptr<testkit::FaultyModule> _module;
  std::unique_ptr<NikonTetherService> _service;
  std::unique_ptr<CNikonObject> _elsewhere;  // what the fences hang on
  std::vector<std::vector<std::uint8_t>> _sent;
  std::set<long> _asked;
  int _lastRequest = 0;
  // A camera that is to be unplugged, because it will not complete what it said it had started; 0 for none.
  std::atomic<std::uint32_t> _toUnplug{0};
  std::mutex _plugLock;  // held while a camera is used, so that it stays
  std::vector<std::thread> _storms;

  std::mutex _lock;
  std::condition_variable _changed;
  std::optional<Place> _holdUpAt;
  bool _heldUp = false;
  std::atomic<bool> _reached{false};
  std::map<decltype(Place().kind()), std::uint32_t> _counts;
  std::vector<Place> _places;
};

Road* currentRoad();  // null for none
