// The SDK object tree: one CNikonObject for every opened SDK object, module, device, item or data object.
//
// A parent owns its children and deletes them before it closes itself, so that the deepest go first. SDK callbacks
// arrive on the thread that is calling into the SDK when it delivers them; none enters an object that is not whole, and
// the destructor waits for those inside on other threads.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "CallbackGate.h"
#include "KtLuaTableMarshalling.h"
#include "Locks.h"
#include "MAID.h"
#include "SdkRecord.h"

// What operations report besides the SDK's own results: the object is not open, or a type or layout is not handled,
inline constexpr std::int32_t kNotOpen = -1;
// and the object does not announce the capability.
inline constexpr std::int32_t kNotAnnounced = 50000;

// No array that the SDK announces is believed to be larger than this many bytes.
inline constexpr std::uint64_t kLargestSdkArray = std::uint64_t{64} << 20;

// Held while an item is downloaded, while settings are gathered, and at the end of the service.
extern platform::RecursiveTimedLock& gNikonAsyncLock;
// Held by a CNikonObject destructor for its whole subtree, and by whoever is to decide that an item is deleted. Never
// held when the other one is taken.
extern platform::RecursiveTimedLock& gNikonObjectLock;
inline platform::RecursiveTimedLock& getAsyncLock() { return gNikonAsyncLock; }

class CNikonCallbackReceiver {
 public:
  virtual void completionCallback(std::int32_t command, std::int32_t result, void* context);
  virtual std::int32_t dataCallback(void* dataInfo, void* data);
  virtual void eventNotification(std::int32_t event, void* data);

 protected:
  CNikonCallbackReceiver() = default;
  ~CNikonCallbackReceiver() = default;
};

class CNikonObject : public CNikonCallbackReceiver {
 public:
  // Opens a module. Throws the SDK's result, a std::int32_t, when that fails. The name is for people only.
  CNikonObject(NkMAIDEntryPoint* entryPoint, const std::string& name);
  // A module as a plain object, all of it there, callbacks let in. Throws like the constructor.
  static std::unique_ptr<CNikonObject> openModule(NkMAIDEntryPoint* entryPoint, const std::string& name);
  // Opens a child. The creator enters it into the parent with addChild. Throws like the other; the parent must not be
  // null and must outlive the child.
  CNikonObject(CNikonObject* parentObject, unsigned long id, const char* name);
  CNikonObject(const CNikonObject&) = delete;
  CNikonObject& operator=(const CNikonObject&) = delete;

  // Modules and cameras use this: a data callback is logged and answered with 0.
  std::int32_t dataCallback(void* dataInfo, void* data) override;
  void eventNotification(std::int32_t event, void* data) override;
  // Deletes the children, closes the object and leaves the parent, all under the deletion lock.
  virtual ~CNikonObject();
  // The memory of an object that the SDK did not let go of is not used again: what is still called back for it must not
  // find another object there.
  static void* operator new(std::size_t size);
  static void operator delete(void* memory);

  // Children. Ids are the SDK's. An entry that is replaced stays the parent's until it is removed.
  void addChild(std::int32_t id, CNikonObject* child);
  void removeChild(CNikonObject* child);
  // The child of that id, opened as a plain object where there is none yet; null when that fails.
  CNikonObject* openChild(std::int32_t id, const char* name);
  // The SDK object is as good as gone: a wait for an action of this object, or of one below it or yet to be opened
  // there, is given up when nothing has been delivered for ten seconds from now. Any thread.
  void abandonWaits();
  // Asks the SDK to look for children. An SDK result, or -1.
  std::int32_t enumChildren();
  // The ids that the SDK lists, in its order; none on failure. 0, an SDK result, or -1.
  std::int32_t listChildren(std::vector<std::int32_t>& ids);

  // Closes the SDK object early; what needs it afterwards reports -1. Where another thread is in a call about it, that
  // closes it when it is back. Again: nothing.
  void closeNikonObject();
  // Whether anything opened below it is still there. Any thread.
  bool hasChildren() const;
  bool checkObject() const { return getObject() != nullptr; }
  // The SDK's record of the object, null once it is closed. For looking at: calls go through the operations here.
  std::shared_ptr<tagNkMAIDObject> getObject() const;
  std::int32_t id() const { return _objectId; }
  void setInUse(bool inUse) { _inUse = inUse; }

  // Capabilities. Every operation that is not said to do otherwise gives 0, an SDK result, -1 (not open, or of a type
  // that is not handled) or 50000 (not announced), and writes its out argument on success only.

  // Reads the list of what the object announces; a failure leaves what was read before.
  void readCapabilities();
  // Whether the capability is announced; `info`, if given, gets its entry, which lives until the list is read again.
  bool hasCapability(std::int32_t capability, const tagNkMAIDCapInfo** info = nullptr) const;
  void debugDumpCapabilities();

  std::int32_t getCapability(std::int32_t capability, std::uint32_t dataType, std::uint64_t data);
  std::int32_t setCapability(std::int32_t capability, std::uint32_t dataType, std::uint64_t data);
  std::int32_t getCapabilityArray(std::int32_t capability, std::uint32_t dataType, std::uint64_t data);

  std::int32_t getIntCapability(std::int32_t capability, std::int32_t& value);
  std::int32_t getBoolCapability(std::int32_t capability, bool& value);
  std::int32_t getStringCapability(std::int32_t capability, std::string& value);
  // The current element of an enumeration. -1 also when it is not announced as one, or the index is beyond its end.
  std::int32_t getEnumIntCapability(std::int32_t capability, std::int32_t& value);
  std::int32_t getEnumStringCapability(std::int32_t capability, std::string& value);
  // The capability's value for the host, or null when it cannot be read.
  std::unique_ptr<KtLuaTE> getCapabilityAsTE(std::int32_t capability);

  // Starts an action. With a receiver, which hears of its completion, drives the SDK on this thread until the
  // completion has come, a poll fails, or the object is abandoned; there is no time limit. A start that failed is not
  // waited for.
  std::int32_t capStart(std::int32_t capability, CNikonCallbackReceiver* receiver, void* context);
  // Starts an action if it is announced. 0, also where it is not, or an SDK result.
  std::int32_t issueCommand(std::int32_t capability, CNikonCallbackReceiver* receiver, void* context);
  // Lets the SDK do its pending work, delivering events, data and completions. False when the object is not open or
  // the SDK reports a failure.
  bool async();

 protected:
  const std::shared_ptr<CallbackGate>& gate() const { return _gate; }
  // Callbacks may come in: last thing in the constructor of the class that the object is made of.
  void openGate() { _gate->open(); }
  // No callback is inside, none comes any more: first thing in the destructor of every class that handles one.
  void closeGate() { _gate->close(); }
  // No callback of this object or of one below it comes any more. Waits for none.
  void shutGates();
  bool inUse() const { return _inUse; }
  // Something of this object has been delivered: a wait for it goes on though it was abandoned. Any thread.
  void noteDelivery();
  // What the last poll of this object answered.
  std::int32_t lastPollResult() const { return _lastPollResult; }
  CNikonObject* parent() const { return _parent; }

 private:
  // There was no memory for an enumeration's elements; no operation reports it.
  static constexpr std::int32_t kNoMemory = -2;
  using Time = std::chrono::steady_clock::rep;  // of the steady clock; 0 for none

  void abandon(Time since);
  bool isGivenUp() const;
  std::shared_ptr<SdkRecord> record() const;
  void closeRecord(std::chrono::milliseconds wait);
  void collectGatesBelow(std::vector<std::shared_ptr<CallbackGate>>& gates) const;
  void init(CNikonObject* parentObject, std::int32_t id);
  std::int32_t openBelow(const CNikonObject* parentObject, tagNkMAIDObject* object, std::int32_t id);
  void registerCallback(std::int32_t capability, void (*procedure)());
  bool unregisterCallback(std::int32_t capability);
  void deleteChildren();
  CNikonObject* takeNextChild();
  const tagNkMAIDCapInfo* findCapability(std::int32_t capability) const;
  std::int32_t send(std::uint32_t command, std::uint32_t parameter, std::uint32_t dataType, std::uint64_t data);
  std::int32_t readCapabilitiesOnce(bool& again);
  int IdleLoop(tagNkMAIDObject* object, const std::atomic<std::uint32_t>* counter, std::uint32_t target);
  std::int32_t readEnumArray(std::int32_t capability, tagNkMAIDEnum& record, std::vector<char>& elements);
  std::int32_t getEnumStringCapability_packed(std::int32_t capability, tagNkMAIDEnum& record, std::string& value);
  std::int32_t getEnumStringCapability_unpacked(std::int32_t capability, tagNkMAIDEnum& record, std::string& value);
  std::unique_ptr<KtLuaTE> getEnumAsTE(std::int32_t capability);

  // Of an object before those of its children.
  mutable platform::Mutex _stateLock;
  std::shared_ptr<SdkRecord> _object GUARDED_BY(_stateLock);
  std::shared_ptr<SdkRecord> _opened;  // also when it is closed
  CNikonObject* _parent = nullptr;
  std::map<std::int32_t, CNikonObject*> _children GUARDED_BY(_stateLock);
  std::vector<CNikonObject*> _replacedChildren GUARDED_BY(_stateLock);
  std::int32_t _capabilityCount = 0;
  std::unique_ptr<tagNkMAIDCapInfo[]> _capabilities;
  std::int32_t _objectId = 0;
  NkMAIDEntryPoint* _entryPoint;
  std::atomic<bool> _inUse{false};
  std::atomic<Time> _abandonedSince{0};
  std::atomic<Time> _lastDelivery{0};  // to this object or to one below it
  std::atomic<std::int32_t> _lastPollResult{0};
  std::shared_ptr<CallbackGate> _gate;
};

// Opens a module, writes its capability list to the debug log and closes it again. 0, or the SDK's result.
std::int32_t InitializeNikonModule(NkMAIDEntryPoint* entryPoint, const std::string& name);

// What the SDK calls back. Each finds its object, hands on, lets no exception through, and answers 0 for an object that
// is not there.
extern "C" {
void MAIDEventHandler(void* reference, std::uint32_t event, std::uint64_t data);
std::int32_t MAIDDataHandler(void* reference, void* dataInfo, void* data);
void CommandCompletionProc(tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter,
                           std::uint32_t dataType, std::uint64_t data, void* reference, std::int32_t result);
}
