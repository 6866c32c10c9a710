// The way of a call: hooks, then the command.
#include <atomic>
#include <new>

#include "Core.h"

namespace camerakit {
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

Hooks& noHooks() {
  static Hooks none;
  return none;
}

}  // namespace

void install(Core* core) { installed = core; }

void uninstall(Core* core) { installed.compare_exchange_strong(core, nullptr); }

int32_t entryPoint(tagNkMAIDObject* object, uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
                   NkMAIDCompletionProc* completion, void* reference) {
  Core* core = installed;
  if (core == nullptr) return kNkMAIDResult_MissingComponent;
  try {
    Call call{object, command, parameter, dataType, data, completion, reference};
    return core->enter(call);
  } catch (const std::bad_alloc&) {
    return kNkMAIDResult_OutOfMemory;
  } catch (...) {  // the caller is C as far as anyone knows
    return kNkMAIDResult_UnexpectedError;
  }
}

Core::Core(Options options, Hooks* hooks)
    : _options(std::move(options)), _hooks(hooks != nullptr ? *hooks : noHooks()) {}

int32_t Core::enter(Call& call) {
  describe(call);
  const std::optional<int32_t> answer = _hooks.before(call);
  call.done = !answer;
  call.result = answer ? *answer : run(call);
  if (call.done && call.command == kNkMAIDCommand_Close) letGo();
  _hooks.after(call);
  return call.result;
}

void Core::describe(Call& call) {
  const Guard guard(_mutex);
  call.thread = std::this_thread::get_id();
  const bool opens = call.command == kNkMAIDCommand_Open;
  if (call.object == nullptr) {
    if (opens) call.target.level = Level::Module;
  } else if (const ObjectPtr object = find(call.object)) {
    call.target = opens ? opening(*object, call.parameter) : object->target;
  }
}

int32_t Core::run(const Call& call) {
  const Guard guard(_mutex);
  if (call.command == kNkMAIDCommand_Open) return open(call);
  const ObjectPtr object = find(call.object);
  return object ? dispatch(object, call) : kNkMAIDResult_ZombieObject;
}

int32_t Core::dispatch(const ObjectPtr& object, const Call& call) {
  if (call.command == kNkMAIDCommand_Close) return close(object);
  if (call.command == kNkMAIDCommand_Async) return poll(object);
  if (isGone(*object)) {
    const bool asksForLife = call.command == kNkMAIDCommand_CapGet && call.parameter == kNkMAIDCapability_IsAlive;
    return asksForLife && !object->orphaned ? capRead(*object, call) : kNkMAIDResult_ZombieObject;
  }
  switch (call.command) {
    case kNkMAIDCommand_GetCapCount: {
      const auto count = static_cast<uint32_t>(capabilities(*object).size());
      return Capability::unsignedInteger(0, count).read(call.dataType, reinterpret_cast<void*>(call.data));
    }
    case kNkMAIDCommand_GetCapInfo:
      return capInfo(*object, call);
    case kNkMAIDCommand_CapStart:
      return capStart(object, call);
    case kNkMAIDCommand_CapSet:
      return capSet(object, call);
    case kNkMAIDCommand_CapGet:
    case kNkMAIDCommand_CapGetArray:
      return capRead(*object, call);
    case kNkMAIDCommand_EnumChildren:
      return enumChildren(*object);
    default:
      return kNkMAIDResult_NotSupported;
  }
}

}  // namespace camerakit
