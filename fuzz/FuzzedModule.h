// A camera module whose every answer comes from the input of a run: results, lists, values and what polls deliver.
//
// It is honest about memory alone: it reads and writes nothing but what it was given for that. Of its caller it expects
// what the interface promises, and a caller that breaks that is a finding: objects are open when they are called,
// children are closed before their parents, and everything is closed in the end. After some polls it answers no more of
// them, so that no wait goes on for ever.
#pragma once

#include <cstdint>
#include <map>
#include <vector>

#include "Input.h"
#include "MAID.h"

namespace fuzz {

// What a well-behaved camera has, in any of its objects.
struct Announced {
  uint32_t capability;
  uint32_t valueType;
};
extern const std::vector<Announced>& usualCapabilities;

class FuzzedModule {
 public:
  // One at a time: it is behind the entry point while it lives.
  explicit FuzzedModule(Input& input);
  FuzzedModule(const FuzzedModule&) = delete;
  FuzzedModule& operator=(const FuzzedModule&) = delete;
  ~FuzzedModule();

  static NkMAIDEntryPoint entryPoint;

 private:
  struct Object {
    tagNkMAIDObject* parent = nullptr;
    bool isCamera = false;
    tagNkMAIDCallback eventProc{};
    tagNkMAIDCallback dataProc{};
  };
  struct Completion {
    tagNkMAIDObject* object;
    uint32_t capability;
    NkMAIDCompletionProc* procedure;
    void* reference;
  };

  int32_t call(tagNkMAIDObject* record, uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
               NkMAIDCompletionProc* completion, void* reference);
  int32_t answer();
  int32_t open(tagNkMAIDObject* parent, tagNkMAIDObject* record);
  void close(tagNkMAIDObject* record);
  void announce(tagNkMAIDCapInfo* list, uint32_t count);
  int32_t set(Object& object, uint32_t capability, uint32_t dataType, uint64_t data);
  int32_t get(uint32_t capability, uint32_t dataType, void* data);
  void describeEnum(uint32_t capability, tagNkMAIDEnum& record);
  void fillEnum(uint32_t capability, tagNkMAIDEnum& record);
  uint32_t unsignedValue(uint32_t capability);

  // Callbacks.
  int32_t poll();
  void deliverSomething();
  void complete();
  void deliverEvent();
  void deliverData();
  tagNkMAIDFileInfo nextPiece();

  Input& _input;
  std::map<tagNkMAIDObject*, Object> _open;
  std::vector<Completion> _completions;
  std::vector<tagNkMAIDCallback> _dataProcs;  // of closed objects too
  std::vector<tagNkMAIDCallback> _lateEventProcs;
  const bool _talksAtAnyTime;
  int _polls = 0;
  int _calls = 0;
  int _depth = 0;  // callbacks inside each other
  uint32_t _fileSize = 0;
  uint32_t _delivered = 0;
};

}  // namespace fuzz
