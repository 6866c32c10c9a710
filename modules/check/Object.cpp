// Calls and callbacks.
#include "Object.h"

#include <algorithm>
#include <cstring>
#include <thread>

#include "Names.h"

namespace modulecheck {
namespace {

using namespace std::chrono_literals;

constexpr auto kPollPause = 10us;
constexpr auto kCloseWait = 5s;

bool isSuccess(int32_t result) { return result == kNkMAIDResult_NoError || result == kNkMAIDResult_Pending; }

std::string describe(uint32_t command, uint32_t parameter) {
  const bool ofCapability = command == kNkMAIDCommand_CapStart || command == kNkMAIDCommand_CapSet ||
                            command == kNkMAIDCommand_CapGet || command == kNkMAIDCommand_CapGetArray;
  return commandText(command) + (ofCapability ? " " + capabilityText(parameter) : "");
}

std::string eventText(uint32_t event) {
  if (event == kNkMAIDEvent_AddChild) return "event AddChild";
  if (event == kNkMAIDEvent_RemoveChild) return "event RemoveChild";
  return "event " + std::to_string(event);
}

}  // namespace

Room::Room(size_t size, uint8_t fill) : _fill(fill), _bytes(size + 2 * kMargin, kEdge) {
  std::fill_n(as(), size, fill);
}

bool Room::isIntact() const {
  const auto isEdge = [](uint8_t byte) { return byte == kEdge; };
  return std::all_of(_bytes.begin(), _bytes.begin() + kMargin, isEdge) &&
         std::all_of(_bytes.end() - kMargin, _bytes.end(), isEdge);
}

bool Room::isUntouchedAtTheEnd(size_t count) const {
  return std::all_of(_bytes.end() - kMargin - static_cast<std::ptrdiff_t>(count), _bytes.end() - kMargin,
                     [this](uint8_t byte) { return byte == _fill; });
}

Object::Object(Context& context, Object* parent, uint32_t id, std::string level, std::string name)
    : _context(context), _parent(parent), _id(id), _level(std::move(level)), _name(std::move(name)) {
  _context.add(this);
  _record.as<tagNkMAIDObject>()->refClient = this;
}

void Object::fault(const std::string& what, const std::string& expected) const {
  _context.report.fault(_level, _name, what, expected);
}

void Object::note(const std::string& what) const { _context.report.note(_level, _name, what); }

// Calls.

int32_t Object::call(uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
                     NkMAIDCompletionProc* completion, void* reference) {
  ++_inside;
  const bool mayEnter = isOpen() || command == kNkMAIDCommand_Close;
  const int32_t result =
      mayEnter ? enter(_record.as<tagNkMAIDObject>(), command, parameter, dataType, data, completion, reference)
               : static_cast<int32_t>(kNkMAIDResult_ZombieObject);
  --_inside;
  return result;
}

int32_t Object::enter(tagNkMAIDObject* record, uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
                      NkMAIDCompletionProc* completion, void* reference) {
  const std::string what = describe(command, parameter) + (Frame::current() ? ", called from inside a callback," : "");
  const Doing doing(_context.report.shared(), _name + ": " + what);
  Frame frame(*this, command);
  const uint32_t holds = _context.holds;
  const int64_t late = _context.report.shared().late;
  const auto start = Clock::now();
  int32_t result = kNkMAIDResult_UnexpectedError;
  try {
    result = _context.entryPoint(record, command, parameter, dataType, data, completion, reference);
  } catch (...) {
    fault("an exception left " + what, "results only, never an exception");
  }
  const auto loaded = Clock::duration(_context.report.shared().late - late);
  if (holds % 2 == 0 && holds == _context.holds) judgeTime(what, command, Clock::now() - start - frame.ours - loaded);
  if (std::this_thread::get_id() == _context.mainThreadId) ++_context.mainThread.calls;
  if (_record.as<tagNkMAIDObject>()->refClient != this || !_record.isIntact()) {
    fault(what + " changed its record outside the first and the last 8 bytes", "the client reference left alone");
    _record.as<tagNkMAIDObject>()->refClient = this;
  }
  return result;
}

void Object::judgeTime(const std::string& what, uint32_t command, std::chrono::nanoseconds time) const {
  const bool polls = command == kNkMAIDCommand_Async;
  if (time <= (polls ? std::chrono::nanoseconds(kPollLimit) : kCallLimit)) return;
  fault(what + " took " + std::to_string(std::chrono::duration_cast<std::chrono::milliseconds>(time).count()) + " ms",
        polls ? "polls that return within half a second" : "calls that return within 2 seconds");
}

void Object::checkRoom(const Room& room, const std::string& what) const {
  if (!room.isIntact()) {
    fault(what + " wrote outside the " + std::to_string(room.size()) + " bytes it was given", "no byte beyond");
  }
}

bool Object::open() {
  if (_parent != nullptr && !_parent->isOpen()) return false;
  auto* const parent = _parent == nullptr ? nullptr : _parent->_record.as<tagNkMAIDObject>();
  ++_inside;
  const int32_t result =
      enter(parent, kNkMAIDCommand_Open, _id, kNkMAIDDataType_ObjectPtr, _record.address(), nullptr, nullptr);
  --_inside;
  if (result != kNkMAIDResult_NoError) {
    fault("Open answered " + resultText(result), "NoError; the helper leaves it out otherwise");
    return false;
  }
  _state = State::kOpen;
  if (!readList()) return false;
  registerCallback(kNkMAIDCapability_EventProc, reinterpret_cast<void (*)()>(&eventProc), _events);
  registerCallback(kNkMAIDCapability_DataProc, reinterpret_cast<void (*)()>(&dataProc), _deliveries);
  return true;
}

void Object::registerCallback(uint32_t capability, void (*procedure)(), std::atomic<bool>& registered) {
  if (!announces(capability)) return;
  tagNkMAIDCallback callback{procedure, this};
  registered = true;
  const int32_t result = set(capability, kNkMAIDDataType_CallbackPtr, reinterpret_cast<uintptr_t>(&callback));
  callback = {};  // what keeps the pointer instead of the record finds nothing
  if (result != kNkMAIDResult_NoError) {
    fault("CapSet " + capabilityText(capability) + " answered " + resultText(result),
          "NoError to a callback that is registered");
  }
}

void Object::unregisterCallback(uint32_t capability, std::atomic<bool>& registered) {
  if (!isOpen() || !announces(capability)) return;
  const int32_t result = set(capability, kNkMAIDDataType_Null, 0);
  registered = false;
  if (result != kNkMAIDResult_NoError) {
    fault("CapSet " + capabilityText(capability) + " with data type 0 answered " + resultText(result),
          "NoError to a callback that is taken back");
  }
}

int32_t Object::set(uint32_t capability, uint32_t dataType, uint64_t data) {
  return call(kNkMAIDCommand_CapSet, capability, dataType, data);
}

bool Object::poll() {
  if (!isOpen()) return false;
  const int32_t result = call(kNkMAIDCommand_Async, 0, kNkMAIDDataType_Null, 0);
  if (!isSuccess(result)) fault("Async answered " + resultText(result), "NoError or Pending from what is there");
  return isSuccess(result);
}

Object::Outcome Object::perform(uint32_t capability) {
  const auto action = std::make_shared<Action>();
  action->object = this;
  action->capability = capability;
  action->record = _record.as<tagNkMAIDObject>();
  Outcome outcome;
  outcome.answer =
      call(kNkMAIDCommand_CapStart, capability, kNkMAIDDataType_Null, 0, &completionProc, _context.addAction(action));
  action->refused = !isSuccess(outcome.answer);
  if (action->refused) return outcome;

  uint64_t seen = _progress;
  auto last = Clock::now();
  while (!action->completed && (poll() || action->completed)) {
    if (_progress != seen) last = Clock::now();
    seen = _progress;
    if (Clock::now() - last > _context.patience) {
      fault(capabilityText(capability) + " did not go on for " + std::to_string(_context.patience / 1s) +
                " s and has not completed",
            "one completion for every start that was not refused");
      break;
    }
    std::this_thread::sleep_for(kPollPause);
  }
  // It may have come in another thread's poll, and closed the object before its receiver has returned.
  while (action->reported && !action->completed) std::this_thread::sleep_for(kPollPause);
  if (action->completed) outcome.result = action->result;
  return outcome;
}

// The end.

void Object::close() {
  State open = State::kOpen;
  if (!_state.compare_exchange_strong(open, State::kClosed)) return;
  if (!othersLeave()) {
    return fault("a call of another thread does not return as long as a callback lasts",
                 "no lock held while calling back");
  }
  const int32_t result = call(kNkMAIDCommand_Close, 0, kNkMAIDDataType_Null, 0);
  _closed = true;
  if (result != kNkMAIDResult_NoError) {
    fault("Close answered " + resultText(result), "NoError to the close of what is open, with nothing open below it");
  }
}

// Nothing is closed under a call of another thread. No new one begins.
bool Object::othersLeave() const {
  int ofThisThread = 0;
  for (const Frame* frame = Frame::current(); frame != nullptr; frame = frame->outer) {
    if (&frame->object == this) ++ofThisThread;
  }
  const auto until = Clock::now() + kCloseWait;
  while (_inside != ofThisThread && Clock::now() < until) std::this_thread::sleep_for(kPollPause);
  return _inside == ofThisThread;
}

void Object::takeDown() {
  unregisterCallback(kNkMAIDCapability_EventProc, _events);
  unregisterCallback(kNkMAIDCapability_DataProc, _deliveries);
  for (Object* const child : below()) child->takeDown();
  close();
}

// Callbacks.

// What every callback is judged by. The time that it takes is not the module's.
class Object::InCallback {
 public:
  InCallback(Object& object, const std::string& what)
      : _frame(Frame::current()),
        _doing(object._context.report.shared(), object._name + ": the host's side of its " + what) {
    if (_frame == nullptr) {
      object.note("a callback, its " + what + ", came on a thread of the module's own");
    } else if (_frame->command != kNkMAIDCommand_Async) {
      object.fault("its " + what + " came inside " + commandText(_frame->command) + " of " + _frame->object.name(),
                   "callbacks inside polls (Async) only");
    }
    if (object._closed) object.fault("its " + what + " came after its Close", "no callback once Close has returned");
  }
  ~InCallback() {
    if (_frame != nullptr) _frame->ours += Clock::now() - _start;
  }
  InCallback(const InCallback&) = delete;
  InCallback& operator=(const InCallback&) = delete;

 private:
  const Clock::time_point _start = Clock::now();
  Frame* const _frame;
  const Doing _doing;
};

void Object::eventProc(void* reference, uint32_t event, uint64_t data) {
  Context& context = Context::theOne();
  Object* const object = context.find(reference);
  if (object == nullptr) {
    context.report.fault("module", "module", "an event came with a reference that was never registered",
                         "the reference that was registered with the procedure");
    return;
  }
  const InCallback inside(*object, eventText(event));
  if (!object->_events && !object->_closed) {
    object->fault("its " + eventText(event) + " came after EventProc was taken back", "no callback after that");
  }
  object->onEvent(event, data);
}

int32_t Object::dataProc(void* reference, void* info, void* data) {
  Context& context = Context::theOne();
  Object* const object = context.find(reference);
  if (object == nullptr || info == nullptr) {
    context.report.fault("module", object == nullptr ? "module" : object->name(),
                         object == nullptr ? "a delivery came with a reference that was never registered"
                                           : "a delivery came without a file-info record",
                         "the registered reference and a file-info record");
    return 0;
  }
  const InCallback inside(*object, "delivery");
  if (!object->_deliveries && !object->_closed) {
    object->fault("a delivery came after DataProc was taken back", "no callback after that");
  }
  tagNkMAIDFileInfo copy{};
  std::memcpy(&copy, info, sizeof copy);
  object->onDelivery(copy, static_cast<const uint8_t*>(data));
  return 0;
}

void Object::completionProc(tagNkMAIDObject* record, uint32_t command, uint32_t parameter, uint32_t dataType,
                            uint64_t data, void* reference, int32_t result) {
  Context& context = Context::theOne();
  const auto action = context.action(reference);
  if (!action) {
    context.report.fault("module", "module", "a completion came with a reference that no start had",
                         "the reference that came with the start");
    return;
  }
  Object& object = *action->object;
  const std::string what = "completion of " + capabilityText(action->capability);
  if (action->reported.exchange(true)) {
    object.fault("its " + what + " came twice", "one completion for every start");
    return;
  }
  const InCallback inside(object, what);
  if (action->refused) object.fault("its " + what + " came although its start was refused", "none where a start fails");
  object.checkCompletion(*action, record, command, parameter, dataType, data);
  object.onCompletion(action->capability, result);
  action->result = result;
  action->completed = true;
}

void Object::checkCompletion(const Action& action, const tagNkMAIDObject* record, uint32_t command, uint32_t parameter,
                             uint32_t dataType, uint64_t data) const {
  if (record == action.record && command == kNkMAIDCommand_CapStart && parameter == action.capability &&
      dataType == kNkMAIDDataType_Null && data == 0) {
    return;
  }
  fault("a completion has other arguments than the start: " + commandText(command) + " " + capabilityText(parameter) +
            ", data type " + std::to_string(dataType) + (record == action.record ? "" : ", another record"),
        "all arguments of the start");
}

void Object::onEvent(uint32_t /*event*/, uint64_t /*data*/) {}

void Object::onDelivery(const tagNkMAIDFileInfo& /*info*/, const uint8_t* /*bytes*/) {
  fault("a delivery came to an object that transfers nothing", "deliveries to data objects only");
}

void Object::onCompletion(uint32_t /*capability*/, int32_t /*result*/) {}

}  // namespace modulecheck
