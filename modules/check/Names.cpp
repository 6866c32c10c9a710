#include "Names.h"

#include "MAID.h"

namespace modulecheck {
namespace {

struct Name {
  int64_t number;
  const char* text;
};

#define COMMAND(name) \
  { kNkMAIDCommand_##name, #name }
#define CAPABILITY(name) \
  { kNkMAIDCapability_##name, #name }
#define RESULT(name) \
  { kNkMAIDResult_##name, #name }

constexpr Name kCommands[] = {COMMAND(Async),       COMMAND(Open),       COMMAND(Close),
                              COMMAND(GetCapCount), COMMAND(GetCapInfo), COMMAND(CapStart),
                              COMMAND(CapSet),      COMMAND(CapGet),     COMMAND(CapGetArray)};
constexpr Name kCapabilities[] = {CAPABILITY(EventProc),
                                  CAPABILITY(DataProc),
                                  CAPABILITY(IsAlive),
                                  CAPABILITY(Children),
                                  CAPABILITY(Name),
                                  CAPABILITY(DataTypes),
                                  CAPABILITY(StoredBytes),
                                  CAPABILITY(Capture),
                                  CAPABILITY(Acquire),
                                  CAPABILITY(BatteryLevel),
                                  CAPABILITY(FreeBytes),
                                  CAPABILITY(ExposureMode),
                                  CAPABILITY(ShutterSpeed),
                                  CAPABILITY(Aperture),
                                  CAPABILITY(Sensitivity),
                                  CAPABILITY(WBMode),
                                  CAPABILITY(RawJpegImageStatus),
                                  CAPABILITY(SaveMedia)};
constexpr Name kResults[] = {RESULT(NotSupported),     RESULT(UnexpectedDataType),
                             RESULT(ValueOutOfBounds), RESULT(BufferSize),
                             RESULT(Aborted),          RESULT(NoMedia),
                             RESULT(NoEventProc),      RESULT(NoDataProc),
                             RESULT(ZombieObject),     RESULT(OutOfMemory),
                             RESULT(UnexpectedError),  RESULT(HardwareError),
                             RESULT(MissingComponent), RESULT(NoError),
                             RESULT(Pending),          RESULT(OrphanedChildren),
                             RESULT(MediaFull),        RESULT(CameraNotFound),
                             RESULT(OutOfFocus),       RESULT(DataTransFailure),
                             RESULT(SessionFailure),   RESULT(BatteryExhausted),
                             RESULT(CaptureFailure),   RESULT(DeviceBusy)};

template <size_t N>
std::string textOf(const Name (&names)[N], int64_t number, const std::string& kind) {
  for (const Name& name : names) {
    if (name.number == number) return name.text;
  }
  return kind + std::to_string(number);
}

}  // namespace

std::string commandText(uint32_t command) { return textOf(kCommands, command, "command "); }

std::string capabilityText(uint32_t capability) { return textOf(kCapabilities, capability, "capability 0x%x"); }

std::string resultText(int32_t result) { return textOf(kResults, result, ""); }

}  // namespace modulecheck
