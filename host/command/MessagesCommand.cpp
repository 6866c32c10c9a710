#include "Commands.h"
#include "Link.h"

namespace tether::command {
namespace {

using namespace std::chrono_literals;

constexpr auto kEndGrace = 2s;

void show(Console& console, const Message& message) {
  const Json payload = payloadJson(*message.payload);
  std::string text = message.name.empty() ? "(no name)" : message.name;
  if (message.id != 0) text += " #" + std::to_string(message.id);
  if (!payload.is_null()) text += " " + payload.dump(-1, ' ', false, Json::error_handler_t::replace);
  Json object = eventJson("message");
  object["message"] = message.name;
  object["id"] = message.id;
  object["payload"] = payload;
  console.result(text, object);
}

// Shows messages until the count or the time is reached; false when the time was, and a count was asked for.
bool showMessages(const Options& options, Console& console, Wakeup& wakeup, Session& session) {
  const auto until = options.timeout ? Clock::now() + *options.timeout : Clock::time_point::max();
  for (int shown = 0; !options.count || shown < *options.count;) {
    const auto message = session.nextMessage(until);
    if (message) {
      show(console, *message);
      ++shown;
    }
    if (wakeup.interrupted()) throw Failure{kInterrupted, ""};
    if (console.closed()) throw Failure{kUnwritable, ""};
    if (!message && session.lost()) {
      const bool asked = options.send == kMessageShutdown && session.lost()->status == 0;
      if (asked && !options.count) return true;
      throw Failure{kHelperLost, session.lost()->description};
    }
    if (!message && Clock::now() >= until) return !options.count;
  }
  return true;
}

}  // namespace

Outcome runMessages(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup) {
  Link link(options, console, wakeup);
  link.start();
  if (!options.send.empty()) {
    const auto payload = options.device ? devicePayload(*options.device) : nullptr;
    link.session().send(options.send, payload.get());
  }
  const bool enough = showMessages(options, console, *wakeup, link.session());
  link.end(kEndGrace, [](const Event&) {});
  if (!enough) throw Failure{kTimeout, "fewer messages came than asked for"};
  return {};
}

}  // namespace tether::command
