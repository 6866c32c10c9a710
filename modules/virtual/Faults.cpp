#include "Faults.h"

#include <utility>

namespace virtualcamera {
namespace {

bool fits(const std::optional<uint32_t>& wanted, uint32_t value) { return !wanted || *wanted == value; }

bool matches(const Fault& fault, const Target& target, uint32_t command, uint32_t parameter) {
  return (fault.level == Level::Any || fault.level == target.level) && fits(fault.camera, target.camera) &&
         fits(fault.item, target.item) && fits(fault.command, command) && fits(fault.parameter, parameter);
}

}  // namespace

FaultPlan::Id FaultPlan::add(Fault fault) {
  const std::lock_guard lock(mutex_);
  released_ = false;
  entries_.push_back({++lastId_, std::move(fault), 0});
  return lastId_;
}

void FaultPlan::remove(Id id) {
  const std::lock_guard lock(mutex_);
  std::erase_if(entries_, [id](const Entry& entry) { return entry.id == id; });
}

void FaultPlan::clear() {
  const std::lock_guard lock(mutex_);
  entries_.clear();
}

void FaultPlan::release() {
  const std::lock_guard lock(mutex_);
  released_ = true;
  releasing_.notify_all();
}

std::optional<Fault> FaultPlan::hit(const Target& target, uint32_t command, uint32_t parameter) {
  const std::lock_guard lock(mutex_);
  const Fault* found = nullptr;
  for (Entry& entry : entries_) {
    if (!matches(entry.fault, target, command, parameter)) continue;
    const uint64_t number = entry.matched++;
    const bool active = number >= entry.fault.skip && number - entry.fault.skip < entry.fault.times;
    if (found == nullptr && active) found = &entry.fault;
  }
  return found ? std::optional<Fault>(*found) : std::nullopt;
}

void FaultPlan::spend(std::chrono::milliseconds delay) {
  if (delay.count() <= 0) return;
  std::unique_lock lock(mutex_);
  releasing_.wait_for(lock, delay, [this] { return released_; });
}

}  // namespace virtualcamera
