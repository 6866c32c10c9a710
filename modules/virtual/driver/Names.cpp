#include "Names.h"

#include <cstddef>

#include "MAID.h"

namespace virtualcamera {
namespace {

struct Name {
  std::string_view name;
  int64_t number;
};

constexpr Name kCapabilities[] = {
    {"EventProc", kNkMAIDCapability_EventProc},
    {"DataProc", kNkMAIDCapability_DataProc},
    {"IsAlive", kNkMAIDCapability_IsAlive},
    {"Children", kNkMAIDCapability_Children},
    {"Name", kNkMAIDCapability_Name},
    {"DataTypes", kNkMAIDCapability_DataTypes},
    {"StoredBytes", kNkMAIDCapability_StoredBytes},
    {"Capture", kNkMAIDCapability_Capture},
    {"Acquire", kNkMAIDCapability_Acquire},
    {"BatteryLevel", kNkMAIDCapability_BatteryLevel},
    {"FreeBytes", kNkMAIDCapability_FreeBytes},
    {"ExposureMode", kNkMAIDCapability_ExposureMode},
    {"ShutterSpeed", kNkMAIDCapability_ShutterSpeed},
    {"Aperture", kNkMAIDCapability_Aperture},
    {"Sensitivity", kNkMAIDCapability_Sensitivity},
    {"WBMode", kNkMAIDCapability_WBMode},
    {"RawJpegImageStatus", kNkMAIDCapability_RawJpegImageStatus},
    {"SaveMedia", kNkMAIDCapability_SaveMedia},
};

constexpr Name kCommands[] = {
    {"Async", kNkMAIDCommand_Async},
    {"Open", kNkMAIDCommand_Open},
    {"Close", kNkMAIDCommand_Close},
    {"GetCapCount", kNkMAIDCommand_GetCapCount},
    {"GetCapInfo", kNkMAIDCommand_GetCapInfo},
    {"CapStart", kNkMAIDCommand_CapStart},
    {"CapSet", kNkMAIDCommand_CapSet},
    {"CapGet", kNkMAIDCommand_CapGet},
    {"CapGetDefault", kNkMAIDCommand_CapGetDefault},
    {"CapGetArray", kNkMAIDCommand_CapGetArray},
    {"Mark", kNkMAIDCommand_Mark},
    {"AbortToMark", kNkMAIDCommand_AbortToMark},
    {"Abort", kNkMAIDCommand_Abort},
    {"EnumChildren", kNkMAIDCommand_EnumChildren},
    {"GetParent", kNkMAIDCommand_GetParent},
    {"ResetToDefault", kNkMAIDCommand_ResetToDefault},
};

constexpr Name kResults[] = {
    {"NotSupported", kNkMAIDResult_NotSupported},
    {"UnexpectedDataType", kNkMAIDResult_UnexpectedDataType},
    {"ValueOutOfBounds", kNkMAIDResult_ValueOutOfBounds},
    {"BufferSize", kNkMAIDResult_BufferSize},
    {"Aborted", kNkMAIDResult_Aborted},
    {"NoMedia", kNkMAIDResult_NoMedia},
    {"NoEventProc", kNkMAIDResult_NoEventProc},
    {"NoDataProc", kNkMAIDResult_NoDataProc},
    {"ZombieObject", kNkMAIDResult_ZombieObject},
    {"OutOfMemory", kNkMAIDResult_OutOfMemory},
    {"UnexpectedError", kNkMAIDResult_UnexpectedError},
    {"HardwareError", kNkMAIDResult_HardwareError},
    {"MissingComponent", kNkMAIDResult_MissingComponent},
    {"NoError", kNkMAIDResult_NoError},
    {"Pending", kNkMAIDResult_Pending},
    {"OrphanedChildren", kNkMAIDResult_OrphanedChildren},
    {"ApertureFEE", kNkMAIDResult_ApertureFEE},
    {"BufferNotReady", kNkMAIDResult_BufferNotReady},
    {"NormalTTL", kNkMAIDResult_NormalTTL},
    {"MediaFull", kNkMAIDResult_MediaFull},
    {"InvalidMedia", kNkMAIDResult_InvalidMedia},
    {"EraseFailure", kNkMAIDResult_EraseFailure},
    {"CameraNotFound", kNkMAIDResult_CameraNotFound},
    {"BatteryDontWork", kNkMAIDResult_BatteryDontWork},
    {"ShutterBulb", kNkMAIDResult_ShutterBulb},
    {"OutOfFocus", kNkMAIDResult_OutOfFocus},
    {"Protected", kNkMAIDResult_Protected},
    {"FileExists", kNkMAIDResult_FileExists},
    {"SharingViolation", kNkMAIDResult_SharingViolation},
    {"DataTransFailure", kNkMAIDResult_DataTransFailure},
    {"SessionFailure", kNkMAIDResult_SessionFailure},
    {"FileRemoved", kNkMAIDResult_FileRemoved},
    {"BusReset", kNkMAIDResult_BusReset},
    {"NonCPULens", kNkMAIDResult_NonCPULens},
    {"ReleaseButtonPressed", kNkMAIDResult_ReleaseButtonPressed},
    {"BatteryExhausted", kNkMAIDResult_BatteryExhausted},
    {"CaptureFailure", kNkMAIDResult_CaptureFailure},
    {"InvalidString", kNkMAIDResult_InvalidString},
    {"NotInitialized", kNkMAIDResult_NotInitialized},
    {"CaptureDisable", kNkMAIDResult_CaptureDisable},
    {"DeviceBusy", kNkMAIDResult_DeviceBusy},
    {"CaptureDustFailure", kNkMAIDResult_CaptureDustFailure},
    {"ICADown", kNkMAIDResult_ICADown},
    {"CpxPlaybackMode", kNkMAIDResult_CpxPlaybackMode},
    {"NotLiveView", kNkMAIDResult_NotLiveView},
    {"MFDriveEnd", kNkMAIDResult_MFDriveEnd},
    {"UnformattedMedia", kNkMAIDResult_UnformattedMedia},
};

template <size_t count>
std::optional<int64_t> find(const Name (&names)[count], std::string_view name) {
  for (const Name& entry : names)
    if (entry.name == name) return entry.number;
  return std::nullopt;
}

}  // namespace

std::optional<int64_t> capabilityNumber(std::string_view name) { return find(kCapabilities, name); }

std::optional<int64_t> commandNumber(std::string_view name) { return find(kCommands, name); }

std::optional<int64_t> resultNumber(std::string_view name) { return find(kResults, name); }

}  // namespace virtualcamera
