// A helper that follows a script, for the tests of the host's side. The script is the JSON file FAKE_HELPER_SCRIPT:
//
//   { "heartbeat": milliseconds (0: none), "ignoresEndOfInput": true, "start": [action...],
//     "on": { "requestName": [[action...] for the first such request, [action...] for the second and all later] } }
//
// or a list of these, one for each start in turn, the last for all later ones. An action is one of
//
//   { "send": "name", "payload": {...} }           with id 0
//   { "reply": "ok", "payload": {...} }            with the request's id, or "to" names a request seen before
//   { "file": "name", "size": n, "at": "name" }    announces nothing; writes a file into the temporary directory
//   { "picture": "name", "id": n, "size": n, "pair": 1 }   announces, writes and completes a picture
//   { "bytes": "hexadecimal" }, { "repeat": n, "do": [action...] }, { "pause": milliseconds }
//   { "await": "path" }                                    of a file that someone else writes
//   { "exit": status }, { "kill": signal }, { "ignore": signal }, { "closeOutput": true }, { "stopReading": true }
//
// "$TMPDIR" in a payload's text stands for that directory. Every start appends "start PID TMPDIR" to the file
// FAKE_HELPER_LOG, every request "request NAME DEVICE", and an end of the input "end".
#include <fcntl.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <fstream>
#include <map>
#include <nlohmann/json.hpp>
#include <thread>

#include "FileManager.h"
#include "Log.h"
#include "Messages.h"

namespace {

using nlohmann::json;

std::string setting(const char* name) {
  const char* const value = std::getenv(name);
  return value == nullptr ? std::string() : value;
}

void note(const std::string& line) { std::ofstream(setting("FAKE_HELPER_LOG"), std::ios::app) << line + "\n"; }

int startsSoFar() {
  std::ifstream log(setting("FAKE_HELPER_LOG"));
  int starts = 0;
  for (std::string line; std::getline(log, line);) starts += line.rfind("start ", 0) == 0 ? 1 : 0;
  return starts;
}

KtLuaTE* element(const json& value) {
  if (value.is_number()) return new KtLuaTENumber(value.get<double>());
  if (value.is_string()) {
    auto text = value.get<std::string>();
    const std::string variable = "$TMPDIR";
    const auto at = text.find(variable);
    if (at != std::string::npos) text.replace(at, variable.size(), platform::temporaryDirectory());
    return new KtLuaTEString(text);
  }
  if (!value.is_object()) return new KtLuaTENil;
  auto table = std::make_unique<KtLuaTETable>();
  for (const auto& [key, entry] : value.items()) table->Set(key.c_str(), element(entry));
  return table.release();
}

class FakeHelper {
 public:
  explicit FakeHelper(json script) : _script(std::move(script)) {}

  int run() {
    auto& center = platform::NotificationCenter::defaultCenter();
    KtRCMessageAccumulator reader(platform::FileHandle::standardInput());
    _available = center.addObserver(std::string(kMessageIsAvailable), &reader, [&](const auto&) {
      while (const auto message = reader.getNextMessage()) dispatch(*message);
    });
    _finished = center.addObserver(std::string(kReadHandleIsFinished), &reader, [&](const auto&) {
      note("end");
      if (!_script.value("ignoresEndOfInput", false)) _exit(0);
    });
    platform::Timer heartbeat;
    const int beat = _script.value("heartbeat", 100);
    if (beat > 0)
      heartbeat = platform::Timer::repeating(platform::Seconds(beat / 1000.0), [&] { send(0, "heartbeat", {}); });
    play(_script.value("start", json::array()), 0);
    while (_reads) platform::RunLoop::current()->runOnce(platform::Clock::now() + std::chrono::hours(1));
    for (;;) pause();
  }

 private:
  static void send(std::int32_t id, const std::string& name, const json& payload) {
    const std::unique_ptr<KtLuaTE> value(element(payload));
    const std::string frame = tether::encodeFrame(id, name, value.get());
    platform::FileHandle::standardOutput()->write(frame.data(), frame.size());
  }

  void dispatch(const CRCMessage& message) {
    const auto name = static_cast<std::string>(*message.name);
    note("request " + name + " " + std::to_string(tether::integerIn(*message.data, "device_id")));
    _seen[name] = message.id;
    const json requests = _script.value("on", json::object());
    if (!requests.contains(name)) {
      if (name == "shutdown") _exit(0);
      return;
    }
    const auto nth = static_cast<std::size_t>(_count[name]++);
    const json& turns = requests[name];
    play(turns[std::min(nth, turns.size() - 1)], message.id);
  }

  static void writeFile(const std::string& name, std::size_t size) {
    std::ofstream(platform::appendingPathComponent(platform::temporaryDirectory(), name)) << std::string(size, 'p');
  }

  static void sendPicture(const json& action) {
    const int id = action.value("id", 1);
    const auto name = action["picture"].get<std::string>();
    const auto size = action.value("size", 1000);
    send(0, "objectWasAdded",
         {{"capture_id", id}, {"has_sidecar", action.value("pair", 0)}, {"file_name", name}, {"file_size", size}});
    const auto at = action.value("at", name);
    writeFile(at, static_cast<std::size_t>(size));
    send(0, "fileDownloadComplete", {{"capture_id", id}, {"file_path", "$TMPDIR/" + at}});
  }

  static void sendBytes(const std::string& digits) {
    std::string bytes;
    for (std::size_t i = 0; i + 1 < digits.size(); i += 2) {
      bytes += static_cast<char>(std::stoi(digits.substr(i, 2), nullptr, 16));
    }
    platform::FileHandle::standardOutput()->write(bytes.data(), bytes.size());
  }

  void play(const json& actions, std::int32_t id) {
    for (const json& action : actions) playOne(action, id);
  }

  void playOne(const json& action, std::int32_t id) {
    const json payload = action.value("payload", json());
    if (action.contains("send")) send(0, action["send"], payload);
    if (action.contains("reply")) send(action.contains("to") ? _seen[action["to"]] : id, action["reply"], payload);
    if (action.contains("file")) writeFile(action["file"], action.value("size", std::size_t{1000}));
    if (action.contains("picture")) sendPicture(action);
    if (action.contains("bytes")) sendBytes(action["bytes"]);
    for (int i = 0; i < action.value("repeat", 0); ++i) play(action["do"], id);
    if (action.contains("pause")) std::this_thread::sleep_for(std::chrono::milliseconds(action["pause"].get<int>()));
    while (action.contains("await") && !platform::FileManager::exists(action["await"])) {
      std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    if (action.contains("exit")) _exit(action["exit"].get<int>());
    if (action.contains("kill")) kill(getpid(), action["kill"].get<int>());
    if (action.contains("ignore")) std::signal(action["ignore"].get<int>(), SIG_IGN);
    if (action.contains("closeOutput")) close(STDOUT_FILENO);
    if (action.contains("stopReading")) _reads = false;
  }

  json _script;
  std::map<std::string, int> _count;
  std::map<std::string, std::int32_t> _seen;
  platform::Observer _available;
  platform::Observer _finished;
  bool _reads = true;
};

}  // namespace

int main() {
  std::signal(SIGPIPE, SIG_IGN);
  json script = json::parse(std::ifstream(setting("FAKE_HELPER_SCRIPT")));
  if (script.is_array()) script = json(script[std::min(static_cast<std::size_t>(startsSoFar()), script.size() - 1)]);
  note("start " + std::to_string(getpid()) + " " + platform::temporaryDirectory());
  return FakeHelper(script).run();
}
