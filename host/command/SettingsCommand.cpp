#include "Commands.h"
#include "Link.h"

namespace tether::command {
namespace {

constexpr std::size_t kNameWidth = 16;

}  // namespace

Outcome runSettings(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup) {
  Link link(options, console, wakeup);
  link.start();
  const Camera camera = link.choose([](const Event&) {});
  link.connect(camera);
  const Reply reply = link.session().settings(camera.id, Clock::now() + link.timeout());
  if (reply.kind != Reply::Kind::kOk) link.fail(reply, "reading the settings of " + camera.name);

  const Settings settings = settingsFrom(*reply.payload);
  Json object = eventJson("settings");
  object["device_id"] = camera.id;
  object["camera"] = camera.name;
  for (std::size_t i = 0; i < settings.size(); ++i) object[kSettingNames[i]] = settingJson(settings[i]);
  if (console.json()) console.result("", object);
  for (std::size_t i = 0; i < settings.size() && !console.json(); ++i) {
    std::string name = kSettingNames[i];
    name.resize(kNameWidth, ' ');
    console.result(name + settingText(settings[i]), object);
  }
  return {console.closed() ? kUnwritable : kSuccess, "", {}};
}

}  // namespace tether::command
