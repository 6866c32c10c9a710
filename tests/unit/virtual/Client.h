// A client of a camera module as small as it can be: one opened object, with what it was told.
#pragma once

#include <atomic>
#include <cstring>
#include <functional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "MAID.h"

namespace virtualcamera::test {

struct Delivery {
  tagNkMAIDFileInfo info;
  std::vector<uint8_t> bytes;
  std::thread::id thread;
};

// Opens in the constructor, registers its callbacks, closes in the destructor.
class Client {
 public:
  Client(NkMAIDEntryPoint* entry, Client* parent, uint32_t id) : entry_(entry) {
    record_.refClient = this;
    opened = entry_(parent ? &parent->record_ : nullptr, kNkMAIDCommand_Open, id, kNkMAIDDataType_ObjectPtr,
                    reinterpret_cast<uint64_t>(&record_), nullptr, nullptr);
    if (opened == kNkMAIDResult_NoError) listen();
  }
  Client(Client& parent, uint32_t id) : Client(parent.entry_, &parent, id) {}
  ~Client() { close(); }
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  void listen() {
    tagNkMAIDCallback forEvents{reinterpret_cast<void (*)()>(&onEvent), this};
    tagNkMAIDCallback forData{reinterpret_cast<void (*)()>(&onData), this};
    send(kNkMAIDCommand_CapSet, kNkMAIDCapability_EventProc, kNkMAIDDataType_CallbackPtr, &forEvents);
    send(kNkMAIDCommand_CapSet, kNkMAIDCapability_DataProc, kNkMAIDDataType_CallbackPtr, &forData);
  }

  int32_t send(uint32_t command, uint32_t parameter = 0, uint32_t dataType = 0, void* data = nullptr) {
    return entry_(&record_, command, parameter, dataType, reinterpret_cast<uint64_t>(data), nullptr, nullptr);
  }
  int32_t close() {
    if (opened != kNkMAIDResult_NoError) return opened;
    opened = kNkMAIDResult_ZombieObject;
    return send(kNkMAIDCommand_Close);
  }
  int32_t poll() { return send(kNkMAIDCommand_Async); }
  int32_t get(uint32_t capability, uint32_t dataType, void* data) {
    return send(kNkMAIDCommand_CapGet, capability, dataType, data);
  }
  int32_t start(uint32_t capability) {
    return entry_(&record_, kNkMAIDCommand_CapStart, capability, 0, 0, &onCompletion, this);
  }
  // Polls until a completion has come or a poll fails.
  int32_t finish() {
    for (const size_t before = completed; completed == before;)
      if (const int32_t result = poll(); result < 0) return result;
    return completions.back();
  }

  uint32_t getUnsigned(uint32_t capability) {
    uint32_t value = 0xdeadbeef;
    get(capability, kNkMAIDDataType_UnsignedPtr, &value);
    return value;
  }
  std::string getString(uint32_t capability) {
    char text[kNkMAIDStringSize];
    std::memset(text, '?', sizeof text);
    return get(capability, kNkMAIDDataType_StringPtr, text) == 0 ? std::string(text, strnlen(text, sizeof text)) : "!";
  }
  bool isAlive() {
    uint8_t value = 2;
    return get(kNkMAIDCapability_IsAlive, kNkMAIDDataType_BooleanPtr, &value) == 0 && value == 1;
  }
  // Header and elements of an enumeration; no elements where one of the two reads fails.
  std::pair<tagNkMAIDEnum, std::vector<uint8_t>> getEnum(uint32_t capability) {
    tagNkMAIDEnum header{};
    if (get(capability, kNkMAIDDataType_EnumPtr, &header) != 0) return {};
    std::vector<uint8_t> bytes(size_t{header.elementCount} * static_cast<size_t>(header.elementSize));
    header.elements = bytes.data();
    if (send(kNkMAIDCommand_CapGetArray, capability, kNkMAIDDataType_EnumPtr, &header) != 0) bytes.clear();
    return {header, bytes};
  }
  std::vector<uint32_t> children() {
    const auto [header, bytes] = getEnum(kNkMAIDCapability_Children);
    std::vector<uint32_t> ids(bytes.size() / sizeof(uint32_t));
    if (!ids.empty()) std::memcpy(ids.data(), bytes.data(), bytes.size());
    return ids;
  }
  std::vector<uint8_t> received() const {
    std::vector<uint8_t> all;
    for (const Delivery& delivery : deliveries) all.insert(all.end(), delivery.bytes.begin(), delivery.bytes.end());
    return all;
  }

  using Events = std::vector<std::pair<uint32_t, uint64_t>>;
  Events events;
  std::vector<Delivery> deliveries;
  std::vector<int32_t> completions;
  std::atomic<size_t> completed{0};  // how many, for threads other than the one that calls back
  std::thread::id completionThread;
  std::function<void()> inCallback;
  int32_t answer = 0;
  int32_t opened;

 private:
  static void onEvent(void* reference, uint32_t event, uint64_t data) {
    auto* self = static_cast<Client*>(reference);
    self->events.emplace_back(event, data);
    if (self->inCallback) self->inCallback();
  }
  static int32_t onData(void* reference, void* info, void* data) {
    auto* self = static_cast<Client*>(reference);
    const auto& record = *static_cast<tagNkMAIDFileInfo*>(info);
    const auto* bytes = static_cast<uint8_t*>(data);
    self->deliveries.push_back({record, {bytes, bytes + record.ulLength}, std::this_thread::get_id()});
    if (self->inCallback) self->inCallback();
    return self->answer;
  }
  static void onCompletion(tagNkMAIDObject*, uint32_t, uint32_t, uint32_t, uint64_t, void* reference, int32_t result) {
    auto* self = static_cast<Client*>(reference);
    self->completionThread = std::this_thread::get_id();
    self->completions.push_back(result);
    ++self->completed;
    if (self->inCallback) self->inCallback();
  }

  NkMAIDEntryPoint* entry_;
  tagNkMAIDObject record_{};
};

// The objects of one picture, opened one below the other.
struct Opened {
  Opened(Client& camera, uint32_t id) : item(camera, id), data(item, kNkMAIDDataObjType_Image) {}
  Client item;
  Client data;
};

}  // namespace virtualcamera::test
