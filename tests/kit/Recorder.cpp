#include "Recorder.h"

#include <algorithm>

#include "DebugTrace.h"
#include "HostMessages.h"
#include "Log.h"

std::function<void(SpyObject&)> SpyObject::onConstruction;

namespace {

Recorder* current = nullptr;

std::size_t countOf(const std::vector<std::string>& lines, const std::string& part) {
  return static_cast<std::size_t>(std::count_if(
      lines.begin(), lines.end(), [&](const std::string& line) { return line.find(part) != std::string::npos; }));
}

}  // namespace

void SendMessageToClient(long id, const char* name, KtLuaTETable* data) {
  Message message{id, name, data != nullptr, {}, {}, {}, std::this_thread::get_id()};
  if (data != nullptr) {
    for (const auto& [key, value] : data->getEntries()) {
      const auto text = static_cast<std::string>(*key);
      if (value->getType() == kKtLuaTypeNumber) message.numbers[text] = static_cast<double>(*value);
      if (value->getType() == kKtLuaTypeString) message.strings[text] = static_cast<std::string>(*value);
      if (value->getType() == kKtLuaTypeNil) message.nils.push_back(text);
    }
  }
  if (current != nullptr) current->add(std::move(message));
}

Recorder::Recorder() {
  current = this;
  setDebugSink([this](const char* text) {
    const std::lock_guard guard(_lock);
    _trace.emplace_back(text);
  });
  platform::setLogSink([this](const std::string& line) {
    const std::lock_guard guard(_lock);
    _log.push_back(line);
  });
}

Recorder::~Recorder() {
  setDebugSink(nullptr);
  platform::setLogSink(nullptr);
  current = nullptr;
}

void Recorder::add(Message message) {
  const std::lock_guard guard(_lock);
  _messages.push_back(std::move(message));
  _changed.notify_all();
}

std::vector<Message> Recorder::messages() {
  const std::lock_guard guard(_lock);
  return _messages;
}

std::string Recorder::names() {
  std::string all;
  for (const Message& message : messages()) {
    all += (all.empty() ? "" : " ") + message.name;
    if (message.id != 0) all += "#" + std::to_string(message.id);
  }
  return all;
}

Message Recorder::await(const std::string& name, std::size_t n) {
  std::unique_lock guard(_lock);
  Message found{};
  _changed.wait(guard, [&] {
    std::size_t seen = 0;
    return std::any_of(_messages.begin(), _messages.end(), [&](const Message& message) {
      if (message.name != name || ++seen < n) return false;
      found = message;
      return true;
    });
  });
  return found;
}

std::size_t Recorder::count(const std::string& name) {
  const std::lock_guard guard(_lock);
  return static_cast<std::size_t>(
      std::count_if(_messages.begin(), _messages.end(), [&](const Message& message) { return message.name == name; }));
}

void Recorder::forgetMessages() {
  const std::lock_guard guard(_lock);
  _messages.clear();
}

std::size_t Recorder::traced(const std::string& part) {
  const std::lock_guard guard(_lock);
  return countOf(_trace, part);
}

std::size_t Recorder::logged(const std::string& part) {
  const std::lock_guard guard(_lock);
  return countOf(_log, part);
}
