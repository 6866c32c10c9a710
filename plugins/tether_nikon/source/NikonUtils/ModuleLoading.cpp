#include "ModuleLoading.h"

#include "Bundle.h"

std::int32_t CallMAIDEntryPoint(NkMAIDEntryPoint* entryPoint, tagNkMAIDObject* object, std::uint32_t command,
                                std::uint32_t parameter, std::uint32_t dataType, std::uint64_t data,
                                NkMAIDCompletionProc* completion, void* reference) {
  return entryPoint(object, command, parameter, dataType, data, completion, reference);
}

std::int32_t FindNikonModulePath(const std::string& name, std::string& path) {
  path = platform::Bundle::mainBundlePath() + "/Contents/Helpers/" + name + ".bundle";
  return 0;
}

NkMAIDEntryPoint* LoadNikonModule(const std::string& path) {
  const auto bundle = platform::Bundle::create(path);
  if (!bundle || !bundle->loadExecutable()) return nullptr;
  void* const function = bundle->functionPointer("MAIDEntryPoint");
  if (function == nullptr) return nullptr;
  bundle->stayLoaded();
  return reinterpret_cast<NkMAIDEntryPoint*>(function);
}

std::int32_t Command_Open(NkMAIDEntryPoint* entryPoint, tagNkMAIDObject* parent, tagNkMAIDObject* object,
                          std::uint32_t id) {
  return CallMAIDEntryPoint(entryPoint, parent, kNkMAIDCommand_Open, id, kNkMAIDDataType_ObjectPtr, sdkData(object),
                            nullptr, nullptr);
}

bool Command_Close(NkMAIDEntryPoint* entryPoint, tagNkMAIDObject* object) {
  return CallMAIDEntryPoint(entryPoint, object, kNkMAIDCommand_Close, 0, kNkMAIDDataType_Null, 0, nullptr, nullptr) ==
         kNkMAIDResult_NoError;
}
