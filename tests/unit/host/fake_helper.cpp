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
//   { "log": "text" }                              a stamped line on standard error
//   { "orphan": true }                             a process of its own that keeps its pipes until its input ends
//   { "bytes": "hexadecimal" }, { "repeat": n, "do": [action...] }, { "pause": milliseconds }
//   { "await": "path" }                                    of a file that someone else writes
//   { "exit": status }, { "kill": signal }, { "ignore": signal }, { "closeOutput": true }, { "stopReading": true }
//
// A camera is shorter in words. Each line is a request, or "start", and its turns between "|", with actions between
// ";";
// "---" stands between two starts. The camera 257 "Cam" is there if "start" does not say else, lets itself be
// connected, and answers settings requests as a helper does: with an error, and not at all during a transfer.
//
//   doCapture: picture a.jpg | | announce b.nef+ 5000; after 300 complete
//
//   add ID NAME, remove ID                   a camera
//   picture NAME [SIZE]                      with "+" at its end: one of a pair
//   announce NAME [SIZE], complete, break    a picture's transfer: it begins, its file is there, it is over
//   short NAME                               a file of another size than was announced
//   after MS ACTION                          and meanwhile it goes on
//   ok, error, log TEXT, pause MS, await PATH, exit STATUS, kill SIGNAL, rmdir, - for nothing
//
// "$TMPDIR" in a payload's text stands for that directory. Every start appends "start PID TMPDIR" to the file
// FAKE_HELPER_LOG, every request "request NAME DEVICE", and an end of the input "end".
#include <fcntl.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <nlohmann/json.hpp>
#include <sstream>
#include <thread>
#include <vector>

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

// Scripts in words
// -----------------------------------------------------------------------------------------------------

std::vector<std::string> parts(const std::string& text, char separator) {
  std::vector<std::string> all;
  std::istringstream stream(text);
  for (std::string part; std::getline(stream, part, separator);) {
    const auto begin = std::min(part.find_first_not_of(' '), part.size());
    all.push_back(part.substr(begin, part.find_last_not_of(' ') + 1 - begin));
  }
  return all;
}

json actionFrom(const std::string& words) {
  const auto space = std::min(words.find(' '), words.size());
  const std::string verb = words.substr(0, space);
  std::string rest = words.substr(std::min(space + 1, words.size()));
  const auto value = [](const std::string& text) { return std::atoi(text.c_str()); };
  if (verb == "picture" || verb == "announce" || verb == "short") {
    const auto size = rest.find(' ');
    json action = {{"size", size == std::string::npos ? 1000 : value(rest.substr(size))}};
    rest.erase(std::min(size, rest.size()));
    action["pair"] = rest.back() == '+' ? 1 : 0;
    if (rest.back() == '+') rest.pop_back();
    action[verb == "short" ? "picture" : verb] = rest;
    if (verb == "short") action["fileSize"] = 5;
    return action;
  }
  if (verb == "add" || verb == "remove") {
    json camera = {{"device_id", value(rest)}};
    if (verb == "add") camera["name"] = rest.substr(rest.find(' ') + 1);
    return {{"send", verb == "add" ? "deviceAdded" : "deviceRemoved"}, {"payload", camera}};
  }
  if (verb == "after") {
    return {{verb, value(rest)}, {"do", json::array({actionFrom(rest.substr(rest.find(' ') + 1))})}};
  }
  if (verb == "ok" || verb == "error") return {{"reply", verb}};
  if (verb == "log" || verb == "await") return {{verb, rest}};
  return {{verb, value(rest)}};
}

json scriptFrom(const std::string& text) {
  json starts = json::array();
  const json camera = json::parse(R"({"heartbeat": 20, "transfers": true, "on": {"connectDevice": [[{"reply": "ok"}]]},
    "start": [{"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam"}}]})");
  starts.push_back(camera);
  for (const std::string& line : parts(text, '\n')) {
    const auto colon = line.find(':');
    if (line == "---") starts.push_back(camera);
    if (colon == std::string::npos) continue;
    json turns = json::array();
    for (const std::string& turn : parts(line.substr(colon + 1), '|')) {
      turns.push_back(json::array());
      for (const std::string& words : parts(turn, ';')) {
        if (words != "-") turns.back().push_back(actionFrom(words));
      }
    }
    const std::string name = line.substr(0, colon);
    if (name == "start") {
      starts.back()["start"] = turns.at(0);
    } else {
      starts.back()["on"][name] = turns;
    }
  }
  return starts;
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
    const std::string frame = encodeFrame(id, name, value.get());
    platform::FileHandle::standardOutput()->write(frame.data(), frame.size());
  }

  void dispatch(const CRCMessage& message) {
    const auto name = static_cast<std::string>(*message.name);
    note("request " + name + " " + std::to_string(tether::integerIn(*message.data, "device_id")));
    _seen[name] = message.id;
    const json none = json::object();
    const json& requests = _script.contains("on") ? _script["on"] : none;
    if (!requests.contains(name)) {
      if (name == "shutdown") _exit(0);
      const bool free = _script.contains("transfers") && !_transfers;
      if (name == "getCameraSettings" && free) send(message.id, "error", {{"error_code", 65535}});
      return;
    }
    const auto nth = static_cast<std::size_t>(_count[name]++);
    const json& turns = requests[name];
    if (!turns.empty()) play(turns[std::min(nth, turns.size() - 1)], message.id);
  }

  static void writeFile(const std::string& name, std::size_t size) {
    std::ofstream(platform::appendingPathComponent(platform::temporaryDirectory(), name)) << std::string(size, 'p');
  }

  void announce(const json& action, const std::string& name) {
    _picture = action;
    _picture["id"] = action.value("id", ++_lastId);
    _picture["name"] = name;
    _transfers = true;
    send(0, "objectWasAdded",
         {{"capture_id", _picture["id"]},
          {"has_sidecar", action.value("pair", 0)},
          {"file_name", name},
          {"file_size", action.value("size", 1000)}});
  }

  // As another picture, where one was announced meanwhile.
  void complete(const json& picture) {
    _transfers = false;
    const auto name = picture["name"].get<std::string>();
    const auto path = platform::appendingPathComponent(platform::temporaryDirectory(), name);
    const bool taken = platform::FileManager::exists(path);
    const auto at = picture.value("at", taken ? picture["id"].dump() + "-" + name : name);
    writeFile(at, static_cast<std::size_t>(picture.value("fileSize", picture.value("size", 1000))));
    send(0, "fileDownloadComplete", {{"capture_id", picture["id"]}, {"file_path", "$TMPDIR/" + at}});
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
    if (action.contains("announce")) announce(action, action["announce"]);
    if (action.contains("picture")) announce(action, action["picture"]);
    if (action.contains("complete") || action.contains("picture")) complete(_picture);
    if (action.contains("break")) _transfers = false;
    if (action.contains("rmdir")) std::filesystem::remove_all(platform::temporaryDirectory());
    if (action.contains("log")) platform::log("%s", action["log"].get<std::string>().c_str());
    if (action.contains("after")) {
      const auto later = [this, actions = action["do"], picture = _picture, id] {
        for (const json& one : actions) one.contains("complete") ? complete(picture) : playOne(one, id);
      };
      platform::RunLoop::current()->performAfter(platform::Seconds(action["after"].get<int>() / 1000.0), later);
    }
    if (action.contains("orphan") && fork() == 0) {
      for (char byte = 0; read(STDIN_FILENO, &byte, 1) > 0;) {
      }
      _exit(0);
    }
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
  int _lastId = 0;
  json _picture;  // announced last
  bool _transfers = false;
};

}  // namespace

int main() {
  std::signal(SIGPIPE, SIG_IGN);
  std::ifstream file(setting("FAKE_HELPER_SCRIPT"));
  const std::string text{std::istreambuf_iterator<char>(file), {}};
  json script = text.find_first_of("{[") == 0 ? json::parse(text) : scriptFrom(text);
  if (script.is_array()) script = json(script[std::min(static_cast<std::size_t>(startsSoFar()), script.size() - 1)]);
  note("start " + std::to_string(getpid()) + " " + platform::temporaryDirectory());
  return FakeHelper(script).run();
}
