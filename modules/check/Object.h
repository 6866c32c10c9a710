// One opened object of the module, called as the helper calls it and watched meanwhile.
//
// Used by two threads: the main thread, and the one that transfers pictures. Callbacks come on whichever thread polls.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "Context.h"

namespace modulecheck {

// Room for a module to write into, with margins that it must leave alone. What it does not fill in shows.
class Room {
 public:
  explicit Room(size_t size, uint8_t fill = kUntouched);

  template <typename T = uint8_t>
  T* as() {
    return reinterpret_cast<T*>(_bytes.data() + kMargin);
  }
  uint64_t address() { return reinterpret_cast<uintptr_t>(as()); }
  size_t size() const { return _bytes.size() - 2 * kMargin; }
  bool isIntact() const;
  // Whether the last bytes are as they were.
  bool isUntouchedAtTheEnd(size_t count) const;

  static constexpr uint8_t kUntouched = 0xA5;

 private:
  static constexpr size_t kMargin = 256;
  static constexpr uint8_t kEdge = 0xC3;

  const uint8_t _fill;
  std::vector<uint8_t> _bytes;
};

class Object {
 public:
  Object(Context& context, Object* parent, uint32_t id, std::string level, std::string name);
  virtual ~Object() = default;
  Object(const Object&) = delete;
  Object& operator=(const Object&) = delete;

  // Opens it, reads what it announces and registers the callbacks. False, with a fault, when it cannot be opened.
  bool open();
  // Closes it and nothing else, as the end of a transfer does. Again: nothing.
  void close();
  // As an object is given up that is still open: callbacks off, then everything below it, then the close.
  void takeDown();
  bool isOpen() const { return _state == State::kOpen; }

  bool announces(uint32_t capability) const { return find(capability) != nullptr; }
  // A fault where it is missing, or of a type that the helper does not read as what it is.
  bool mustAnnounce(uint32_t capability, std::initializer_list<uint32_t> types, const char* why);

  // Values as the helper reads them; nothing where that fails, which `mustRead` makes a fault.
  enum class Reading { kMust, kMay };
  std::optional<uint32_t> number(uint32_t capability, Reading reading = Reading::kMust);
  std::optional<bool> flag(uint32_t capability);
  std::optional<std::string> text(uint32_t capability, Reading reading = Reading::kMust);
  std::optional<std::vector<uint32_t>> children();
  // One of the settings that the host is told.
  void checkSetting(uint32_t capability);

  int32_t set(uint32_t capability, uint32_t dataType, uint64_t data);
  // Starts an action and polls until it has completed, or does not go on. What its start answered, and its result.
  struct Outcome {
    int32_t answer = 0;
    std::optional<int32_t> result{};
  };
  Outcome perform(uint32_t capability);
  // False where the object says that it is gone.
  bool poll();

  void fault(const std::string& what, const std::string& expected) const;
  void note(const std::string& what) const;
  const std::string& name() const { return _name; }
  uint32_t id() const { return _id; }
  Context& context() const { return _context; }

 protected:
  // What the module calls back. By default nothing happens.
  virtual void onEvent(uint32_t event, uint64_t data);
  virtual void onDelivery(const tagNkMAIDFileInfo& info, const uint8_t* bytes);
  virtual void onCompletion(uint32_t capability, int32_t result);
  virtual std::vector<Object*> below() const { return {}; }
  // Something came that an action waits for.
  void noteProgress() { ++_progress; }

 private:
  enum class State { kNew, kOpen, kClosed };

  int32_t call(uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
               NkMAIDCompletionProc* completion = nullptr, void* reference = nullptr);
  int32_t enter(tagNkMAIDObject* record, uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
                NkMAIDCompletionProc* completion, void* reference);
  void judgeTime(const std::string& what, uint32_t command, std::chrono::nanoseconds time) const;
  bool othersLeave() const;
  void checkRoom(const Room& room, const std::string& what) const;

  bool readList();
  int32_t readListOnce(uint32_t& count);
  void checkList();
  void checkListRoom(uint32_t count);
  const tagNkMAIDCapInfo* find(uint32_t capability) const;
  void registerCallback(uint32_t capability, void (*procedure)(), std::atomic<bool>& registered);
  void unregisterCallback(uint32_t capability, std::atomic<bool>& registered);
  int32_t get(uint32_t capability, uint32_t dataType, Room& room);
  int32_t getOrComplain(uint32_t capability, uint32_t dataType, Room& room, Reading reading);
  std::optional<Room> list(uint32_t capability, tagNkMAIDEnum& header, Reading reading);
  bool fitsItsType(uint32_t capability, const tagNkMAIDEnum& header) const;
  void checkListArrayRoom(uint32_t capability, const tagNkMAIDEnum& header);
  void checkElements(uint32_t capability, const tagNkMAIDEnum& header, Room& room) const;
  void checkText(uint32_t capability, const char* bytes, size_t size) const;

  class InCallback;
  static void eventProc(void* reference, uint32_t event, uint64_t data);
  static int32_t dataProc(void* reference, void* info, void* data);
  static void completionProc(tagNkMAIDObject* record, uint32_t command, uint32_t parameter, uint32_t dataType,
                             uint64_t data, void* reference, int32_t result);
  void checkCompletion(const Action& action, const tagNkMAIDObject* record, uint32_t command, uint32_t parameter,
                       uint32_t dataType, uint64_t data) const;

  Context& _context;
  Object* const _parent;
  const uint32_t _id;
  const std::string _level;
  const std::string _name;
  Room _record{sizeof(tagNkMAIDObject), 0};
  std::atomic<State> _state{State::kNew};
  std::atomic<bool> _events{false};
  std::atomic<bool> _deliveries{false};
  std::atomic<int> _inside{0};       // calls about this object that have not returned
  std::atomic<bool> _closed{false};  // the module has said so
  std::atomic<uint64_t> _progress{0};
  std::vector<tagNkMAIDCapInfo> _list;
};

}  // namespace modulecheck
