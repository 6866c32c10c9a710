/* The example module, broken in the way that the environment's BROKEN names. */
#define _GNU_SOURCE
#include <stdio.h>
#include <stdlib.h>
#include <unistd.h>

#define MAIDEntryPoint wholeEntryPoint
#include "example_module.c"
#undef MAIDEntryPoint

#ifndef ENTRY
#define ENTRY MAIDEntryPoint
#endif
__attribute__((visibility("default"))) NkMAIDEntryPoint ENTRY;

static pthread_mutex_t always = PTHREAD_RECURSIVE_MUTEX_INITIALIZER_NP;
static tagNkMAIDCallback lastEvents;

static int broken(const char* way) {
  const char* const named = getenv("BROKEN");
  return named != NULL && strcmp(named, way) == 0;
}

static void readWrongly(uint32_t capability, void* data) {
  if (capability == kNkMAIDCapability_Name && broken("long name")) memset(data, 'X', kNkMAIDStringSize + 1);
  if (capability == kNkMAIDCapability_BatteryLevel && broken("wide number")) memset(data, 0, sizeof(uint64_t));
  if (capability != kNkMAIDCapability_Aperture) return;
  if (broken("crashes")) abort();
  if (broken("exits")) _exit(3);
  if (broken("prints") || broken("pipes")) printf("Aperture\n");
  if (broken("pipes")) fflush(stdout);
  if (broken("reads") || broken("pipes")) getchar();
  if (broken("closes") || broken("pipes")) close(STDIN_FILENO);
}

int32_t ENTRY(tagNkMAIDObject* object, uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
              NkMAIDCompletionProc* completion, void* reference) {
  if (command == kNkMAIDCommand_Open && broken("fails")) return kNkMAIDResult_MissingComponent;
  if (command == kNkMAIDCommand_CapStart && broken("completes at once")) {
    completion(object, command, parameter, dataType, data, reference, kNkMAIDResult_NoError);
    return kNkMAIDResult_NoError;
  }
  if (command == kNkMAIDCommand_CapStart && broken("wrong reference")) reference = object;
  if (parameter == kNkMAIDCapability_EventProc && dataType == kNkMAIDDataType_CallbackPtr) {
    lastEvents = *(tagNkMAIDCallback*)pointer(data);
  }
  if (command == kNkMAIDCommand_Async && broken("late event") && lastEvents.procedure != NULL) {
    ((NkMAIDEventProc*)lastEvents.procedure)(lastEvents.reference, kNkMAIDEvent_CapChange, 0);
  }
  if (command == kNkMAIDCommand_GetCapInfo && broken("no count")) {
    parameter = kCapabilities[objectOf(object)->level].count;
  }
  const int locks = broken("lock");
  if (locks) pthread_mutex_lock(&always);
  const int32_t result = wholeEntryPoint(object, command, parameter, dataType, data, completion, reference);
  if (locks) pthread_mutex_unlock(&always);
  if (command == kNkMAIDCommand_CapGet) readWrongly(parameter, pointer(data));
  if (command == kNkMAIDCommand_Open && broken("client")) ((tagNkMAIDObject*)pointer(data))->refClient = NULL;
  return result;
}
