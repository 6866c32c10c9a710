#include "CommandLine.h"

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cmath>
#include <cstdint>
#include <cstdlib>

namespace tether::command {
namespace {

constexpr int kLargestCount = 1'000'000;
constexpr double kLongestTime = 7 * 24 * 3600;  // in seconds

const char* const kStatuses =
    "Exit status:\n"
    "  0    done\n"
    "  1    standard output was closed, or takes nothing more\n"
    "  2    wrong usage, or a folder that cannot be written\n"
    "  3    no camera, no such camera, it cannot be connected, or it has gone\n"
    "  4    a picture did not come, or something did not come in time\n"
    "  5    the helper cannot be started or was lost for good\n"
    "  6    a picture could not be saved; its path is said\n"
    "  130  interrupted\n"
    "It tells the worst that happened, also after an interruption: 6 before 5 and 3, and these before 4.\n";

const char* const kEnvironment =
    "Environment:\n"
    "  TMPDIR                  where pictures lie until they are saved, in a private folder (default: /tmp)\n"
    "  TETHER_CAMERAS          cameras on the network, separated by spaces, like ptpip:192.168.1.7\n"
    "  TETHER_STATE            where is kept which pictures were received (default: ~/.local/state/tether)\n"
    "  TETHER_VIRTUAL_CAMERAS  the folder from which virtual cameras take their pictures\n"
    "  TERM                    with dumb there is no live line\n\n";

const char* const kExamples =
    "Examples:\n"
    "  tether list\n"
    "  tether capture --virtual\n"
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
  const bool decimal = text.find_first_not_of("0123456789.") == std::string::npos;
  if (!decimal || end == text.c_str() || *end != '\0' || value < smallest || value > kLongestTime) {
    return "'" + text + "' is no number of seconds from " + (smallest > 0 ? "0.001" : "0") + " to 604800";
  }
  return {};
}

// Digits are a decimal number, with zeros before it too.
std::optional<int> wholeNumber(const std::string& text, int smallest, int largest) {
  if (text.empty() || text.find_first_not_of("0123456789") != std::string::npos) return {};
  const auto value = std::strtoll(text.c_str(), nullptr, 10);
  if (value < smallest || value > largest) return {};
  return static_cast<int>(value);
}

struct Values {
  Options options;
  Seconds every;
  Seconds timeout;
  std::string count;
  std::string device;
};

CLI::Option* addNumber(CLI::App& command, const char* name, std::string& value, int smallest, int largest,
                       const char* text) {
  return command.add_option(name, value, text)->check([=](const std::string& given) {
    if (wholeNumber(given, smallest, largest)) return std::string();
    return "'" + given + "' is no whole number from " + std::to_string(smallest) + " to " + std::to_string(largest);
  });
}

void addCommon(CLI::App& command, Values& values, const char* timeoutText) {
  command.add_flag("--json", values.options.json,
                   "One JSON object a line instead of text for people, as docs/json.md has them");
  command.add_option("--timeout", values.timeout.value, timeoutText)
      ->type_name("SECONDS")
      ->check([](const std::string& text) { return secondsAbove(0.001, text); });
  command.add_flag("--virtual", values.options.virtualCamera,
                   "Show a virtual camera, which makes its own pictures, to try things out");
  command.add_option("--helper", values.options.helper, "The helper's executable (default: the one beside tether)")
      ->type_name("PATH");
  command
      .add_option("--helper-log", values.options.helperLog,
                  "Append what the helper logs to this file, - for standard error (default: dropped)")
      ->type_name("FILE");
}

void addCamera(CLI::App& command, Values& values, const char* text) {
  command.add_option("--camera", values.options.camera, std::string(text) + "; digits are an id")->type_name("ID|NAME");
}

void addCount(CLI::App& command, Values& values, const char* text) {
  addNumber(command, "--count", values.count, 1, kLargestCount, text)->type_name("N");
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
      "Examples:\n  tether list\n  tether list --json | jq -r 'select(.event == \"camera\").camera'\n\n" +
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
            "How long connecting may take, and a picture's announcement after the exposure; a transfer that\n"
            "takes longer is spoken of, and not given up while it goes on (default: 30; exposures longer than\n"
            "a minute need more)");
  addCamera(capture, values, "Which camera (default: the first)");
  addOutput(capture, values);
  addCount(capture, values, "How many pictures to take; a RAW and JPEG pair is one (default: 1)");
  capture
      .add_option("--every", values.every.value,
                  "Seconds from one shutter to the next, or more where the last picture has not begun to come\n"
                  "(default: as soon as it is saved)")
      ->type_name("SECONDS")
      ->check([](const std::string& text) { return secondsAbove(0, text); });
  capture.footer(
      "Ends when the picture of each shutter is saved or given up, and what others shot until then has come; or after\n"
      "ten shutters in a row that brought nothing; or when the camera goes. Each failure is said when it is known, "
      "and\n"
      "the series goes on. A shutter that had to wait is not made up for: those after it keep their distance.\n\n"
      "Pictures that others shoot, and those that the camera had before, are saved too, named as another's and not\n"
      "counted. Who shoots in the very moment of a shutter cannot be told apart: of two pictures for one shutter the\n"
      "first counts, the other is perhaps another's.\n\n"
      "A helper that is lost is started again, up to 3 times a minute, and the remaining pictures are taken; a "
      "picture\n"
      "that was lost with it is not taken again. Ctrl-C waits 5 seconds for pictures under way, a second one does "
      "not.\n\n"
      "Examples:\n  tether capture\n  tether capture --count 3 --every 10 --output shoot/\n"
      "  tether capture --camera 257 --timeout 90 --json\n\n" +
      std::string(kEnvironment) + kStatuses);
}

void addWatch(CLI::App& app, Values& values) {
  CLI::App& watch = *app.add_subcommand("watch", "Save every picture that arrives, until Ctrl-C");
  addCommon(watch, values,
            "How long connecting a camera may take; a transfer that takes longer is spoken of, and not given up\n"
            "while it goes on (default: 30)");
  addCamera(watch, values, "Connect only this camera (default: every camera that comes)");
  addOutput(watch, values);
  addCount(watch, values, "End after so many pictures; a RAW and JPEG pair is one (default: no end)");
  watch.footer(
      "Cameras may come and go, and are connected again when they come back. A helper that is lost is started again,\n"
      "up to 3 times a minute. Ctrl-C waits 5 seconds for pictures under way, a second one does not.\n\n"
      "Examples:\n  tether watch --output shoot/\n  tether watch --count 10 --json\n\n" +
      std::string(kEnvironment) + kStatuses);
}

void addMessages(CLI::App& app, Values& values) {
  CLI::App& messages = *app.add_subcommand("messages", "Show every message of the helper, for those who write a host");
  addCommon(messages, values, "End after so long; with --count it is an error then (default: no end)");
  addCount(messages, values, "End after so many messages (default: no end)");
  auto* const send =
      messages.add_option("--send", values.options.send, "A request to send at the start")->type_name("NAME");
  addNumber(messages, "--device", values.device, 0, INT32_MAX, "Its device_id")->type_name("ID")->needs(send);
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
  app.footer(kExamples + std::string("tether COMMAND --help tells more.\n\n") + kEnvironment + kStatuses);
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
  const auto commands = app.get_subcommands([](const CLI::App*) { return true; });
  const bool known = std::any_of(commands.begin(), commands.end(),
                                 [&](const CLI::App* command) { return command->get_name() == argv[1]; });
  if (argv[1][0] != '-' && !known) {
    std::cerr << "tether: there is no command '" << printable(argv[1]) << "'; tether --help lists those there are\n";
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
  parsed.options.savesPictures = parsed.subcommand == "capture" || parsed.subcommand == "watch";
  parsed.options.every = values.every.get();
  parsed.options.timeout = values.timeout.get();
  if (given("--count")) parsed.options.count = wholeNumber(values.count, 1, kLargestCount);
  if (given("--device")) parsed.options.device = wholeNumber(values.device, 0, INT32_MAX);
  return parsed;
}

}  // namespace tether::command
