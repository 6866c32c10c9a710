#include <dlfcn.h>

#include "MAID.h"

extern "C" __attribute__((visibility("default"))) int32_t MAIDEntryPoint(tagNkMAIDObject* object, uint32_t command,
                                                                         uint32_t parameter, uint32_t dataType,
                                                                         uint64_t data,
                                                                         NkMAIDCompletionProc* completion,
                                                                         void* reference) {
  static auto* const target = reinterpret_cast<NkMAIDEntryPoint*>(dlsym(RTLD_DEFAULT, "testEntryPoint"));
  if (target == nullptr) return kNkMAIDResult_MissingComponent;
  return target(object, command, parameter, dataType, data, completion, reference);
}
