// The platform's exception: a name to tell it by and a reason to print.
#pragma once

#include <exception>
#include <string>

namespace platform {

class Exception : public std::exception {
 public:
  Exception(std::string name, std::string reason) : _name(std::move(name)), _reason(std::move(reason)) {}

  const std::string& name() const { return _name; }
  const std::string& reason() const { return _reason; }
  const char* what() const noexcept override { return _reason.c_str(); }

 private:
  std::string _name;
  std::string _reason;
};

// The exception that a failed assertion in a method raises.
inline constexpr const char* kInternalInconsistency = "InternalInconsistency";

// Logs the failure and raises it as an Exception named kInternalInconsistency whose reason is the description.
class AssertionHandler {
 public:
  static AssertionHandler& current();
  [[noreturn]] void handleFailureInMethod(const char* method, const void* object, const char* file, int line,
                                          const char* description);
};

// Logs a failed assertion of `expression` and stops the program.
[[noreturn]] void failAssertion(const char* expression, const char* function, const char* file, int line);

}  // namespace platform
