#include "NikonObject.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <new>
#include <set>
#include <utility>

#include "DebugTrace.h"
#include "Exception.h"
#include "Log.h"
#include "ModuleLoading.h"
#include "NameTables.h"
#include "Thread.h"

namespace {

using namespace std::chrono_literals;

constexpr auto kDeletionLockWait = 30s;
constexpr auto kAbandonedPatience = 10s;
// For a call about an object that is being deleted.
constexpr auto kCallWait = 5s;

std::chrono::steady_clock::rep steadyNow() { return std::chrono::steady_clock::now().time_since_epoch().count(); }

// Addresses under which the SDK still knows an object that has gone.
struct Stranded {
  platform::Mutex lock;
  std::set<const void*> addresses GUARDED_BY(lock);
};

Stranded& stranded() {
  static auto* const all = new Stranded;
  return *all;
}

}  // namespace

// Never destroyed: threads may hold them until the last moment of the process.
platform::RecursiveTimedLock& gNikonObjectLock = *new platform::RecursiveTimedLock;
platform::RecursiveTimedLock& gNikonAsyncLock = *new platform::RecursiveTimedLock;

// Callbacks, as they are where no class of the tree knows better.

void CNikonCallbackReceiver::completionCallback(std::int32_t /*command*/, std::int32_t /*result*/, void* /*context*/) {}

std::int32_t CNikonCallbackReceiver::dataCallback(void* /*dataInfo*/, void* /*data*/) { return 0; }

void CNikonCallbackReceiver::eventNotification(std::int32_t /*event*/, void* /*data*/) {}

std::int32_t CNikonObject::dataCallback(void* /*dataInfo*/, void* /*data*/) {
  debugmsg("Unhandled data callback");
  return 0;
}

void CNikonObject::eventNotification(std::int32_t event, void* /*data*/) {
  debugmsgstr("Event Notification: %s", eventToName(event));
  debugmsgstr("Unhandled event: %s", eventToName(event));
}

// Construction.

CNikonObject::CNikonObject(NkMAIDEntryPoint* entryPoint, const std::string& /*name*/) : _entryPoint(entryPoint) {
  init(nullptr, 0);
}

CNikonObject::CNikonObject(CNikonObject* parentObject, unsigned long id, const char* /*name*/)
    : _entryPoint(parentObject == nullptr ? nullptr : parentObject->_entryPoint) {
  if (parentObject == nullptr) {
    platform::failAssertion("parentObject != NULL", "CNikonObject", "plugins/tether_nikon/source/NikonUtils", 255);
  }
  init(parentObject, static_cast<std::int32_t>(id));
}

std::unique_ptr<CNikonObject> CNikonObject::openModule(NkMAIDEntryPoint* entryPoint, const std::string& name) {
  auto module = std::make_unique<CNikonObject>(entryPoint, name);
  module->openGate();
  return module;
}

std::int32_t InitializeNikonModule(NkMAIDEntryPoint* entryPoint, const std::string& name) {
  try {
    const auto module = CNikonObject::openModule(entryPoint, name);
    module->readCapabilities();
    module->debugDumpCapabilities();
    return kNkMAIDResult_NoError;
  } catch (std::int32_t result) {
    return result;
  }
}

void CNikonObject::init(CNikonObject* parentObject, std::int32_t id) {
  // What needs memory comes before the open: nothing may keep an opened object from being closed.
  auto record = std::make_shared<SdkRecord>(_entryPoint, parentObject == nullptr ? nullptr : parentObject->record());
  _gate = CallbackGate::make(static_cast<CNikonCallbackReceiver*>(this));
  // The SDK knows an object by the address at which its callbacks are received.
  record->get()->refClient = static_cast<CNikonCallbackReceiver*>(this);
  const std::int32_t result = openBelow(parentObject, record->get(), id);
  if (result != kNkMAIDResult_NoError) {
    closeGate();
    debugmsgstr("Error from Command_Open: %s", errorToName(result));
    throw result;
  }
  {
    const platform::Guard guard(_stateLock);
    _object = record;
  }
  _opened = std::move(record);
  _parent = parentObject;
  _objectId = id;
  if (parentObject != nullptr) abandon(parentObject->_abandonedSince);
  readCapabilities();
  registerCallback(kNkMAIDCapability_EventProc, reinterpret_cast<void (*)()>(MAIDEventHandler));
  registerCallback(kNkMAIDCapability_DataProc, reinterpret_cast<void (*)()>(MAIDDataHandler));
}

std::int32_t CNikonObject::openBelow(const CNikonObject* parentObject, tagNkMAIDObject* object, std::int32_t id) {
  if (parentObject == nullptr) return Command_Open(_entryPoint, nullptr, object, id);
  const SdkRecord::Call call(parentObject->record());
  // Without its parent's record the child would be opened as a module.
  return call ? Command_Open(_entryPoint, call.object(), object, id)
              : static_cast<std::int32_t>(kNkMAIDResult_ZombieObject);
}

void CNikonObject::registerCallback(std::int32_t capability, void (*procedure)()) {
  const tagNkMAIDCallback callback{procedure, static_cast<CNikonCallbackReceiver*>(this)};
  setCapability(capability, kNkMAIDDataType_CallbackPtr, sdkData(&callback));
}

bool CNikonObject::unregisterCallback(std::int32_t capability) {
  const std::int32_t result = setCapability(capability, kNkMAIDDataType_Null, 0);
  return result == kNkMAIDResult_NoError || result == kNotAnnounced;
}

// Teardown.

CNikonObject::~CNikonObject() {
  closeGate();
  // Before the lock is taken: a callback inside a descendant, which is waited for, may want the lock itself.
  std::vector<std::shared_ptr<CallbackGate>> below;
  collectGatesBelow(below);
  for (const auto& gate : below) gate->close();
  const std::string thread = platform::Thread::current()->description();
  const auto address = static_cast<unsigned>(reinterpret_cast<std::uintptr_t>(this));
  while (!gNikonObjectLock.try_lock_for(kDeletionLockWait)) {
    platform::log("*** COULD NOT ACQUIRE LOCK! ACQLOCK  Thread: %s - For deleting CNikonObject: 0x%x", thread.c_str(),
                  address);
  }
  const std::unique_lock guard(gNikonObjectLock, std::adopt_lock);
  platform::log("Thread: %s - Did acquire lock - ACQLOCK - for deleting CNikonObject: 0x%x", thread.c_str(), address);
  const bool noEvents = unregisterCallback(kNkMAIDCapability_EventProc);
  const bool noData = unregisterCallback(kNkMAIDCapability_DataProc);
  deleteChildren();
  closeRecord(kCallWait);
  if (!_opened->isClosed() && !(noEvents && noData)) {
    Stranded& all = stranded();
    const platform::Guard strandedGuard(all.lock);
    all.addresses.insert(this);
  }
  if (_parent != nullptr) _parent->removeChild(this);
  platform::log("Thread: %s - Releasing lock - ACQLOCK - for deleting CNikonObject: 0x%x", thread.c_str(), address);
}

// Not inlined: the compiler would take the pair for a mismatched one.
[[gnu::noinline]] void* CNikonObject::operator new(std::size_t size) { return ::operator new(size); }

void CNikonObject::operator delete(void* memory) {
  {
    Stranded& all = stranded();
    const platform::Guard guard(all.lock);
    if (all.addresses.count(memory) != 0) return;
  }
  ::operator delete(memory);
}

void CNikonObject::shutGates() {
  std::vector<std::shared_ptr<CallbackGate>> gates{_gate};
  collectGatesBelow(gates);
  for (const auto& gate : gates) gate->shut();
}

// A child that another thread is deleting cannot go as long as its parent's lock is held.
void CNikonObject::collectGatesBelow(std::vector<std::shared_ptr<CallbackGate>>& gates) const {
  const platform::Guard guard(_stateLock);
  const auto collect = [&](const CNikonObject* child) {
    if (child == nullptr) return;
    gates.push_back(child->_gate);
    child->collectGatesBelow(gates);
  };
  for (const auto& [id, child] : _children) collect(child);
  for (const CNikonObject* const child : _replacedChildren) collect(child);
}

void CNikonObject::deleteChildren() {
  while (CNikonObject* child = takeNextChild()) delete child;
}

// Ascending by id; each leaves its parent in its own destructor, which finds its entry empty or gone.
CNikonObject* CNikonObject::takeNextChild() {
  const platform::Guard guard(_stateLock);
  for (auto& [id, child] : _children) {
    if (child != nullptr) return std::exchange(child, nullptr);
  }
  if (_replacedChildren.empty()) return nullptr;
  CNikonObject* const last = _replacedChildren.back();
  _replacedChildren.pop_back();
  return last;
}

// Without a wait: it may come from a completion, which the call of another thread is waiting for.
void CNikonObject::closeNikonObject() { closeRecord(0ms); }

void CNikonObject::closeRecord(std::chrono::milliseconds wait) {
  std::shared_ptr<SdkRecord> record;
  {
    const platform::Guard guard(_stateLock);
    record.swap(_object);
  }
  if (record) SdkRecord::close(record, wait);
}

bool CNikonObject::hasChildren() const {
  const platform::Guard guard(_stateLock);
  return !_children.empty() || !_replacedChildren.empty();
}

std::shared_ptr<SdkRecord> CNikonObject::record() const {
  const platform::Guard guard(_stateLock);
  return _object;
}

std::shared_ptr<tagNkMAIDObject> CNikonObject::getObject() const {
  const auto open = record();
  return open ? std::shared_ptr<tagNkMAIDObject>(open, open->get()) : nullptr;
}

// Children.

void CNikonObject::addChild(std::int32_t id, CNikonObject* child) {
  const platform::Guard guard(_stateLock);
  CNikonObject*& entry = _children[id];
  if (entry != nullptr && entry != child) _replacedChildren.push_back(entry);
  entry = child;
  if (_abandonedSince != 0) child->abandon(_abandonedSince);
}

void CNikonObject::removeChild(CNikonObject* child) {
  if (child == nullptr) return;
  const platform::Guard guard(_stateLock);
  _replacedChildren.erase(std::remove(_replacedChildren.begin(), _replacedChildren.end(), child),
                          _replacedChildren.end());
  const auto found = _children.find(child->id());
  // Another child may have taken the entry over.
  if (found != _children.end() && (found->second == child || found->second == nullptr)) _children.erase(found);
}

void CNikonObject::abandonWaits() { abandon(steadyNow()); }

void CNikonObject::abandon(Time since) {
  if (since == 0) return;
  _abandonedSince = since;  // before the children are looked at: one that comes now sees it
  const platform::Guard guard(_stateLock);
  for (const auto& [id, child] : _children) {
    if (child != nullptr) child->abandon(since);
  }
  for (CNikonObject* const child : _replacedChildren) child->abandon(since);
}

void CNikonObject::noteDelivery() {
  const Time now = steadyNow();
  for (CNikonObject* object = this; object != nullptr; object = object->_parent) object->_lastDelivery = now;
}

// Whatever comes from the abandoned object, of this picture or of one before it, shows that it is still there.
bool CNikonObject::isGivenUp() const {
  if (_abandonedSince == 0) return false;
  const CNikonObject* top = this;
  while (top->_parent != nullptr && top->_parent->_abandonedSince != 0) top = top->_parent;
  const std::chrono::steady_clock::duration silence(steadyNow() -
                                                    std::max<Time>(top->_abandonedSince, top->_lastDelivery));
  return silence >= kAbandonedPatience;
}

CNikonObject* CNikonObject::openChild(std::int32_t id, const char* name) {
  {
    const platform::Guard guard(_stateLock);
    const auto found = _children.find(id);
    if (found != _children.end() && found->second != nullptr) return found->second;
  }
  try {
    auto child = std::make_unique<CNikonObject>(this, static_cast<std::uint32_t>(id), name);
    addChild(id, child.get());
    child->openGate();
    return child.release();
  } catch (std::int32_t result) {
    debugmsgint("Error opening child: %ld", result);
    return nullptr;
  }
}

std::int32_t CNikonObject::enumChildren() { return send(kNkMAIDCommand_EnumChildren, 0, kNkMAIDDataType_Null, 0); }

std::int32_t CNikonObject::listChildren(std::vector<std::int32_t>& ids) {
  ids.clear();
  if (!checkObject()) return kNotOpen;
  tagNkMAIDEnum record{};
  std::vector<char> elements;
  std::int32_t result = getCapability(kNkMAIDCapability_Children, kNkMAIDDataType_EnumPtr, sdkData(&record));
  if (result == kNkMAIDResult_NoError && record.elementCount > 0) {
    result = record.elementSize == sizeof(std::int32_t) ? readEnumArray(kNkMAIDCapability_Children, record, elements)
                                                        : kNotOpen;
  }
  if (result == kNoMemory) result = kNkMAIDResult_OutOfMemory;
  if (result != kNkMAIDResult_NoError) {
    debugDumpError(result);
    return result;
  }
  ids.resize(elements.size() / sizeof(std::int32_t));
  if (!ids.empty()) std::copy(elements.begin(), elements.end(), reinterpret_cast<char*>(ids.data()));
  debugmsg("Children found:");
  for (const std::int32_t child : ids) debugmsgint("\t ID: %d", child);
  return kNkMAIDResult_NoError;
}
