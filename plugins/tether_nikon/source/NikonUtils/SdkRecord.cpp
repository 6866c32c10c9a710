#include "SdkRecord.h"

#include <algorithm>
#include <utility>

#include "ModuleLoading.h"

namespace {

constexpr std::size_t kUsualCallers = 4;  // a call must not need memory

}  // namespace

SdkRecord::SdkRecord(NkMAIDEntryPoint* entryPoint, std::shared_ptr<SdkRecord> parent)
    : _entryPoint(entryPoint), _parent(std::move(parent)) {
  _inside.reserve(kUsualCallers);
}

SdkRecord::Call::Call(std::shared_ptr<SdkRecord> record) {
  if (!record) return;
  const platform::Guard guard(record->_lock);
  if (record->_ended) return;
  record->_inside.push_back(std::this_thread::get_id());
  _record = std::move(record);
}

SdkRecord::Call::~Call() {
  if (_record) _record->leave(std::this_thread::get_id());
}

void SdkRecord::leave(std::thread::id caller) {
  {
    const platform::Guard guard(_lock);
    _inside.erase(std::find(_inside.begin(), _inside.end(), caller));
    if (_ended) _left.notifyAll();
    if (!_pending || !_inside.empty()) return;
    _pending = false;
  }
  closeNow();
}

bool SdkRecord::othersAreInside() const {
  const auto self = std::this_thread::get_id();
  return std::any_of(_inside.begin(), _inside.end(), [&](const auto& caller) { return caller != self; });
}

void SdkRecord::close(const std::shared_ptr<SdkRecord>& record, std::chrono::milliseconds wait) {
  const auto until = std::chrono::steady_clock::now() + wait;
  {
    const platform::Guard guard(record->_lock);
    record->_ended = true;
    while (record->othersAreInside() && record->_left.waitUntil(record->_lock, until)) {
    }
    record->_pending = record->othersAreInside();
    if (record->_pending && record->_parent) {
      const platform::Guard parentGuard(record->_parent->_lock);
      record->_parent->_inside.emplace_back();
    }
    if (record->_pending) return;
  }
  if (Command_Close(record->_entryPoint, record->get())) record->_closed = true;
}

void SdkRecord::closeNow() {
  if (Command_Close(_entryPoint, &_object)) _closed = true;
  if (_parent) _parent->leave({});
}
