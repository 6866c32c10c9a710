/* The interface's header stands alone, in C too. */
#include "MAID.h"

__attribute__((visibility("default"))) NkMAIDEntryPoint MAIDEntryPoint;

int32_t MAIDEntryPoint(tagNkMAIDObject* object, uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
                       NkMAIDCompletionProc* completion, void* reference) {
  if (completion != NULL) completion(object, command, parameter, dataType, data, reference, kNkMAIDResult_NotSupported);
  return kNkMAIDResult_MissingComponent;
}
