#include "Exception.h"

#include <cstdlib>

#include "Log.h"

namespace platform {

AssertionHandler& AssertionHandler::current() {
  static AssertionHandler handler;
  return handler;
}

void AssertionHandler::handleFailureInMethod(const char* method, const void* object, const char* file, int line,
                                             const char* description) {
  log("*** Assertion failure in %s (object %p), %s:%d: %s", method, object, file, line, description);
  throw Exception(kInternalInconsistency, description);
}

void failAssertion(const char* expression, const char* function, const char* file, int line) {
  log("Assertion failed: (%s), function %s, file %s, line %d.", expression, function, file, line);
  std::abort();
}

}  // namespace platform
