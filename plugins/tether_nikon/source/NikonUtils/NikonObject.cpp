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

// Addresses under which the SDK still knows an object that has gone.
struct Stranded {
  std::mutex lock;
  std::set<const void*> addresses;
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

void CNikonObject::init(CNikonObject* parentObject, std::int32_t id) {
  const auto parentRecord = parentObject == nullptr ? nullptr : parentObject->getObject();
  auto record = std::make_shared<tagNkMAIDObject>();
  // The SDK knows an object by the address at which its callbacks are received.
  record->refClient = static_cast<CNikonCallbackReceiver*>(this);
  // Without its parent's record the child would be opened as a module.
  const std::int32_t result = parentObject != nullptr && parentRecord == nullptr
                                  ? static_cast<std::int32_t>(kNkMAIDResult_ZombieObject)
                                  : Command_Open(_entryPoint, parentRecord.get(), record.get(), id);
  if (result != kNkMAIDResult_NoError) {
    debugmsgstr("Error from Command_Open: %s", errorToName(result));
    throw result;
  }
  _object = std::move(record);
  _parent = parentObject;
  _objectId = id;
  _gate = CallbackGate::make(static_cast<CNikonCallbackReceiver*>(this));
  readCapabilities();
  registerCallback(kNkMAIDCapability_EventProc, reinterpret_cast<void (*)()>(MAIDEventHandler));
  registerCallback(kNkMAIDCapability_DataProc, reinterpret_cast<void (*)()>(MAIDDataHandler));
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
  closeGatesBelow();
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
  closeNikonObject();
  if (!_closed && !(noEvents && noData)) {
    const std::lock_guard strandedGuard(stranded().lock);
    stranded().addresses.insert(this);
  }
  if (_parent != nullptr) _parent->removeChild(this);
  platform::log("Thread: %s - Releasing lock - ACQLOCK - for deleting CNikonObject: 0x%x", thread.c_str(), address);
}

// Not inlined: the compiler would take the pair for a mismatched one.
[[gnu::noinline]] void* CNikonObject::operator new(std::size_t size) { return ::operator new(size); }

void CNikonObject::operator delete(void* memory) {
  {
    const std::lock_guard guard(stranded().lock);
    if (stranded().addresses.count(memory) != 0) return;
  }
  ::operator delete(memory);
}

// Before the lock is taken: a callback inside a descendant, which is waited for, may want the lock itself.
void CNikonObject::closeGatesBelow() {
  std::vector<std::shared_ptr<CallbackGate>> gates;
  collectGatesBelow(gates);
  for (const auto& gate : gates) gate->close();
}

// A child that another thread is deleting cannot go as long as its parent's lock is held.
void CNikonObject::collectGatesBelow(std::vector<std::shared_ptr<CallbackGate>>& gates) const {
  const std::lock_guard guard(_stateLock);
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
  const std::lock_guard guard(_stateLock);
  for (auto& [id, child] : _children) {
    if (child != nullptr) return std::exchange(child, nullptr);
  }
  if (_replacedChildren.empty()) return nullptr;
  CNikonObject* const last = _replacedChildren.back();
  _replacedChildren.pop_back();
  return last;
}

void CNikonObject::closeNikonObject() {
  std::shared_ptr<tagNkMAIDObject> record;
  {
    const std::lock_guard guard(_stateLock);
    record.swap(_object);
  }
  if (record) _closed = Command_Close(_entryPoint, record.get());
}

std::shared_ptr<tagNkMAIDObject> CNikonObject::getObject() const {
  const std::lock_guard guard(_stateLock);
  return _object;
}

// Children.

void CNikonObject::addChild(std::int32_t id, CNikonObject* child) {
  const std::lock_guard guard(_stateLock);
  CNikonObject*& entry = _children[id];
  if (entry != nullptr && entry != child) _replacedChildren.push_back(entry);
  entry = child;
}

void CNikonObject::removeChild(CNikonObject* child) {
  if (child == nullptr) return;
  const std::lock_guard guard(_stateLock);
  _replacedChildren.erase(std::remove(_replacedChildren.begin(), _replacedChildren.end(), child),
                          _replacedChildren.end());
  const auto found = _children.find(child->id());
  // Another child may have taken the entry over.
  if (found != _children.end() && (found->second == child || found->second == nullptr)) _children.erase(found);
}

void CNikonObject::abandonWaits() {
  _waitsAbandoned = true;
  const std::lock_guard guard(_stateLock);
  for (const auto& [id, child] : _children) {
    if (child != nullptr) child->abandonWaits();
  }
  for (CNikonObject* const child : _replacedChildren) child->abandonWaits();
}

CNikonObject* CNikonObject::openChild(std::int32_t id, const char* name) {
  {
    const std::lock_guard guard(_stateLock);
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
