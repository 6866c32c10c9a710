#include "Report.h"

#include "FileManager.h"

namespace tether::command {
namespace {

Json numberOrNull(int number) {
  if (number == 0) return nullptr;
  return number;
}

void addCamera(Json& object, const std::optional<Camera>& camera) {
  object["device_id"] = camera ? Json(camera->id) : Json();
  object["camera"] = camera ? Json(camera->name) : Json();
}

Json pictureJson(const char* event, const Picture& picture) {
  Json object = eventJson(event);
  object["number"] = numberOrNull(picture.number);
  object["capture_id"] = numberOrNull(picture.captureId);
  object["name"] = picture.number == 0 ? Json() : Json(platform::lastPathComponent(picture.name));
  object["pair"] = numberOrNull(picture.pair);
  object["shutter"] = numberOrNull(picture.shutter);
  object["own"] = picture.own == Own::kUnknown ? Json() : Json(picture.own == Own::kYes);
  addCamera(object, picture.camera);
  return object;
}

double secondsSince(Clock::time_point time) { return std::chrono::duration<double>(Clock::now() - time).count(); }

}  // namespace

Json countsJson(const Shots::Counts& counts) {
  const auto tally = [](const Shots::Tally& one) {
    return Json({{"saved", one.saved}, {"not_saved", one.notSaved}, {"missing", one.missing}});
  };
  return {{"shutters", counts.shutters}, {"own", tally(counts.own)}, {"others", tally(counts.others)}};
}

void Report::camera(const char* event, const Camera& camera, const std::string& text) {
  Json object = eventJson(event);
  addCamera(object, camera);
  _console.result(text, object);
}

void Report::connectFailed(const Camera& camera, const std::string& reason, bool silently) {
  Json object = eventJson("connect_failed");
  addCamera(object, camera);
  object["reason"] = reason;
  _console.result("", object);
  if (!silently) _console.say(reason + "; trying again");
}

void Report::helperLost(const std::string& reason) {
  Json object = eventJson("helper_lost");
  object["reason"] = reason;
  _console.result("", object);
}

void Report::helperLog(const std::string& text, bool silently) {
  Json object = eventJson("helper_log");
  object["text"] = text;
  _console.result("", object);
  if (!silently) _console.say("the helper says: " + text);
}

void Report::shutter(int number) {
  Json object = eventJson("shutter");
  object["shutter"] = number;
  _console.result("", object);
}

void Report::receiving(const Picture& picture) {
  Json object = pictureJson("receiving", picture);
  object["size"] = picture.size;
  _console.result("", object);
}

void Report::saved(const Picture& picture, const MovedFile& file) {
  const double seconds = secondsSince(picture.since);
  const std::string name(platform::lastPathComponent(file.path));
  Json object = pictureJson("saved", picture);
  object["name"] = name;
  addPath(object, "path", file.path);
  object["size"] = file.size;
  object["seconds"] = seconds;
  object["late"] = picture.late;
  object["remark"] = file.description.empty() ? Json() : Json(file.description);
  const std::string camera = picture.camera ? "  " + picture.camera->name : "";
  const std::string whose = !_namesOthers || picture.own == Own::kYes ? ""
                            : picture.own == Own::kNo                 ? "  another's"
                                                                      : "  perhaps another's";
  _console.result(
      name + "  " + sizeText(file.size) + "  " + secondsText(std::chrono::duration<double>(seconds)) + camera + whose,
      object);
  if (picture.late) _console.say(name + " came after all");
  if (!file.description.empty()) _console.say(file.description);
}

void Report::notSaved(const Picture& picture, const MovedFile& file) {
  Json object = pictureJson("not_saved", picture);
  addPath(object, "path", file.path);
  object["reason"] = file.description;
  _console.result("", object);
  _console.say("could not save " + picture.name + " in " + _folder + ": " + file.description + "; it stays at " +
               file.path);
}

void Report::notice(const Notice& notice, const std::string& cause) {
  const double seconds = secondsSince(notice.since);
  const std::string reason = notice.reason + (cause.empty() ? "" : "; " + cause);
  if (notice.kind == Notice::Kind::kShutterFailed) {
    Json object = eventJson("shutter_failed");
    object["shutter"] = notice.shutter;
    object["seconds"] = seconds;
    object["reason"] = reason;
    _console.result("", object);
    _console.say("shutter " + std::to_string(notice.shutter) + " failed: " + reason);
    return;
  }
  const bool coming = notice.kind == Notice::Kind::kStillComing;
  Json object = pictureJson(coming ? "still_receiving" : "not_received", notice.picture);
  object["seconds"] = seconds;
  if (!coming) object["reason"] = reason;
  _console.result("", object);
  if (coming) {
    _console.say(notice.picture.name + " is still being received after " +
                 secondsText(std::chrono::duration<double>(seconds)));
  } else if (notice.kind == Notice::Kind::kNoPartner) {
    _console.say(reason);
  } else {
    _console.say(notice.picture.name + " was not received: " + reason);
  }
}

void Report::leftover(Console& console, const char* fate, const std::string& found, const std::string& path,
                      const std::string& remark) {
  Json object = eventJson("leftover");
  object["fate"] = fate;
  addPath(object, "found", found);
  addPath(object, "path", path);
  object["remark"] = remark.empty() ? Json() : Json(remark);
  console.result("", object);
}

void Report::neverCame(const std::string& reason) {
  Json object = pictureJson("not_received", Picture());
  object["seconds"] = 0;
  object["reason"] = reason;
  _console.result("", object);
  _console.say("a picture was not received: " + reason);
}

}  // namespace tether::command
