// Cuts the bytes that arrive on a pipe into messages.
//
// A frame is a 32-bit length (of what follows), a 32-bit id, the name element and the data element, all little-endian.
// It ends where the data element's encoding ends, wherever the length field points; the length says how many bytes to
// wait for before decoding. Where the two differ a line in the platform log says so, once until a frame fits again.
//
// A frame that can never be decoded, or that is longer than 64 MiB, is dropped with a line in the platform log: what is
// left of its announced bytes is skipped, and reading goes on with the next frame.
#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <istream>
#include <memory>
#include <string_view>

#include "Data.h"
#include "FileHandle.h"
#include "KtLuaTableMarshalling.h"
#include "Locks.h"
#include "NotificationCenter.h"
#include "RunLoop.h"
#include "Thread.h"

// Longest frame that is kept, its length field included.
inline constexpr std::int64_t kLargestFrame = kKtLuaLargestElement;

// A reader on its caller's thread reads no more when so much has come since its queue was empty last, until it is empty
// again: what nobody takes waits in the pipe, and its writer with it.
inline constexpr std::size_t kMostWaitingMessages = 10'000;
inline constexpr std::size_t kMostWaitingBytes = std::size_t{64} << 20;

// Posted through the default notification center with the reader as the object, on the thread that reads:
// once for every message put into the queue,
inline constexpr std::string_view kMessageIsAvailable = "messageIsAvailable";
// and once at the end of the input.
inline constexpr std::string_view kReadHandleIsFinished = "readHandleIsFinished";

// One message. Name or data is null where its tag was unknown.
struct CRCMessage {
  std::int32_t id = 0;
  std::unique_ptr<KtLuaTE> name;
  std::unique_ptr<KtLuaTE> data;
  std::int32_t length = 0;  // the frame's length field
};

class KtRCMessageAccumulator {
 public:
  // Reads on the calling thread's run loop. The first read is under way when this returns.
  explicit KtRCMessageAccumulator(std::shared_ptr<platform::FileHandle> source)
      : KtRCMessageAccumulator(std::move(source), false) {}
  // With `fromOrchard`, reads on a thread of its own instead.
  KtRCMessageAccumulator(std::shared_ptr<platform::FileHandle> source, bool fromOrchard);
  KtRCMessageAccumulator(const KtRCMessageAccumulator&) = delete;
  KtRCMessageAccumulator& operator=(const KtRCMessageAccumulator&) = delete;
  // Stops reading and waits for the reader's own thread, so not from an observer on that thread; without such a thread,
  // only on the thread that made the reader. Messages still queued go with it.
  ~KtRCMessageAccumulator();

  // The oldest message, or null when there is none or the queue was not to be had within 10 seconds. Any thread.
  std::unique_ptr<CRCMessage> getNextMessage();
  // Whether a message of that name is in the queue. Any thread.
  bool hasWaiting(std::string_view name);

  // How far the current message has got, and how many bytes wait for its next step. On the reading thread.
  int currentMessageStage() const { return _currentMessageStage; }
  std::size_t accumulatedLength() const { return _accumulatedData->length(); }

 private:
  friend struct KtRCMessageAccumulatorTest;  // holds the queue lock

  // What the reader waits for.
  enum Stage : std::int32_t { kLength = 0, kWholeFrame = 1, kName = 2, kData = 3, kQueue = 4 };

  struct Pass;

  void observePipeForData();
  void dataWasRead(const platform::Notification& notification);
  void formMessagesWithData(const platform::Data& chunk);
  bool mayReadOn(std::size_t chunk);
  void readOn();
  void dropConsumedBytes(const Pass& pass);
  bool step(Pass& pass);
  static bool readField(Pass& pass, std::int32_t& field);
  bool readLength(Pass& pass);
  bool readId(Pass& pass);
  void readElement(Pass& pass, std::unique_ptr<KtLuaTE>& element);
  void noteStep();
  void dropFrame(Pass& pass, const char* reason);
  void addMessageToQueue();
  bool queueCurrentMessage();
  void startNextMessage();
  void startReadThread();

  platform::TimedLock _messageQueueLock;
  std::deque<std::unique_ptr<CRCMessage>> _waitingMessages GUARDED_BY(_messageQueueLock);
  std::size_t _bytesSinceEmpty GUARDED_BY(_messageQueueLock) = 0;  // read since the queue was empty
  bool _readingRests GUARDED_BY(_messageQueueLock) = false;
  std::shared_ptr<platform::FileHandle> _sourceFileHandle;
  std::atomic<bool> _keepActiveRunloop{false};
  // Begins at the first byte that the next step needs.
  std::shared_ptr<platform::MutableData> _accumulatedData;
  std::istream _in{nullptr};  // kept: making one costs as much as decoding a small table
  std::unique_ptr<CRCMessage> _currentMessage;
  std::int32_t _currentMessageStage = kLength;

  bool _outOfStep = false;          // the last frame did not end where its length said
  std::int64_t _frameConsumed = 0;  // bytes of the current frame behind its length field that are decoded
  std::int64_t _bytesNeeded = 0;    // before the current element is decoded again
  std::int64_t _bytesToSkip = 0;    // of a dropped frame, still to arrive
  platform::Observer _readObserver;
  std::shared_ptr<platform::Thread> _readThread;
  std::shared_ptr<platform::RunLoop> _callersLoop;  // null with a thread of its own
  std::shared_ptr<int> _alive = std::make_shared<int>();
};
