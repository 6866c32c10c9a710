// A camera module that does wrong: the virtual camera, between which and its caller results and values are replaced,
// and which is joined by callbacks that nobody expects. What goes wrong where, its user decides call by call.
//
// It is honest about memory alone: it reads and writes nothing but what it was given for that. Of its caller it expects
// what the interface promises: objects are open when they are called and closed after their children, records zeroed
// before they are opened, registered procedures not null.
#pragma once

#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <utility>
#include <vector>

#include "Input.h"
#include "VirtualCamera.h"

namespace testkit {

// What becomes of a call.
struct Deed {
  bool done = true;
  std::optional<std::int32_t> answer{};  // in place of its own; without one, a call that is not done answers NoError
  Input* nonsense = nullptr;             // what it gives comes from here
  std::function<void()> before{};
  std::function<void()> after{};
};

class FaultyModule {
 public:
  struct Procedure {
    virtualcamera::Level level;  // of the object that it was registered for
    tagNkMAIDCallback callback;
    void event(std::uint32_t event, std::uint64_t data) const;
    void deliver(tagNkMAIDFileInfo* info, void* data) const;
  };
  struct Completion {
    NkMAIDCompletionProc* procedure;
    void* reference;
    void operator()(std::int32_t result) const;
  };
  // All that were ever registered or waited for, whether they are still to be called or not.
  struct Callbacks {
    std::vector<Procedure> events, deliveries;
    std::vector<Completion> completions;
  };

  // One at a time. `broken` hears of a promise that is not kept.
  FaultyModule(std::function<Deed(const virtualcamera::Call&)> decide, std::function<void(const char*)> broken);
  FaultyModule(const FaultyModule&) = delete;
  FaultyModule& operator=(const FaultyModule&) = delete;
  ~FaultyModule();

  static std::int32_t entryPoint(tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter,
                                 std::uint32_t dataType, std::uint64_t data, NkMAIDCompletionProc* completion,
                                 void* reference);
  Callbacks callbacks();
  // Anything in place of what a delivery says of itself, but no more bytes than can be had.
  static void scribble(Input& from, tagNkMAIDFileInfo& info);

  virtualcamera::Model model;

 private:
  std::int32_t call(tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter, std::uint32_t dataType,
                    std::uint64_t data, NkMAIDCompletionProc* completion, void* reference);
  virtualcamera::Target targetOf(const tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter);
  static void scribble(Input& from, std::uint32_t command, std::uint32_t count, std::uint32_t dataType, void* data);

  const std::function<Deed(const virtualcamera::Call&)> _decide;
  const std::function<void(const char*)> _broken;
  std::mutex _lock;
  std::map<const tagNkMAIDObject*, virtualcamera::Target> _open;
  Callbacks _callbacks;
};

}  // namespace testkit
