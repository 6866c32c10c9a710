// Faults: which calls of a virtual camera go wrong, how often, and in what way.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <limits>
#include <mutex>
#include <optional>
#include <vector>

#include "MAID.h"

namespace virtualcamera {

enum class Level { Any, Module, Camera, Item, Data };

// What a call is about. Of an Open, level and ids are those of the object to be opened; of a call with a record that
// is not open they are Any and 0.
struct Target {
  Level level = Level::Any;
  uint32_t camera = 0;  // 0 for the module
  uint32_t item = 0;    // 0 for module and camera

  bool operator==(const Target&) const = default;
};

// What becomes of some of a transfer's deliveries. One of them is counted as made even where it is dropped.
struct DeliveryFault {
  uint32_t first = 0;  // the first delivery concerned, counted from 0
  uint32_t count = 1;  // how many from there
  bool drop = false;
  bool twice = false;
  std::optional<uint32_t> cutTo{};                 // at most so many bytes; the rest of the piece never comes
  std::function<void(tagNkMAIDFileInfo&)> edit{};  // changes the record that the client is shown

  bool concerns(uint32_t delivery) const { return delivery >= first && delivery - first < count; }
};

// One fault. The first group says which calls it is about; what is not set matches everything. A fault that is not
// about a started action leaves the third group unread, and so on: only what fits the call has an effect.
struct Fault {
  static constexpr uint32_t kAlways = std::numeric_limits<uint32_t>::max();

  Level level = Level::Any;
  std::optional<uint32_t> camera{};
  std::optional<uint32_t> item{};
  std::optional<uint32_t> command{};
  std::optional<uint32_t> parameter{};  // capability, or child id of an Open
  uint32_t skip = 0;                    // so many matching calls are spared first
  uint32_t times = kAlways;             // and so many are hit then

  // Any call. A delay is spent inside the call, before anything else, with no lock held; FaultPlan::release ends it.
  std::chrono::milliseconds delay{0};
  std::optional<int32_t> answer{};  // given without doing the call
  bool doAnyway = false;            // the call is done all the same, only its result is replaced

  // CapGet and CapGetArray.
  std::function<void(tagNkMAIDEnum&)> editEnum{};   // changes the header that CapGet answers
  bool anyArraySize = false;                        // CapGetArray fills what fits instead of answering BufferSize
  bool unterminated = false;                        // strings fill their buffer with 'X', without a zero byte
  std::optional<std::vector<uint32_t>> children{};  // what Children lists instead

  // CapStart. A capture whose completion reports a failure takes no picture.
  bool noCompletion = false;
  std::optional<int32_t> completionResult{};
  uint32_t completionPolls = 0;         // so many more polls before the completion comes
  bool completionAfterClose = false;    // it comes only once the object is closed, in the module's next poll
  bool completionTwice = false;         // and again in the module's next poll
  bool ownThread = false;               // deliveries and completion come on a thread of the module
  std::optional<uint32_t> stopAfter{};  // the transfer ends after so many deliveries
  DeliveryFault delivery{};
};

// The faults of one model. Safe to use from any thread, also between two calls of a client.
class FaultPlan {
 public:
  using Id = uint64_t;

  Id add(Fault fault);
  void remove(Id id);
  void clear();

  // Ends delays that calls are spending right now, and those of calls to come until a fault is added.
  void release();

  // The first fault that is in effect for the call, having counted the call for all that match.
  std::optional<Fault> hit(const Target& target, uint32_t command, uint32_t parameter);
  // Spends the delay on the calling thread.
  void spend(std::chrono::milliseconds delay);

 private:
  struct Entry {
    Id id;
    Fault fault;
    uint64_t matched;
  };

  std::mutex mutex_;
  std::condition_variable releasing_;
  std::vector<Entry> entries_;
  Id lastId_ = 0;
  bool released_ = false;
};

}  // namespace virtualcamera
