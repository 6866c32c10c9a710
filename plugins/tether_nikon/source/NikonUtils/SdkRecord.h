// The SDK's record of an open object, and the calls that are in progress with it. It is closed once, by whichever
// thread, and no call goes to it afterwards. Any thread.
#pragma once

#include <atomic>
#include <chrono>
#include <memory>
#include <thread>
#include <vector>

#include "Locks.h"
#include "MAID.h"

class SdkRecord {
 public:
  // The record of a child keeps its parent's from being closed before it.
  SdkRecord(NkMAIDEntryPoint* entryPoint, std::shared_ptr<SdkRecord> parent);
  SdkRecord(const SdkRecord&) = delete;
  SdkRecord& operator=(const SdkRecord&) = delete;

  tagNkMAIDObject* get() { return &_object; }
  // Whether it has been closed and the SDK said so.
  bool isClosed() const { return _closed; }

  // A call's stay with the record.
  class Call {
   public:
    // Null, or a record that is closed or about to be: not let in.
    explicit Call(std::shared_ptr<SdkRecord> record);
    Call(const Call&) = delete;
    Call& operator=(const Call&) = delete;
    // The last one out closes the record where that was left to it.
    ~Call();
    explicit operator bool() const { return _record != nullptr; }
    tagNkMAIDObject* object() const { return _record->get(); }

   private:
    std::shared_ptr<SdkRecord> _record;
  };

  // Lets no call in any more and closes the record. Calls of other threads that are in progress, and a child that is
  // yet to be closed, are waited for so long; whatever is left then closes it when it leaves. Calls of this thread are
  // what brought it here.
  static void close(const std::shared_ptr<SdkRecord>& record, std::chrono::milliseconds wait);

 private:
  bool othersAreInside() const REQUIRES(_lock);
  void leave(std::thread::id caller) EXCLUDES(_lock);
  void closeNow();

  NkMAIDEntryPoint* const _entryPoint;
  const std::shared_ptr<SdkRecord> _parent;
  tagNkMAIDObject _object{};
  std::atomic<bool> _closed{false};
  platform::Mutex _lock;
  platform::Condition _left;
  bool _ended GUARDED_BY(_lock) = false;    // no call is let in any more
  bool _pending GUARDED_BY(_lock) = false;  // whoever leaves last closes it
  // Threads that are inside; a child to be closed is the thread that is none.
  std::vector<std::thread::id> _inside GUARDED_BY(_lock);
};
