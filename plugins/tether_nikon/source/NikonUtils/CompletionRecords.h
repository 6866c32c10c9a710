// Completions that are waited for. The SDK gets a number that is never used again as its reference, so that one that
// comes twice, or after its wait was given up, finds nothing.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>

#include "CallbackGate.h"
#include "NikonObject.h"

struct CompletionRecord {
  CNikonCallbackReceiver* receiver;
  void* context;
  std::atomic<std::uint32_t>* counter;  // the waiting caller's
};
static_assert(sizeof(CompletionRecord) == 24);

// Adds a record and returns its reference. A receiver with a gate is called only while that lets callbacks in.
void* addCompletionRecord(const CompletionRecord& record);
// Takes the record of a completion out and counts it for the waiting caller. False when there is none. The entry keeps
// the receiver from going until it ends; where it was not let in, the record comes without its receiver.
bool takeCompletionRecord(void* reference, CompletionRecord& record, std::unique_ptr<CallbackGate::Entry>& entry);
// Gives a wait up: the completion will find neither counter nor receiver.
void detachCompletionRecord(void* reference);
