// The spine of the program: starts everything, turns the host's messages into calls of the tether service, writes what
// goes to the host, sends the heartbeat, drives the service's idle pass, and ends the process.
//
// There is one task, on the main thread; sendMessage alone may be called from any.
#pragma once

#include <cstdint>
#include <memory>

#include "FileHandle.h"
#include "FrameWriter.h"
#include "KtLuaTableMarshalling.h"
#include "KtRCMessageAccumulator.h"
#include "Locks.h"
#include "NotificationCenter.h"
#include "RunLoop.h"

class NikonTetherService;

// The busy flag, set while one of these lives. A flag, not a counter: whoever makes one has seen it clear.
class TetherTaskStatus {
 public:
  TetherTaskStatus() { inProgress = true; }
  TetherTaskStatus(const TetherTaskStatus&) = delete;
  TetherTaskStatus& operator=(const TetherTaskStatus&) = delete;
  ~TetherTaskStatus() { inProgress = false; }
  static bool IsInProgress() { return inProgress; }

  static bool inProgress;
};

class TetherTask {
 public:
  TetherTask();
  TetherTask(const TetherTask&) = delete;
  TetherTask& operator=(const TetherTask&) = delete;
  ~TetherTask();

  // Start-up: once, before the main run loop runs.
  void awakeFromNib();

  // Encodes a message and writes it as one frame, whole among those of other threads. Both elements stay the caller's;
  // without a payload the frame carries a nil. Blocks while the host does not read. Once the host is gone for good
  // (logged the first time), frames are dropped.
  void sendMessage(const KtLuaTEString& name, std::int32_t id, const KtLuaTETable* data);

 private:
  void notificationFromAccumulator(const platform::Notification& notification);
  void dispatchMessages();
  void dispatchMessage(CRCMessage* message);
  void timer();
  void scheduleNextIdle();
  void sendHeartbeat();
  void willShutdown() {}
  void receiveWakeNote() {}

  std::unique_ptr<NikonTetherService> _tetherService;
  std::shared_ptr<platform::FileHandle> _outputFileHandle;
  std::shared_ptr<platform::FileHandle> _inputFileHandle;
  platform::Timer _timer;
  std::unique_ptr<KtRCMessageAccumulator> _messageAccumulator;

  platform::Timer _idleTimer;
  platform::Observer _accumulatorObserver;
  platform::Observer _terminateObserver;
  platform::Observer _wakeObserver;
  platform::Mutex _frameLock;
  FrameWriter _frameWriter GUARDED_BY(_frameLock);
  bool _hostIsGone GUARDED_BY(_frameLock) = false;
  std::shared_ptr<int> _alive = std::make_shared<int>();  // deferred dispatches look whether the task is still there
};

// The one task, set when it starts up.
extern TetherTask* gTetherTask;
