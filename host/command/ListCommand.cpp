#include "Commands.h"
#include "Link.h"

namespace tether::command {

int runList(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup) {
  Link link(options, console, wakeup);
  link.start();
  link.choose([](const Event&) {});
  for (const auto& [id, name] : link.cameras()) {
    console.result(std::to_string(id) + "  " + name, {{"device_id", id}, {"name", name}});
  }
  return console.closed() ? kUnwritable : kSuccess;
}

}  // namespace tether::command
