// A client of a camera module as small as it can be: one opened object, with what it was told.
#pragma once

#include <atomic>
#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "CameraKit.h"

namespace camerakit::test {

// Opens in the constructor, registers its callbacks, closes in the destructor.
class Client {
 public:
  explicit Client(Client* parent = nullptr, uint32_t id = 0) {
    record_.refClient = this;
    opened = entryPoint(parent ? &parent->record_ : nullptr, kNkMAIDCommand_Open, id, kNkMAIDDataType_ObjectPtr,
                        reinterpret_cast<uint64_t>(&record_), nullptr, nullptr);
    tagNkMAIDCallback forEvents{reinterpret_cast<void (*)()>(&onEvent), this};
    tagNkMAIDCallback forData{reinterpret_cast<void (*)()>(&onData), this};
    if (opened != kNkMAIDResult_NoError) return;
    send(kNkMAIDCommand_CapSet, kNkMAIDCapability_EventProc, kNkMAIDDataType_CallbackPtr, &forEvents);
    send(kNkMAIDCommand_CapSet, kNkMAIDCapability_DataProc, kNkMAIDDataType_CallbackPtr, &forData);
  }
  Client(Client& parent, uint32_t id) : Client(&parent, id) {}
  ~Client() { close(); }
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  int32_t send(uint32_t command, uint32_t parameter = 0, uint32_t dataType = 0, void* data = nullptr) {
    return entryPoint(&record_, command, parameter, dataType, reinterpret_cast<uint64_t>(data), nullptr, nullptr);
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
  uint32_t number(uint32_t capability, uint32_t dataType = kNkMAIDDataType_UnsignedPtr) {
    uint32_t value = 0xdeadbeef;
    get(capability, dataType, &value);
    return value;
  }
  std::string name() {
    char text[kNkMAIDStringSize];
    return get(kNkMAIDCapability_Name, kNkMAIDDataType_StringPtr, text) == 0 ? text : "!";
  }
  int32_t start(uint32_t capability) {
    return entryPoint(&record_, kNkMAIDCommand_CapStart, capability, 0, 0, &onCompletion, this);
  }
  // Polls until a completion has come or a poll fails.
  int32_t finish() {
    for (const size_t before = completions.size(); completions.size() == before;)
      if (const int32_t result = poll(); result < 0) return result;
    return completions.back();
  }

  using Events = std::vector<std::pair<uint32_t, uint64_t>>;
  Events events;
  std::vector<tagNkMAIDFileInfo> deliveries;
  std::string received;
  std::vector<int32_t> completions;
  std::function<void()> inCallback;
  int32_t opened;

 private:
  int32_t called() const {
    if (inCallback) inCallback();
    return 0;
  }
  static void onEvent(void* reference, uint32_t event, uint64_t data) {
    static_cast<Client*>(reference)->events.emplace_back(event, data);
    static_cast<Client*>(reference)->called();
  }
  static int32_t onData(void* reference, void* info, void* data) {
    auto* self = static_cast<Client*>(reference);
    self->deliveries.push_back(*static_cast<tagNkMAIDFileInfo*>(info));
    self->received.append(static_cast<char*>(data), self->deliveries.back().ulLength);
    return self->called();
  }
  static void onCompletion(tagNkMAIDObject*, uint32_t, uint32_t, uint32_t, uint64_t, void* reference, int32_t result) {
    static_cast<Client*>(reference)->completions.push_back(result);
    static_cast<Client*>(reference)->called();
  }

  tagNkMAIDObject record_{};
};

// The objects of one picture, opened one below the other.
struct Opened {
  Opened(Client& camera, uint32_t id) : item(camera, id), data(item, kNkMAIDDataObjType_Image) {}
  int32_t transfer() {
    data.start(kNkMAIDCapability_Acquire);
    return data.finish();
  }
  Client item;
  Client data;
};

}  // namespace camerakit::test
