#include "CallbackGate.h"

#include <algorithm>
#include <unordered_map>

namespace {

std::mutex gatesLock;
thread_local int staysOfThisThread = 0;

// Never destroyed: callbacks may come until the last moment of the process.
std::unordered_map<const void*, std::shared_ptr<CallbackGate>>& gates() {
  static auto* const all = new std::unordered_map<const void*, std::shared_ptr<CallbackGate>>;
  return *all;
}

}  // namespace

std::shared_ptr<CallbackGate> CallbackGate::make(const void* reference) {
  std::shared_ptr<CallbackGate> gate(new CallbackGate(reference));
  const std::lock_guard guard(gatesLock);
  gates()[reference] = gate;
  return gate;
}

std::shared_ptr<CallbackGate> CallbackGate::find(const void* reference) {
  const std::lock_guard guard(gatesLock);
  const auto found = gates().find(reference);
  return found == gates().end() ? nullptr : found->second;
}

void CallbackGate::open() {
  std::unique_lock guard(_lock);
  // An event may bring about another one, which is then kept as well.
  while (_state == State::starting && !_early.empty()) {
    std::vector<std::function<void()>> early;
    early.swap(_early);
    guard.unlock();
    for (const auto& event : early) event();
    guard.lock();
  }
  if (_state == State::starting) _state = State::open;
}

void CallbackGate::close() {
  std::unique_lock guard(_lock);
  if (_state != State::closed) {
    _state = State::closed;
    _early.clear();
    const std::lock_guard all(gatesLock);
    const auto found = gates().find(_reference);
    if (found != gates().end() && found->second.get() == this) gates().erase(found);
  }
  _left.wait(guard, [this] { return !othersAreInside(); });
}

void CallbackGate::waitForOthers() {
  std::unique_lock guard(_lock);
  _left.wait(guard, [this] { return !othersAreInside(); });
}

bool CallbackGate::keepForLater(std::function<void()> event) {
  const std::lock_guard guard(_lock);
  if (_state != State::starting) return false;
  _early.push_back(std::move(event));
  return true;
}

bool CallbackGate::othersAreInside() const {
  const auto self = std::this_thread::get_id();
  return std::any_of(_inside.begin(), _inside.end(), [&](const auto& thread) { return thread != self; });
}

void CallbackGate::enter() {
  const std::lock_guard guard(_lock);
  _inside.push_back(std::this_thread::get_id());
}

bool CallbackGate::leave() {
  const std::lock_guard guard(_lock);
  const auto found = std::find(_inside.begin(), _inside.end(), std::this_thread::get_id());
  if (found == _inside.end()) return false;
  _inside.erase(found);
  _left.notify_all();
  return true;
}

CallbackGate::Entry::Entry(std::shared_ptr<CallbackGate> gate) {
  if (!gate) return;
  const std::lock_guard guard(gate->_lock);
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
