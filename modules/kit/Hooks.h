// What may stand around the calls of a module, and in the way of its answers. A module without hooks is an honest one;
// hooks are for modules that look at the bus before they list their cameras, that keep a record of the calls, or that
// are to go wrong on purpose.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <thread>

#include "Capability.h"
#include "MAID.h"

namespace camerakit {

enum class Level { Any, Module, Camera, Item, Data };

// What a call is about. Of an Open, level and ids are those of the object to be opened; of a call with a record that
// is not open they are Any and 0.
struct Target {
  Level level = Level::Any;
  uint32_t camera = 0;  // 0 for the module
  uint32_t item = 0;    // 0 for module and camera

  bool operator==(const Target&) const = default;
};

// One call of the entry point. An action keeps the call that started it.
struct Call {
  tagNkMAIDObject* object = nullptr;
  uint32_t command = 0;
  uint32_t parameter = 0;
  uint32_t dataType = 0;
  uint64_t data = 0;
  NkMAIDCompletionProc* completion = nullptr;
  void* reference = nullptr;

  Target target{};
  std::thread::id thread{};
  bool done = false;                        // false where a hook answered instead
  int32_t result = kNkMAIDResult_NoError;   // known after the call
  int32_t outcome = kNkMAIDResult_NoError;  // of a CapStart: what the action completes with when nothing goes wrong
  std::shared_ptr<void> note{};             // the hooks' own

  // Calls the completion procedure, if there is one.
  void complete(int32_t with) const {
    if (completion != nullptr) completion(object, command, parameter, dataType, data, reference, with);
  }
};

// One delivery of a transfer, before it is made. Record and bytes are valid as long as the call of the hook.
struct Delivery {
  const Call& start;
  uint32_t number;  // in its transfer, from 0
  tagNkMAIDFileInfo info;
  const uint8_t* bytes;
  tagNkMAIDCallback receiver;

  // Makes it. Aborted where the client wants no more.
  std::optional<int32_t> hand() const {
    tagNkMAIDFileInfo shown = info;
    auto* data = const_cast<uint8_t*>(bytes);  // clients do not write to it
    const bool taken = reinterpret_cast<NkMAIDDataProc*>(receiver.procedure)(receiver.reference, &shown, data) == 0;
    return taken ? std::nullopt : std::optional<int32_t>(kNkMAIDResult_Aborted);
  }
};

// Each function does what a module without hooks does. They are called on the thread in question with no lock held, and
// may call model and cameras; they do not throw, except before and read, which then answer UnexpectedError.
class Hooks {
 public:
  virtual ~Hooks() = default;

  // Around every call. What `before` answers is the result, and the call is not carried out. Both may change the call's
  // outcome and note, `after` also its result.
  virtual std::optional<int32_t> before(Call&) { return std::nullopt; }
  virtual void after(Call&) {}

  // CapGet and CapGetArray of a capability that is announced.
  virtual int32_t read(const Call& call, const Capability& value) {
    auto* data = reinterpret_cast<void*>(call.data);
    return call.command == kNkMAIDCommand_CapGetArray ? value.readElements(call.dataType, data)
                                                      : value.read(call.dataType, data);
  }

  // What calls the client back for an action: a delivery, or the completion. To be run once, from any thread.
  virtual void carryOut(const Call& /*start*/, const std::function<void()>& step) { step(); }
  // Nothing: the transfer goes on. A result: it ends with that, good or bad.
  virtual std::optional<int32_t> deliver(const Delivery& delivery) { return delivery.hand(); }

  // An action has come to its end; true puts its completion off, and the next poll asks again.
  virtual bool holdsBack(const Call& /*start*/) { return false; }
  virtual void complete(const Call& start, int32_t result) { start.complete(result); }
  // No completion will come: the action's object was closed, or is gone. The result is what it had ended with, if it
  // had.
  virtual void abandoned(const Call& /*start*/, int32_t /*result*/) {}
};

}  // namespace camerakit
