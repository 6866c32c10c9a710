// Faults: which calls of a virtual camera go wrong, how often, and in what way.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <limits>
#include <memory>
#include <optional>
#include <vector>

#include "Hooks.h"
#include "Mutex.h"
#include "Worker.h"

namespace virtualcamera {

using camerakit::Call;
using camerakit::Capability;
using camerakit::Delivery;
using camerakit::Level;
using camerakit::Target;

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

// The faults of one model, which asks it in the way of its calls. Safe to use from any thread, also between two calls
// of a client.
class FaultPlan : public camerakit::Hooks {
 public:
  using Id = uint64_t;

  Id add(Fault fault);
  void remove(Id id);
  void clear();

  // Ends delays that calls are spending right now, and those of calls to come until a fault is added.
  void release();

 protected:
  // Nothing is called back on the module's thread any more.
  void end() { _worker.end(); }

  std::optional<int32_t> before(Call& call) override;
  void after(Call& call) override;
  int32_t read(const Call& call, const Capability& value) override;
  void carryOut(const Call& start, const std::function<void()>& step) override;
  std::optional<int32_t> deliver(const Delivery& delivery) override;
  bool holdsBack(const Call& start) override;
  void complete(const Call& start, int32_t result) override;
  void abandoned(const Call& start, int32_t result) override;

 private:
  struct Entry {
    Id id;
    std::shared_ptr<const Fault> fault;
    uint64_t matched;
  };
  // A completion that comes apart from its action: a second time, or after the close.
  struct Stray {
    Call start;
    int32_t result;
  };

  std::shared_ptr<const Fault> hit(const Call& call) KIT_EXCLUDES(_mutex);
  void spend(std::chrono::milliseconds delay) KIT_EXCLUDES(_mutex);
  void addStray(const Call& start, int32_t result) KIT_EXCLUDES(_mutex);
  void completeStrays() KIT_EXCLUDES(_mutex);

  camerakit::Mutex _mutex;
  camerakit::Condition _releasing;
  std::vector<Entry> _entries KIT_GUARDED_BY(_mutex);
  Id _lastId KIT_GUARDED_BY(_mutex) = 0;
  bool _released KIT_GUARDED_BY(_mutex) = false;
  std::vector<Stray> _strays KIT_GUARDED_BY(_mutex);
  Worker _worker;
};

}  // namespace virtualcamera
