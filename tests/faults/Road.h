// A helper's life from its start to its shutdown, with two cameras, and what must hold of it whatever goes wrong.
#pragma once

#include <condition_variable>
#include <functional>
#include <memory>
#include <set>

#include "LyingModule.h"
#include "NikonTetherService.h"
#include "Recorder.h"

enum class Course {
  kShooting,    // connect, settings, a shot, a pair, pictures of the other camera, another connect
  kUnplugging,  // a camera goes with a picture in transfer and two queued
  kShutdown     // comes with a picture in transfer and two queued
};

// One in a process.
class Road {
 public:
  Road(const std::string& folder, Course course, std::optional<Place> place, Way way);
  // Fails the test where something does not hold.
  void run();

  virtualcamera::Model model;
  LyingModule module;

 private:
  using Operation = void (NikonTetherService::*)(int, KtLuaTE*);

  void shooting();
  void unplugging();
  void leaveQueued();
  void expectUnhurtCamerasToWork();
  void verify();
  std::string history();  // for people

  void idle();
  void idleUntil(const std::function<bool()>& condition);  // which is looked at under the lock
  std::shared_ptr<bool> queueFence();                      // true once what was queued before it has been dealt with
  void settle();                                           // everything that was queued has been dealt with
  void plugIn(std::uint32_t camera);
  void request(Operation operation, std::uint32_t camera, bool answered = true);
  virtualcamera::Picture picture(std::uint32_t fileDataType = kNkMAIDFileDataType_JPEG);
  void shoot(std::uint32_t camera, bool pair = false);
  bool isHurt(std::uint32_t camera) const;
  bool liesAboutAPicture() const;
  std::vector<std::vector<std::uint8_t>> completeFiles();

  void beforeCall(const Place& at);
  // Until the place is reached, or it will not be.
  void holdUpAt(const Place& at);
  void goOn();

  const std::string _folder;
  const Course _course;
  const std::optional<Place> _place;
  const Way _way;
  Recorder _recorder;
  std::unique_ptr<NikonTetherService> _service;
  std::unique_ptr<CNikonObject> _elsewhere;  // what the fences hang on
  std::vector<std::vector<std::uint8_t>> _sent;
  std::set<long> _asked;
  int _lastRequest = 0;

  std::mutex _plugLock;  // held while a camera is used, so that it stays

  std::mutex _lock;
  std::condition_variable _changed;
  std::optional<Place> _holdUpAt;
  bool _heldUp = false;
};
