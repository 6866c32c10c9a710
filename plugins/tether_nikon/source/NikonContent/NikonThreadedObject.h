// An SDK object whose callbacks run on the download thread. One that arrives on another thread is carried there, and
// the delivering thread waits until it has run, so that what the SDK passed stays valid meanwhile. A download thread
// that waits for a transfer runs it between two polls; one that does not get to it in a moment leaves it to the
// delivering thread.
//
// Without a download thread, from inside another callback, and on a thread that holds the SDK access lock, they run
// where they are delivered.
#pragma once

#include <atomic>

#include "HomeThread.h"
#include "NikonObject.h"

class CNikonThreadedObject : public CNikonObject {
 public:
  CNikonThreadedObject(CNikonObject* parentObject, unsigned long id, const char* name)
      : CNikonObject(parentObject, id, name) {}

  void completionCallback(std::int32_t command, std::int32_t result, void* context) override;
  // Carried, any result other than 0 becomes 1; delivered on the right thread, it stays as it is.
  std::int32_t dataCallback(void* dataInfo, void* data) override;
  void eventNotification(std::int32_t event, void* data) override;
  ~CNikonThreadedObject() override { closeGate(); }

  // What subclasses handle instead.
  virtual void completionCallback_thread(std::int32_t command, std::int32_t result, void* context);
  virtual std::int32_t dataCallback_thread(void* dataInfo, void* data);
  virtual void eventNotification_thread(std::int32_t event, void* data);

  // Not owned; null for none.
  void setDownloadThread(HomeThread* thread) { _downloadThread = thread; }
  HomeThread* downloadThread() const { return _downloadThread; }
  bool shouldPassToDownloadThread() const;

 private:
  friend class MessageForwardPackage;

  std::atomic<HomeThread*> _downloadThread{nullptr};
};

// One callback on its way to the download thread. Owns nothing that it points to.
class MessageForwardPackage {
 public:
  static MessageForwardPackage initCompletionWithTargetObject(CNikonThreadedObject* target, std::int32_t commandId,
                                                              std::int32_t errorCode, void* data);
  static MessageForwardPackage initDataWithTargetObject(CNikonThreadedObject* target, void* dataInfo, void* data);
  static MessageForwardPackage initEventNotificationWithTargetObject(CNikonThreadedObject* target, std::int32_t eventId,
                                                                     void* data);

  // Runs forwardMessage on the target's download thread and waits for it. The target may be gone afterwards.
  void performOnDownloadThread();
  // Hands the callback to its target, unless that has gone meanwhile. On the download thread.
  void forwardMessage();
  bool getResult() const { return _result != 0; }

 private:
  enum CallbackType : std::int32_t { kCompletion = 0, kData = 1, kEvent = 2 };

  MessageForwardPackage(CallbackType type, CNikonThreadedObject* target);

  std::int32_t _callbackType;
  std::int32_t _commandId = 0;  // of a completion; the event of an event
  std::int32_t _errorCode = 0;
  void* _dataInfo = nullptr;
  void* _data = nullptr;  // the context of a completion
  CNikonThreadedObject* _targetObject;
  std::int32_t _result = 0;
  std::shared_ptr<CallbackGate> _gate;
};
