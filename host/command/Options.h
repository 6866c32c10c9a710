// What the command line asks for, and how the command ends.
#pragma once

#include <cerrno>
#include <chrono>
#include <optional>
#include <string>

#include "Text.h"

namespace tether::command {

// Exit statuses.
inline constexpr int kSuccess = 0;
inline constexpr int kUnwritable = 1;  // standard output is closed
inline constexpr int kUsage = 2;
inline constexpr int kNoCamera = 3;
inline constexpr int kTimeout = 4;
inline constexpr int kHelperLost = 5;
inline constexpr int kNotSaved = 6;
inline constexpr int kInterrupted = 130;

struct Options {
  bool json = false;
  std::string output = ".";
  std::optional<int> count;
  std::optional<std::chrono::milliseconds> every;
  std::optional<std::chrono::milliseconds> timeout;
  std::string camera;  // id or name; "" for any
  bool savesPictures = false;
  bool virtualCamera = false;
  std::string helper;     // "" for the one beside the command
  std::string helperLog;  // "" to drop what the helper logs, "-" for standard error
  std::string send;       // a request to send
  std::optional<int> device;
};

// Ends a command with a status and a word to the user, who may already have been told everything ("").
struct Failure {
  int status;
  std::string text;
};

// What it ends with where a file cannot be made: with that name, or none at all.
inline int statusWithoutFile(int error) { return error == EMFILE || error == ENFILE ? kHelperLost : kUsage; }

// How a command ended, for the last line that it prints.
struct Outcome {
  int status = kSuccess;
  std::string error;  // "" when all is well, or when everything was said
  Json details;       // of this command, merged into that line; null for none
};

}  // namespace tether::command
