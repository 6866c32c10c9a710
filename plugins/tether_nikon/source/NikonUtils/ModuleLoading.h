// Finding and loading SDK modules, and the thin wrappers through which every call into one goes. Loading is for the
// main thread; the calls may come from any, serialised by the callers where that matters.
#pragma once

#include <cstdint>
#include <string>

#include "MAID.h"

// Passes the last seven arguments on to the entry point as they are and returns its result.
std::int32_t CallMAIDEntryPoint(NkMAIDEntryPoint* entryPoint, tagNkMAIDObject* object, std::uint32_t command,
                                std::uint32_t parameter, std::uint32_t dataType, std::uint64_t data,
                                NkMAIDCompletionProc* completion, void* reference);

// Stores the path at which a module of that name belongs, and returns 0. Whether it is there shows when it is loaded.
std::int32_t FindNikonModulePath(const std::string& name, std::string& path);

// The module's entry point, or null. A module that was loaded stays so for the rest of the process.
NkMAIDEntryPoint* LoadNikonModule(const std::string& path);

// Opens the child `id` of the parent, a null parent and 0 for a module, into `object`, which the caller zeroed.
std::int32_t Command_Open(NkMAIDEntryPoint* entryPoint, tagNkMAIDObject* parent, tagNkMAIDObject* object,
                          std::uint32_t id);

// Closes an object. True on success.
bool Command_Close(NkMAIDEntryPoint* entryPoint, tagNkMAIDObject* object);

// A pointer as the data argument of a call.
inline std::uint64_t sdkData(const void* pointer) { return reinterpret_cast<std::uintptr_t>(pointer); }
