// A module that does wrong once: every call into it, every delivery out of it, and every call of the system that a
// picture's file needs, has a place, and at one place of a run things go another way. Behind it stands the virtual
// camera.
//
// It keeps books of the objects that the camera side was told are open, and fails the test where one is used after its
// close, is closed before its children, or never.
#pragma once

#include <atomic>
#include <deque>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

#include "VirtualCamera.h"

inline constexpr std::uint32_t kPictureBytes = 10'000;  // every picture's
inline constexpr std::size_t kLargeBlock = 8 << 10;     // so much is a picture's

// What is no command of the SDK's.
enum : std::uint32_t { kDelivery = 1000 };
enum SystemCall : std::uint32_t { kOpen = 2000, kFdopen, kFwrite, kWrite, kFclose, kMemory, kThread };

// The n-th call of its kind, so that a place is the same one in every run, whatever the threads are doing.
struct Place {
  virtualcamera::Level level = virtualcamera::Level::Any;
  std::uint32_t camera = 0;
  std::uint32_t item = 0;
  std::uint32_t command = 0;
  std::uint32_t parameter = 0;
  std::uint32_t nth = 0;

  auto kind() const { return std::tuple(level, camera, item, command, parameter); }
  bool operator==(const Place& other) const { return kind() == other.kind() && nth == other.nth; }
  std::string text() const;
};

enum Way : int {
  kRefused,
  kCondition,
  kBufferSize,
  kDoneButRefused,
  kNothingDone,  // but answered as done
  kNonsense,     // the first of as many
  kStormBefore = kNonsense + 7,
  kStormAfter,
  kStormElsewhere,  // on a thread of the module's own, meanwhile
  kWays
};

// One at a time in a process.
class LyingModule {
 public:
  LyingModule(virtualcamera::Model& model, std::optional<Place> place, Way way);
  ~LyingModule();

  std::int32_t call(tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter, std::uint32_t dataType,
                    std::uint64_t data, NkMAIDCompletionProc* completion, void* reference);
  // What is to go wrong with this call of the system, if anything.
  std::optional<Way> systemCall(SystemCall which);
  // Calls back whatever was ever registered or waited for, whether it is still there or not. From a delivery, which
  // the download thread may wait for, nothing that is carried to it.
  void storm(bool fromDelivery = false);
  void endStorms();
  void expectAllClosed();

  bool reached();
  std::vector<Place> places();  // all of the run

  std::function<void(const Place&)> beforeCall;
  // A camera that is to be unplugged, because it will not complete what it said it had started; 0 for none.
  std::atomic<std::uint32_t> toUnplug{0};

 private:
  struct Registered {
    tagNkMAIDCallback callback;
    Place place;
  };

  bool arrive(Place& place);
  Place placeOf(const tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter);
  void keepBooks(const tagNkMAIDObject* object, const Place& place, std::uint64_t data, std::int32_t result);
  std::int32_t astray(const Place& place, std::uint32_t dataType, std::uint64_t data,
                      const std::function<std::int32_t()>& pass);
  void scribble(const Place& place, std::uint32_t dataType, void* data) const;
  void stormOnce(Way when, bool fromDelivery = false);
  static std::int32_t deliver(void* registered, void* dataInfo, void* data);

  virtualcamera::Model& _model;
  const std::optional<Place> _place;
  const Way _way;
  std::mutex _lock;
  bool _reached = false;
  std::map<decltype(Place().kind()), std::uint32_t> _counts;
  std::vector<Place> _places;
  std::map<const tagNkMAIDObject*, std::pair<Place, const tagNkMAIDObject*>> _open;  // with their parents
  std::deque<Registered> _eventProcs;
  std::deque<Registered> _dataProcs;
  std::vector<std::pair<NkMAIDCompletionProc*, void*>> _completions;
  std::vector<std::thread> _stormThreads;
};

LyingModule* lyingModule();  // null for none
