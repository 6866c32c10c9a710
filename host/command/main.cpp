// The command `tether`.
#include <fcntl.h>
#include <unistd.h>

#include <csignal>
#include <exception>
#include <iostream>
#include <map>
#include <string_view>
#include <system_error>

#include "CommandLine.h"
#include "Commands.h"
#include "Log.h"

namespace {

using namespace tether;
using namespace tether::command;

// Who asks this often is not to be kept waiting by anything, a hanging file system included.
constexpr int kSignalsToLeave = 3;

Wakeup* signalled = nullptr;
volatile std::sig_atomic_t signals = 0;

void noteSignal(int) {
  signals = signals + 1;
  if (signals >= kSignalsToLeave) _exit(kInterrupted);
  signalled->interrupt();
}

// What is opened in a closed standard descriptor's place would get the lines that are meant for it: a picture's copy,
// for one. Writing to this fails as it does to a closed one.
void occupyClosedDescriptors() {
  while (true) {
    const int descriptor = open("/dev/null", O_RDONLY);
    if (descriptor > STDERR_FILENO) close(descriptor);
    if (descriptor < 0 || descriptor > STDERR_FILENO) return;
  }
}

// A signal that whoever started this wants ignored (nohup, a shell's background job) stays ignored.
void watchSignals(Wakeup& wakeup) {
  signalled = &wakeup;
  for (const int number : {SIGPIPE, SIGXFSZ}) std::signal(number, SIG_IGN);  // errors of the write
  for (const int number : {SIGINT, SIGTERM, SIGHUP}) {
    struct sigaction before {};
    sigaction(number, nullptr, &before);
    if (before.sa_handler == SIG_IGN) continue;
    struct sigaction action {};
    action.sa_handler = noteSignal;
    action.sa_flags = SA_RESTART;
    sigaction(number, &action, nullptr);
  }
}

// The frame reader logs every turn of its thread; a dropped frame is worth a word.
void logOnlyWhatMatters(Console& console) {
  platform::setLogSink([&console](const std::string& line) {
    if (line.rfind("NSRunLoop ", 0) != 0) console.say(line);
  });
}

Outcome run(Parsed& parsed, Console& console, const std::shared_ptr<Wakeup>& wakeup) {
  const std::map<std::string_view, decltype(&runList)> commands = {{"list", runList},
                                                                   {"settings", runSettings},
                                                                   {"capture", runCapture},
                                                                   {"watch", runWatch},
                                                                   {"messages", runMessages}};
  try {
    // Where no pictures are asked for, nothing says where those go that come all the same.
    if (parsed.subcommand != "capture" && parsed.subcommand != "watch") parsed.options.output.clear();
    return commands.at(parsed.subcommand)(parsed.options, console, wakeup);
  } catch (const Failure& failure) {
    return {failure.status, failure.text, {}};
  } catch (const std::exception& problem) {
    return {kHelperLost, problem.what(), {}};
  }
}

int tellOutcome(const Outcome& outcome, Console& console) {
  Json object = eventJson("result");
  object["status"] = outcome.status;
  object["error"] = outcome.error.empty() ? Json() : Json(outcome.error);
  if (outcome.details.is_object()) object.update(outcome.details);
  if (!outcome.error.empty()) console.say(outcome.error);
  console.result("", object);
  return outcome.status;
}

}  // namespace

int main(int argc, char** argv) {
  occupyClosedDescriptors();
  Parsed parsed = parseCommandLine(argc, argv);
  if (parsed.subcommand.empty()) return parsed.status;
  // Never destroyed: a signal may come until the very end.
  static std::shared_ptr<Wakeup>* wakeup = nullptr;
  try {
    wakeup = new std::shared_ptr<Wakeup>(std::make_shared<Wakeup>());
  } catch (const std::system_error& problem) {
    std::cerr << "tether: cannot start: " << problem.what() << "\n";
    return kHelperLost;
  }
  watchSignals(**wakeup);
  Console console(parsed.options.json, **wakeup);
  logOnlyWhatMatters(console);
  const int status = tellOutcome(run(parsed, console, *wakeup), console);
  platform::setLogSink({});
  // Output that was given up to come to an end is no fault of the output's.
  return status == kUnwritable && (*wakeup)->everInterrupted() ? kInterrupted : status;
}
