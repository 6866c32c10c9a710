#include "CommandLine.h"

#include <CLI/CLI.hpp>
#include <cmath>
#include <cstdint>

namespace tether::command {
namespace {

constexpr double kLongestTime = 7 * 24 * 3600;  // in seconds

const char* const kStatuses =
    "Exit status:\n"
    "  0    done\n"
    "  1    standard output was closed, or takes nothing more\n"
    "  2    wrong usage\n"
    "  3    no camera, no such camera, or it cannot be connected\n"
    "  4    something did not come in time\n"
    "  5    the helper cannot be started or was lost\n"
    "  6    a picture could not be saved; its path is said\n"
    "  130  interrupted\n";

const char* const kExamples =
    "Examples:\n"
    "  tether list\n"
    "  tether capture --count 3 --every 10 --output shoot/\n"
    "  tether watch --output shoot/ --json\n"
    "\n";

struct Seconds {
  double value = -1;
  bool given() const { return value >= 0; }
  std::optional<std::chrono::milliseconds> get() const {
    if (!given()) return {};
    return std::chrono::milliseconds(static_cast<std::int64_t>(std::ceil(value * 1000)));
  }
};

std::string secondsAbove(double smallest, const std::string& text) {
  char* end = nullptr;
  const double value = std::strtod(text.c_str(), &end);
  if (end == text.c_str() || *end != '\0' || !std::isfinite(value) || value < smallest || value > kLongestTime) {
    return "'" + text + "' is no number of seconds from " + (smallest > 0 ? "0.001" : "0") + " to 604800";
  }
  return {};
}

struct Values {
  Options options;
  Seconds every;
  Seconds timeout;
  int count = 0;
  int device = 0;
};

void addCommon(CLI::App& command, Values& values, const char* timeoutText) {
  command.add_flag("--json", values.options.json, "One JSON object a line instead of text for people");
  command.add_option("--timeout", values.timeout.value, timeoutText)
      ->type_name("SECONDS")
      ->check([](const std::string& text) { return secondsAbove(0.001, text); });
  command.add_option("--helper", values.options.helper, "The helper's executable (default: the one beside tether)")
      ->type_name("PATH");
  command
      .add_option("--helper-log", values.options.helperLog,
                  "Append what the helper logs to this file, - for standard error (default: dropped)")
      ->type_name("FILE");
}

void addCamera(CLI::App& command, Values& values, const char* text) {
  command.add_option("--camera", values.options.camera, text)->type_name("ID|NAME");
}

void addCount(CLI::App& command, Values& values, const char* text) {
  command.add_option("--count", values.count, text)->type_name("N")->check(CLI::Range(1, 1'000'000));
}

void addOutput(CLI::App& command, Values& values) {
  command
      .add_option("--output", values.options.output,
                  "Folder for the pictures, made if it is missing (default: the current one). A file that is there is\n"
                  "never overwritten: the new one becomes NAME-2.jpg, NAME-3.jpg ...")
      ->type_name("DIR");
}

void addList(CLI::App& app, Values& values) {
  CLI::App& list = *app.add_subcommand("list", "Show the cameras: device id and name");
  addCommon(list, values, "How long the helper may take to answer (default: 30)");
  list.footer(
      "Waits until the helper has listed its cameras, and up to 3 seconds after its start for the first one.\n\n"
      "Examples:\n  tether list\n  tether list --json | jq -r .name\n\n" +
      std::string(kStatuses));
}

void addSettings(CLI::App& app, Values& values) {
  CLI::App& settings = *app.add_subcommand("settings", "Connect a camera and show its settings");
  addCommon(settings, values, "How long connecting and reading may take (default: 30)");
  addCamera(settings, values, "Which camera (default: the first)");
  settings.footer(
      "A setting that the camera does not tell is shown as -, in JSON as null.\n\n"
      "Examples:\n  tether settings\n  tether settings --camera 257 --json\n\n" +
      std::string(kStatuses));
}

void addCapture(CLI::App& app, Values& values) {
  CLI::App& capture = *app.add_subcommand("capture", "Take pictures and save them");
  addCommon(capture, values,
            "How long to wait for each step: connecting, the picture's announcement after the shutter,\n"
            "its transfer (default: 30; exposures longer than that need more)");
  addCamera(capture, values, "Which camera (default: the first)");
  addOutput(capture, values);
  addCount(capture, values, "How many pictures to take; a RAW and JPEG pair is one (default: 1)");
  capture
      .add_option("--every", values.every.value,
                  "Seconds from one shutter to the next (default: as soon as the last picture is saved)")
      ->type_name("SECONDS")
      ->check([](const std::string& text) { return secondsAbove(0, text); });
  capture.footer(
      "A helper that is lost is started again, up to 3 times a minute, and the remaining pictures are taken; a "
      "picture\n"
      "that was lost with it is not taken again. Ctrl-C waits 5 seconds for pictures under way, a second one does "
      "not.\n\n"
      "Examples:\n  tether capture\n  tether capture --count 3 --every 10 --output shoot/\n"
      "  tether capture --camera 257 --timeout 90 --json\n\n" +
      std::string(kStatuses));
}

void addWatch(CLI::App& app, Values& values) {
  CLI::App& watch = *app.add_subcommand("watch", "Save every picture that arrives, until Ctrl-C");
  addCommon(watch, values, "How long connecting a camera and each transfer may take (default: 30)");
  addCamera(watch, values, "Connect only this camera (default: every camera that comes)");
  addOutput(watch, values);
  addCount(watch, values, "End after so many pictures; a RAW and JPEG pair is one (default: no end)");
  watch.footer(
      "Cameras may come and go, and are connected again when they come back. A helper that is lost is started again,\n"
      "up to 3 times a minute. Ctrl-C waits 5 seconds for pictures under way, a second one does not.\n\n"
      "Examples:\n  tether watch --output shoot/\n  tether watch --count 10 --json\n\n" +
      std::string(kStatuses));
}

void addMessages(CLI::App& app, Values& values) {
  CLI::App& messages = *app.add_subcommand("messages", "Show every message of the helper, for those who write a host");
  addCommon(messages, values, "End after so long; with --count it is an error then (default: no end)");
  addCount(messages, values, "End after so many messages (default: no end)");
  auto* const send =
      messages.add_option("--send", values.options.send, "A request to send at the start")->type_name("NAME");
  messages.add_option("--device", values.device, "Its device_id")->type_name("ID")->needs(send);
  messages.footer(
      "Examples:\n  tether messages --timeout 5\n  tether messages --json --send connectDevice --device 257\n\n" +
      std::string(kStatuses));
}

}  // namespace

Parsed parseCommandLine(int argc, char** argv) {
  Values values;
  CLI::App app("Brings pictures from tethered cameras into a folder.", "tether");
  app.set_version_flag("--version", "tether " TETHER_VERSION);
  app.require_subcommand(1);
  app.footer(kExamples + std::string("tether COMMAND --help tells more.\n\n") + kStatuses);
  addList(app, values);
  addSettings(app, values);
  addCapture(app, values);
  addWatch(app, values);
  addMessages(app, values);

  Parsed parsed;
  if (argc < 2) {
    std::cerr << app.help();
    parsed.status = kUsage;
    return parsed;
  }
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& error) {
    parsed.status = app.exit(error, std::cout, std::cerr) == 0 ? kSuccess : kUsage;
    if (!std::cout.flush()) {
      std::cerr << "tether: cannot write to standard output\n";
      parsed.status = kUnwritable;
    }
    return parsed;
  }
  const CLI::App& chosen = *app.get_subcommands().front();
  const auto given = [&](const char* name) {
    const CLI::Option* const option = chosen.get_option_no_throw(name);
    return option != nullptr && option->count() > 0;
  };
  parsed.subcommand = chosen.get_name();
  parsed.options = values.options;
  parsed.options.every = values.every.get();
  parsed.options.timeout = values.timeout.get();
  if (given("--count")) parsed.options.count = values.count;
  if (given("--device")) parsed.options.device = values.device;
  return parsed;
}

}  // namespace tether::command
