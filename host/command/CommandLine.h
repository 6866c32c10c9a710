// The command line of `tether`.
#pragma once

#include <functional>
#include <string>

#include "Options.h"

namespace tether::command {

struct Parsed {
  std::string subcommand;  // "" when there is nothing to run
  Options options;
  int status = kSuccess;  // to end with when there is nothing to run; help and complaints are out already
};

Parsed parseCommandLine(int argc, char** argv);

}  // namespace tether::command
