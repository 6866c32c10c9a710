#include "NameTables.h"

#include <cstdio>

#include "DebugTrace.h"
#include "Locks.h"
#include "MAID.h"

#define ROW(name) \
  { name, #name }

const EnumMapEntry CommandDebugList[] = {ROW(kNkMAIDCommand_Async),
                                         ROW(kNkMAIDCommand_Open),
                                         ROW(kNkMAIDCommand_Close),
                                         ROW(kNkMAIDCommand_GetCapCount),
                                         ROW(kNkMAIDCommand_GetCapInfo),
                                         ROW(kNkMAIDCommand_CapStart),
                                         ROW(kNkMAIDCommand_CapSet),
                                         ROW(kNkMAIDCommand_CapGet),
                                         ROW(kNkMAIDCommand_CapGetDefault),
                                         ROW(kNkMAIDCommand_CapGetArray),
                                         ROW(kNkMAIDCommand_Mark),
                                         ROW(kNkMAIDCommand_AbortToMark),
                                         ROW(kNkMAIDCommand_Abort),
                                         ROW(kNkMAIDCommand_EnumChildren),
                                         ROW(kNkMAIDCommand_GetParent),
                                         ROW(kNkMAIDCommand_ResetToDefault),
                                         {0, nullptr}};

const EnumMapEntry EventDebugList[] = {ROW(kNkMAIDEvent_AddChild),           ROW(kNkMAIDEvent_RemoveChild),
                                       ROW(kNkMAIDEvent_WarmingUp),          ROW(kNkMAIDEvent_WarmedUp),
                                       ROW(kNkMAIDEvent_CapChange),          ROW(kNkMAIDEvent_OrphanedChildren),
                                       ROW(kNkMAIDEvent_CapChangeValueOnly), ROW(kNkMAIDEvent_AddPreviewImage),
                                       ROW(kNkMAIDEvent_CaptureComplete),    {0, nullptr}};

const EnumMapEntry ErrorDebugList[] = {ROW(kNkMAIDResult_NotSupported),
                                       ROW(kNkMAIDResult_UnexpectedDataType),
                                       ROW(kNkMAIDResult_ValueOutOfBounds),
                                       ROW(kNkMAIDResult_BufferSize),
                                       ROW(kNkMAIDResult_Aborted),
                                       ROW(kNkMAIDResult_NoMedia),
                                       ROW(kNkMAIDResult_NoEventProc),
                                       ROW(kNkMAIDResult_NoDataProc),
                                       ROW(kNkMAIDResult_ZombieObject),
                                       ROW(kNkMAIDResult_OutOfMemory),
                                       ROW(kNkMAIDResult_UnexpectedError),
                                       ROW(kNkMAIDResult_HardwareError),
                                       ROW(kNkMAIDResult_MissingComponent),
                                       ROW(kNkMAIDResult_NoError),
                                       ROW(kNkMAIDResult_Pending),
                                       ROW(kNkMAIDResult_OrphanedChildren),
                                       ROW(kNkMAIDResult_ApertureFEE),
                                       ROW(kNkMAIDResult_BufferNotReady),
                                       ROW(kNkMAIDResult_NormalTTL),
                                       ROW(kNkMAIDResult_MediaFull),
                                       ROW(kNkMAIDResult_InvalidMedia),
                                       ROW(kNkMAIDResult_EraseFailure),
                                       ROW(kNkMAIDResult_CameraNotFound),
                                       ROW(kNkMAIDResult_BatteryDontWork),
                                       ROW(kNkMAIDResult_ShutterBulb),
                                       ROW(kNkMAIDResult_OutOfFocus),
                                       ROW(kNkMAIDResult_Protected),
                                       ROW(kNkMAIDResult_FileExists),
                                       ROW(kNkMAIDResult_SharingViolation),
                                       ROW(kNkMAIDResult_DataTransFailure),
                                       ROW(kNkMAIDResult_SessionFailure),
                                       ROW(kNkMAIDResult_FileRemoved),
                                       ROW(kNkMAIDResult_BusReset),
                                       ROW(kNkMAIDResult_NonCPULens),
                                       ROW(kNkMAIDResult_ReleaseButtonPressed),
                                       ROW(kNkMAIDResult_BatteryExhausted),
                                       ROW(kNkMAIDResult_CaptureFailure),
                                       ROW(kNkMAIDResult_InvalidString),
                                       ROW(kNkMAIDResult_NotInitialized),
                                       ROW(kNkMAIDResult_CaptureDisable),
                                       ROW(kNkMAIDResult_DeviceBusy),
                                       ROW(kNkMAIDResult_CaptureDustFailure),
                                       ROW(kNkMAIDResult_ICADown),
                                       ROW(kNkMAIDResult_CpxPlaybackMode),
                                       ROW(kNkMAIDResult_NotLiveView),
                                       ROW(kNkMAIDResult_MFDriveEnd),
                                       ROW(kNkMAIDResult_UnformattedMedia),
                                       {0, nullptr}};

#undef ROW

namespace {

platform::Mutex unknownValueLock;  // the text may be overwritten, but never be seen half written without its end
char unknownValueText[50] GUARDED_BY(unknownValueLock);

}  // namespace

const char* enumToName(std::int32_t value, const EnumMapEntry* table) {
  for (const EnumMapEntry* row = table;; ++row) {
    if (row->value == value) return row->name;
    if (row->name == nullptr) break;
  }
  const platform::Guard guard(unknownValueLock);
  std::snprintf(unknownValueText, sizeof unknownValueText, "<unknown value: %d>", value);
  return unknownValueText;
}

const char* errorToName(std::int32_t result) { return enumToName(result, ErrorDebugList); }

const char* eventToName(std::int32_t event) { return enumToName(event, EventDebugList); }

const char* commandToName(std::int32_t command) { return enumToName(command, CommandDebugList); }

const char* capabilityToName(std::int32_t capability) { return enumToName(capability, CapabilityDebugList); }

void debugDumpError(std::int32_t result) {
  const char* const name = errorToName(result);
  char line[128];
  std::snprintf(line, sizeof line, "Error detected: (%ld) %s", static_cast<long>(result),
                name == nullptr ? "(unknown)" : name);
  debugmsg(line);
}
