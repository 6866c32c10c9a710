// What each command does. Each runs to its end on the calling thread; a Failure that leaves it is how it ended, too. No
// helper is left either way.
#pragma once

#include <memory>

#include "Console.h"
#include "Options.h"
#include "Wakeup.h"

namespace tether::command {

Outcome runList(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup);
Outcome runSettings(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup);
Outcome runCapture(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup);
Outcome runWatch(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup);
Outcome runMessages(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup);

}  // namespace tether::command
