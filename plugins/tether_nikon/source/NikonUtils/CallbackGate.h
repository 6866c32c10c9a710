// Decides whether an SDK callback may enter its object. Callbacks come when the SDK likes: while an object is being
// built, while another thread tears it down, and after it has gone. A gate lets none into an object that is not whole.
#pragma once

#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <thread>
#include <vector>

#include "Locks.h"

class CallbackGate {
 public:
  // Registers a gate, not open yet, for callbacks with this reference.
  static std::shared_ptr<CallbackGate> make(const void* reference);
  // The gate for a reference, or null when there is none (any more).
  static std::shared_ptr<CallbackGate> find(const void* reference);

  // The object is whole: runs the events that came before, in order, as callbacks inside, and lets others in from now
  // on.
  void open();
  // The object goes: lets nothing in any more and forgets the reference. Again: nothing.
  void shut();
  // As shut(), and waits for callbacks that are inside on other threads.
  void close();
  // Waits for callbacks that are inside on other threads.
  void waitForOthers();

  // Keeps an event that came while the gate was not open yet. False when it is open or closed. The event must not
  // throw.
  bool keepForLater(std::function<void()> event);

  // A callback's stay inside.
  class Entry {
   public:
    Entry() = default;
    explicit Entry(std::shared_ptr<CallbackGate> gate);
    Entry(Entry&& other) noexcept = default;
    Entry(const Entry&) = delete;
    Entry& operator=(const Entry&) = delete;
    Entry& operator=(Entry&&) = delete;
    ~Entry();
    // Whether it was let in.
    explicit operator bool() const { return _gate != nullptr; }
    // Whether the calling thread is inside more than one callback: the SDK was called from one and delivered another.
    static bool isNested();

   private:
    std::shared_ptr<CallbackGate> _gate;
  };

  // While the calling thread, inside, waits for another thread, nobody waits for it. It must not touch the object
  // again afterwards, which may be gone.
  class StepOut {
   public:
    explicit StepOut(std::shared_ptr<CallbackGate> gate) : _gate(std::move(gate)), _wasInside(_gate->leave()) {}
    StepOut(const StepOut&) = delete;
    StepOut& operator=(const StepOut&) = delete;
    ~StepOut() {
      if (_wasInside) _gate->enter();
    }

   private:
    std::shared_ptr<CallbackGate> _gate;
    const bool _wasInside;
  };

 private:
  enum class State { starting, open, closed };

  explicit CallbackGate(const void* reference) : _reference(reference) {}
  void enter();
  bool leave();
  bool othersAreInside() const REQUIRES(_lock);

  const void* const _reference;
  platform::Mutex _lock;
  platform::Condition _left;
  State _state GUARDED_BY(_lock) = State::starting;
  std::vector<std::thread::id> _inside GUARDED_BY(_lock);
  std::deque<std::function<void()>> _early GUARDED_BY(_lock);
};
