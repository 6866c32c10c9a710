#include "Commands.h"
#include "Link.h"

namespace tether::command {

Outcome runList(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup) {
  Link link(options, console, wakeup);
  link.start();
  link.choose([](const Event&) {});
  for (const auto& [id, name] : link.cameras()) {
    Json object = eventJson("camera");
    object["device_id"] = id;
    object["camera"] = name;
    console.result(std::to_string(id) + "  " + name, object);
  }
  return {console.closed() ? kUnwritable : kSuccess, "", {}};
}

}  // namespace tether::command
