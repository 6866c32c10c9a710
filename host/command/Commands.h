// What each command does. Each runs to its end on the calling thread and returns the exit status; a Failure that leaves
// it carries the status and what to say. No helper is left either way.
#pragma once

#include <memory>

#include "Console.h"
#include "Options.h"
#include "Wakeup.h"

namespace tether::command {

int runList(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup);
int runSettings(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup);
int runCapture(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup);
int runWatch(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup);
int runMessages(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup);

}  // namespace tether::command
