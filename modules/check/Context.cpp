#include "Context.h"

namespace modulecheck {
namespace {

using namespace std::chrono_literals;

constexpr uintptr_t kFirstReference = 0x5EED;
constexpr auto kHold = 2s;

thread_local Frame* currentFrame = nullptr;
Context* theContext = nullptr;

}  // namespace

Frame::Frame(const Object& ofObject, uint32_t ofCommand) : object(ofObject), command(ofCommand), outer(currentFrame) {
  currentFrame = this;
}

Frame::~Frame() { currentFrame = outer; }

Frame* Frame::current() { return currentFrame; }

Context::Context(Report& findings, std::chrono::milliseconds longestWait) : report(findings), patience(longestWait) {
  theContext = this;
}

Context& Context::theOne() { return *theContext; }

void Context::add(const Object* object) {
  const platform::Guard guard(_lock);
  _objects.insert(object);
}

Object* Context::find(void* reference) const {
  const platform::Guard guard(_lock);
  return _objects.count(reference) == 0 ? nullptr : static_cast<Object*>(reference);
}

void* Context::addAction(std::shared_ptr<Action> action) {
  const platform::Guard guard(_lock);
  _actions.push_back(std::move(action));
  return reinterpret_cast<void*>(kFirstReference + _actions.size() - 1);
}

std::shared_ptr<Action> Context::action(void* reference) const {
  const platform::Guard guard(_lock);
  const uintptr_t index = reinterpret_cast<uintptr_t>(reference) - kFirstReference;
  return index < _actions.size() ? _actions[index] : nullptr;
}

bool Context::mainThreadGetsThrough() {
  const uint64_t before = mainThread.calls;
  const auto until = std::chrono::steady_clock::now() + kHold;
  const auto isStuck = [&] { return mainThread.calling && mainThread.calls < before + 2; };
  ++holds;
  while (isStuck() && std::chrono::steady_clock::now() < until) std::this_thread::sleep_for(1ms);
  const bool stuck = isStuck();
  ++holds;
  return !stuck;
}

}  // namespace modulecheck
