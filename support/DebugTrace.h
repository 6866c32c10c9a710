// The debug trace: plain lines that name what is being done and carry at most one value. Any thread.
//
// Every line goes to one sink. The one that stands there drops it; a build option sends it to standard error instead.
// Standard output is the host's and never carries a line.
#pragma once

#include <functional>

void debugmsg(const char* text);

// Format the one value, up to 2047 characters; the rest is cut. The format has one integer placeholder, of an int or a
// long, or one string placeholder (or none).
[[gnu::format(printf, 1, 0)]] void debugmsgint(const char* format, int value);
[[gnu::format(printf, 1, 0)]] void debugmsgstr(const char* format, const char* value);

// Replaces the sink; an empty function brings the standing one back. For tests. It is called with no lock held.
void setDebugSink(std::function<void(const char*)> sink);
