#include "CallbackGate.h"

#include <algorithm>
#include <unordered_map>

namespace {

platform::Mutex gatesLock;
thread_local int staysOfThisThread = 0;

// Never destroyed: callbacks may come until the last moment of the process.
std::unordered_map<const void*, std::shared_ptr<CallbackGate>>& gates() REQUIRES(gatesLock) {
  static auto* const all = new std::unordered_map<const void*, std::shared_ptr<CallbackGate>>;
  return *all;
}

}  // namespace

std::shared_ptr<CallbackGate> CallbackGate::make(const void* reference) {
  std::shared_ptr<CallbackGate> gate(new CallbackGate(reference));
  const platform::Guard guard(gatesLock);
  gates()[reference] = gate;
  return gate;
}

std::shared_ptr<CallbackGate> CallbackGate::find(const void* reference) {
  const platform::Guard guard(gatesLock);
  const auto found = gates().find(reference);
  return found == gates().end() ? nullptr : found->second;
}

void CallbackGate::open() {
  const platform::Guard guard(_lock);
  // An event may bring about another one, which is then kept as well.
  while (_state == State::starting && !_early.empty()) {
    const auto event = std::move(_early.front());
    _early.pop_front();
    _inside.push_back(std::this_thread::get_id());
    ++staysOfThisThread;
    {
      const platform::Release outside(_lock);
      event();
    }
    --staysOfThisThread;
    _inside.erase(std::find(_inside.begin(), _inside.end(), std::this_thread::get_id()));
    _left.notifyAll();
  }
  if (_state == State::starting) _state = State::open;
}

void CallbackGate::shut() {
  const platform::Guard guard(_lock);
  if (_state == State::closed) return;
  _state = State::closed;
  _early.clear();
  const platform::Guard all(gatesLock);
  const auto found = gates().find(_reference);
  if (found != gates().end() && found->second.get() == this) gates().erase(found);
}

void CallbackGate::close() {
  shut();
  waitForOthers();
}

void CallbackGate::waitForOthers() {
  const platform::Guard guard(_lock);
  while (othersAreInside()) _left.wait(_lock);
}

bool CallbackGate::keepForLater(std::function<void()> event) {
  const platform::Guard guard(_lock);
  if (_state != State::starting) return false;
  _early.push_back(std::move(event));
  return true;
}

bool CallbackGate::othersAreInside() const {
  const auto self = std::this_thread::get_id();
  return std::any_of(_inside.begin(), _inside.end(), [&](const auto& thread) { return thread != self; });
}

void CallbackGate::enter() {
  const platform::Guard guard(_lock);
  _inside.push_back(std::this_thread::get_id());
}

bool CallbackGate::leave() {
  const platform::Guard guard(_lock);
  const auto found = std::find(_inside.begin(), _inside.end(), std::this_thread::get_id());
  if (found == _inside.end()) return false;
  _inside.erase(found);
  _left.notifyAll();
  return true;
}

CallbackGate::Entry::Entry(std::shared_ptr<CallbackGate> gate) {
  if (!gate) return;
  const platform::Guard guard(gate->_lock);
  if (gate->_state != State::open) return;
  gate->_inside.push_back(std::this_thread::get_id());
  _gate = std::move(gate);
  ++staysOfThisThread;
}

CallbackGate::Entry::~Entry() {
  if (!_gate) return;
  --staysOfThisThread;
  _gate->leave();
}

bool CallbackGate::Entry::isNested() { return staysOfThisThread > 1; }
