#include "DebugTrace.h"

#include <atomic>
#include <cstdio>
#include <cstring>
#include <memory>

#include "Locks.h"
#include "Log.h"

namespace {

constexpr std::size_t kLongestText = 2048;  // with its NUL

using Sink = std::function<void(const char*)>;

platform::Mutex sinkLock;
std::atomic<bool> hasSink{false};

std::shared_ptr<const Sink>& replacement() REQUIRES(sinkLock) {
  static std::shared_ptr<const Sink> sink;
  return sink;
}

void standingSink([[maybe_unused]] const char* text) {
#if defined(TETHER_TRACE_TO_STDERR)
  platform::log("%s", text);
#endif
}

}  // namespace

void debugmsg(const char* text) {
  if (!hasSink) {
    standingSink(text);
    return;
  }
  std::shared_ptr<const Sink> sink;
  {
    const platform::Guard guard(sinkLock);
    sink = replacement();
  }
  if (sink) (*sink)(text);
}

// The formats are checked where they are written.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"

void debugmsgint(const char* format, int value) {
  char text[kLongestText];
  if (std::strstr(format, "%ld") != nullptr) {
    std::snprintf(text, sizeof text, format, static_cast<long>(value));
  } else {
    std::snprintf(text, sizeof text, format, value);
  }
  debugmsg(text);
}

void debugmsgstr(const char* format, const char* value) {
  char text[kLongestText];
  std::snprintf(text, sizeof text, format, value);
  debugmsg(text);
}

#pragma GCC diagnostic pop

void setDebugSink(std::function<void(const char*)> sink) {
  auto fresh = sink ? std::make_shared<const Sink>(std::move(sink)) : nullptr;
  const platform::Guard guard(sinkLock);
  hasSink = fresh != nullptr;
  replacement().swap(fresh);
}
