// What the camera side says: messages to the host, debug lines and log lines. One at a time.
#pragma once

#include <condition_variable>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "NikonObject.h"
#include "VirtualCamera.h"

struct Message {
  long id;
  std::string name;
  bool hasPayload;
  std::map<std::string, double> numbers;
  std::map<std::string, std::string> strings;
  std::vector<std::string> nils;
  std::thread::id thread;
};

class Recorder {
 public:
  Recorder();
  ~Recorder();

  std::vector<Message> messages();
  // All recorded names, each with its request's id where it has one: "ok#7 cameraSettingsChanged".
  std::string names();
  // The n-th message of that name, waited for.
  Message await(const std::string& name, std::size_t n = 1);
  std::size_t count(const std::string& name);
  void forgetMessages();

  std::size_t traced(const std::string& part);
  std::size_t logged(const std::string& part);

  void add(Message message);

 private:
  std::mutex _lock;
  std::condition_variable _changed;
  std::vector<Message> _messages;
  std::vector<std::string> _trace;
  std::vector<std::string> _log;
};

// A plain object of the tree whose callbacks the test sees.
class SpyObject : public CNikonObject {
 public:
  SpyObject(NkMAIDEntryPoint* entryPoint) : CNikonObject(entryPoint, "module") { openGate(); }
  SpyObject(CNikonObject* parentObject, std::int32_t id)
      : CNikonObject(parentObject, static_cast<unsigned>(id), "spy") {
    parentObject->addChild(id, this);
    if (onConstruction) onConstruction(*this);
    openGate();
  }
  ~SpyObject() override { closeGate(); }

  void completionCallback(std::int32_t command, std::int32_t result, void* context) override {
    if (onCompletion) onCompletion(command, result, context);
  }
  std::int32_t dataCallback(void* dataInfo, void* data) override {
    return onData ? onData(dataInfo, data) : CNikonObject::dataCallback(dataInfo, data);
  }
  void eventNotification(std::int32_t event, void* data) override {
    if (onEvent) onEvent(event, data);
  }
  void* reference() { return static_cast<CNikonCallbackReceiver*>(this); }

  static std::function<void(SpyObject&)> onConstruction;
  std::function<void(std::int32_t, std::int32_t, void*)> onCompletion;
  std::function<std::int32_t(void*, void*)> onData;
  std::function<void(std::int32_t, void*)> onEvent;
};
