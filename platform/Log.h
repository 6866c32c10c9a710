// The platform log: one stamped line on standard error, written whole. Any thread.
#pragma once

#include <functional>
#include <string>

namespace platform {

// A line that standard error cannot take at once is dropped: a log that nobody reads must not stop the program. Before
// the next line that goes out another says how many were dropped.
// Longer lines are cut at 4 KiB.
[[gnu::format(printf, 1, 2)]] void log(const char* format, ...);

// Where lines go instead, without their stamp; an empty function brings standard error back. For tests. The sink is
// called with no lock held, on the thread that logs.
void setLogSink(std::function<void(const std::string&)> sink);

}  // namespace platform
