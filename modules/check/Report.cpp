#include "Report.h"

#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <new>
#include <string_view>

namespace modulecheck {
namespace {

Activity* activityOfThisThread(Shared& shared) {
  struct Place {
    ~Place() {
      if (activity != nullptr) activity->taken = false;
    }
    Activity* activity = nullptr;
  };
  thread_local Place place;
  for (Activity& activity : shared.activities) {
    if (place.activity == nullptr && !activity.taken.exchange(true)) place.activity = &activity;
  }
  return place.activity;
}

std::string withoutNumbers(std::string text) {
  text.erase(std::remove_if(text.begin(), text.end(), [](char c) { return c >= '0' && c <= '9'; }), text.end());
  return text;
}

void set(Activity& activity, std::string_view text, int64_t since) {
  activity.since = 0;  // nobody reads a text that is being written
  activity.text[text.copy(activity.text, sizeof activity.text - 1)] = '\0';
  activity.since = since;
}

}  // namespace

Shared& makeShared() {
  void* const memory = mmap(nullptr, sizeof(Shared), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
  if (memory == MAP_FAILED) throw std::bad_alloc();
  return *new (memory) Shared;
}

bool Report::isNew(const std::string& kind) {
  const platform::Guard guard(_lock);
  return _told.insert(kind).second;
}

void Report::write(const std::string& line) const {
  const std::string whole = line + '\n';
  while (::write(_output, whole.data(), whole.size()) < 0 && errno == EINTR) {
  }
}

void Report::fault(const std::string& level, const std::string& object, const std::string& what,
                   const std::string& expected) {
  if (!isNew(level + withoutNumbers(what))) return;
  ++_shared.faults;
  write(object + ": " + what + "; expected: " + expected);
}

void Report::note(const std::string& level, const std::string& object, const std::string& what) {
  if (isNew(level + withoutNumbers(what))) write("note: " + object + ": " + what);
}

Doing::Doing(Shared& shared, const std::string& text) : _activity(activityOfThisThread(shared)) {
  if (_activity == nullptr) return;
  _outerSince = _activity->since;
  std::memcpy(_outerText, _activity->text, sizeof _outerText);
  set(*_activity, text, Clock::now().time_since_epoch().count());
}

Doing::~Doing() {
  if (_activity != nullptr) set(*_activity, _outerText, _outerSince == 0 ? 0 : Clock::now().time_since_epoch().count());
}

}  // namespace modulecheck
