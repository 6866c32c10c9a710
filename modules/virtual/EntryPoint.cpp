// The way of a call: hooks, faults, then the command.
#include <atomic>
#include <new>

#include "Core.h"

namespace virtualcamera {
namespace {

std::atomic<Core*> installed{nullptr};

Level below(Level level) {
  switch (level) {
    case Level::Module:
      return Level::Camera;
    case Level::Camera:
      return Level::Item;
    case Level::Item:
      return Level::Data;
    default:
      return Level::Any;
  }
}

Target opening(const Object& parent, uint32_t id) {
  Target target = parent.target;
  target.level = below(target.level);
  if (target.level == Level::Camera) target.camera = id;
  if (target.level == Level::Item) target.item = id;
  return target;
}

}  // namespace

void install(Core* core) { installed = core; }

void uninstall(Core* core) { installed.compare_exchange_strong(core, nullptr); }

int32_t entryPoint(tagNkMAIDObject* object, uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
                   NkMAIDCompletionProc* completion, void* reference) {
  Core* core = installed;
  if (core == nullptr) return kNkMAIDResult_MissingComponent;
  try {
    return core->entry(object, {command, parameter, dataType, data, completion, reference});
  } catch (const std::bad_alloc&) {
    return kNkMAIDResult_OutOfMemory;
  } catch (...) {  // the caller is C as far as anyone knows
    return kNkMAIDResult_UnexpectedError;
  }
}

int32_t Core::entry(tagNkMAIDObject* record, const Arguments& arguments) {
  Lock lock(mutex_);
  Call call = describe(lock, record, arguments);
  const bool fails = failsNow(lock, call);
  const int32_t failure = failingResult_;
  const std::shared_ptr<const CallHook> before = before_;
  lock.unlock();

  if (before) (*before)(call);
  if (fails) {
    call.result = failure;
  } else {
    const std::optional<Fault> fault = faults_.hit(call.target, arguments.command, arguments.parameter);
    call.result = run(record, arguments, fault ? &*fault : nullptr);
  }

  lock.lock();
  if (recording_ && call.command != kNkMAIDCommand_Async) calls_.push_back(call);
  const std::shared_ptr<const CallHook> after = after_;
  lock.unlock();
  if (after) (*after)(call);
  return call.result;
}

Call Core::describe(Lock&, tagNkMAIDObject* record, const Arguments& arguments) const {
  Call call;
  call.command = arguments.command;
  call.parameter = arguments.parameter;
  call.dataType = arguments.dataType;
  call.thread = std::this_thread::get_id();
  const bool opens = arguments.command == kNkMAIDCommand_Open;
  if (record == nullptr) {
    if (opens) call.target.level = Level::Module;
  } else if (const ObjectPtr object = find(record)) {
    call.target = opens ? opening(*object, arguments.parameter) : object->target;
  }
  return call;
}

bool Core::failsNow(Lock&, const Call& call) {
  if (call.command == kNkMAIDCommand_Async && !counting_.polls) return false;
  if (call.command == kNkMAIDCommand_Close && !counting_.closes) return false;
  if (call.command == kNkMAIDCommand_Open && !counting_.opens) return false;
  ++countedCalls_;
  return failingCall_ != 0 && countedCalls_ == failingCall_;
}

int32_t Core::run(tagNkMAIDObject* record, const Arguments& arguments, const Fault* fault) {
  if (fault != nullptr) {
    faults_.spend(fault->delay);
    if (fault->answer && !fault->doAnyway) return *fault->answer;
  }
  Lock lock(mutex_);
  int32_t result = kNkMAIDResult_ZombieObject;
  if (arguments.command == kNkMAIDCommand_Open) {
    result = open(lock, record, arguments);
  } else if (const ObjectPtr object = find(record)) {
    result = dispatch(lock, object, arguments, fault);
  }
  return fault != nullptr && fault->answer ? *fault->answer : result;
}

int32_t Core::dispatch(Lock& lock, const ObjectPtr& object, const Arguments& arguments, const Fault* fault) {
  if (arguments.command == kNkMAIDCommand_Close) return close(lock, object);
  if (arguments.command == kNkMAIDCommand_Async) return poll(lock, object);
  if (isGone(*object)) {
    const bool asksForLife =
        arguments.command == kNkMAIDCommand_CapGet && arguments.parameter == kNkMAIDCapability_IsAlive;
    return asksForLife && !object->orphaned ? capGet(*object, arguments, fault) : kNkMAIDResult_ZombieObject;
  }
  switch (arguments.command) {
    case kNkMAIDCommand_GetCapCount: {
      const auto count = static_cast<uint32_t>(capabilities(*object).size());
      return Capability::unsignedInteger(0, count).read(arguments.dataType, reinterpret_cast<void*>(arguments.data));
    }
    case kNkMAIDCommand_GetCapInfo:
      return capInfo(*object, arguments);
    case kNkMAIDCommand_CapStart:
      return capStart(lock, object, arguments, fault);
    case kNkMAIDCommand_CapSet:
      return capSet(lock, object, arguments);
    case kNkMAIDCommand_CapGet:
      return capGet(*object, arguments, fault);
    case kNkMAIDCommand_CapGetArray:
      return capGetArray(*object, arguments, fault);
    case kNkMAIDCommand_EnumChildren:
      return enumChildren(lock, *object);
    default:
      return kNkMAIDResult_NotSupported;
  }
}

}  // namespace virtualcamera
