/*
 * The binary interface between the tether helper and a camera SDK module: records, numbers and function types, nothing
 * else. The header stands alone and compiles as C11 and as C++; a module needs no other file of this project.
 *
 * A module is a loadable bundle that exports one function, "MAIDEntryPoint", of the type NkMAIDEntryPoint below.
 * Everything goes through it, addressed to one of a tree of objects: module, device (camera), item (picture) and data
 * object (the picture's bytes). Calls may come from two threads. A module calls back only from inside a call of the
 * entry point or, where it cannot do better, from a thread of its own.
 *
 * All integers are little-endian and of fixed width; pointers are 64 bits wide. Where "data" carries a pointer, it is
 * the pointer's value as an unsigned 64-bit integer, and what it points to belongs to the caller.
 */
#ifndef MAID_H
#define MAID_H

#include <assert.h>
#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Commands: what a call of the entry point asks for. */
enum {
  kNkMAIDCommand_Async = 0,       /* do pending work; events, data and completions are delivered inside */
  kNkMAIDCommand_Open = 1,        /* parameter: id of the child, 0 for a module; data: the new object's record */
  kNkMAIDCommand_Close = 2,       /* the record's object is gone afterwards */
  kNkMAIDCommand_GetCapCount = 3, /* data: uint32_t to fill in */
  kNkMAIDCommand_GetCapInfo = 4,  /* parameter: count; data: that many capability records to fill in */
  kNkMAIDCommand_CapStart = 5,    /* parameter: capability; an action, reported done by the completion */
  kNkMAIDCommand_CapSet = 6,      /* parameter: capability; data by data type */
  kNkMAIDCommand_CapGet = 7,      /* parameter: capability; data by data type, filled in */
  kNkMAIDCommand_CapGetDefault = 8,
  kNkMAIDCommand_CapGetArray = 9, /* parameter: capability; data: enumeration record with room for its elements */
  kNkMAIDCommand_Mark = 10,
  kNkMAIDCommand_AbortToMark = 11,
  kNkMAIDCommand_Abort = 12,
  kNkMAIDCommand_EnumChildren = 13, /* look for children again; reported as events */
  kNkMAIDCommand_GetParent = 14,
  kNkMAIDCommand_ResetToDefault = 15
};

/* Events: the second argument of an event procedure. */
enum {
  kNkMAIDEvent_AddChild = 0,    /* data: id of the new child */
  kNkMAIDEvent_RemoveChild = 1, /* data: id of the child that went */
  kNkMAIDEvent_WarmingUp = 2,
  kNkMAIDEvent_WarmedUp = 3,
  kNkMAIDEvent_CapChange = 4, /* data: capability */
  kNkMAIDEvent_OrphanedChildren = 5,
  kNkMAIDEvent_CapChangeValueOnly = 6, /* data: capability */
  kNkMAIDEvent_AddPreviewImage = 0x107,
  kNkMAIDEvent_CaptureComplete = 0x108
};

/* Results: 0 success, negative failures, positive from 128 conditions of the camera. */
enum {
  kNkMAIDResult_NotSupported = -127,
  kNkMAIDResult_UnexpectedDataType = -126,
  kNkMAIDResult_ValueOutOfBounds = -125,
  kNkMAIDResult_BufferSize = -124, /* the room given does not fit what there is to give (any more) */
  kNkMAIDResult_Aborted = -123,
  kNkMAIDResult_NoMedia = -122,
  kNkMAIDResult_NoEventProc = -121,
  kNkMAIDResult_NoDataProc = -120,
  kNkMAIDResult_ZombieObject = -119, /* the object, or its camera, is gone */
  kNkMAIDResult_OutOfMemory = -118,
  kNkMAIDResult_UnexpectedError = -117,
  kNkMAIDResult_HardwareError = -116,
  kNkMAIDResult_MissingComponent = -115,
  kNkMAIDResult_NoError = 0,
  kNkMAIDResult_Pending = 1, /* accepted; goes on inside later polls */
  kNkMAIDResult_OrphanedChildren = 2,
  kNkMAIDResult_ApertureFEE = 128,
  kNkMAIDResult_BufferNotReady = 129,
  kNkMAIDResult_NormalTTL = 130,
  kNkMAIDResult_MediaFull = 131,
  kNkMAIDResult_InvalidMedia = 132,
  kNkMAIDResult_EraseFailure = 133,
  kNkMAIDResult_CameraNotFound = 134,
  kNkMAIDResult_BatteryDontWork = 135,
  kNkMAIDResult_ShutterBulb = 136,
  kNkMAIDResult_OutOfFocus = 137,
  kNkMAIDResult_Protected = 138,
  kNkMAIDResult_FileExists = 139,
  kNkMAIDResult_SharingViolation = 140,
  kNkMAIDResult_DataTransFailure = 141,
  kNkMAIDResult_SessionFailure = 142,
  kNkMAIDResult_FileRemoved = 143,
  kNkMAIDResult_BusReset = 144,
  kNkMAIDResult_NonCPULens = 145,
  kNkMAIDResult_ReleaseButtonPressed = 146,
  kNkMAIDResult_BatteryExhausted = 147,
  kNkMAIDResult_CaptureFailure = 148,
  kNkMAIDResult_InvalidString = 149,
  kNkMAIDResult_NotInitialized = 150,
  kNkMAIDResult_CaptureDisable = 151,
  kNkMAIDResult_DeviceBusy = 152,
  kNkMAIDResult_CaptureDustFailure = 153,
  kNkMAIDResult_ICADown = 154,
  kNkMAIDResult_CpxPlaybackMode = 158,
  kNkMAIDResult_NotLiveView = 159,
  kNkMAIDResult_MFDriveEnd = 160,
  kNkMAIDResult_UnformattedMedia = 161
};

/* Capabilities: the numbered properties and actions of an object, as far as the tether helper uses them. */
enum {
  kNkMAIDCapability_EventProc = 3,    /* set: callback record, or nothing to unregister */
  kNkMAIDCapability_DataProc = 4,     /* set: callback record, or nothing to unregister */
  kNkMAIDCapability_IsAlive = 6,      /* boolean; of a camera */
  kNkMAIDCapability_Children = 7,     /* enumeration of child ids */
  kNkMAIDCapability_Name = 9,         /* string */
  kNkMAIDCapability_DataTypes = 12,   /* unsigned bit mask; of an item */
  kNkMAIDCapability_StoredBytes = 14, /* size in bytes; of a data object */
  kNkMAIDCapability_Capture = 17,     /* action of a camera: fires the shutter */
  kNkMAIDCapability_Acquire = 20,     /* action of a data object: delivers its bytes */
  kNkMAIDCapability_BatteryLevel = 49,
  kNkMAIDCapability_FreeBytes = 50,
  kNkMAIDCapability_ExposureMode = 0x8111,
  kNkMAIDCapability_ShutterSpeed = 0x8112,
  kNkMAIDCapability_Aperture = 0x8113,
  kNkMAIDCapability_Sensitivity = 0x8117,
  kNkMAIDCapability_WBMode = 0x8118,
  kNkMAIDCapability_RawJpegImageStatus = 0x81b5, /* non-zero: the data object is one half of a pair */
  kNkMAIDCapability_SaveMedia = 0x8305           /* unsigned; 0: card only, 1: to the computer */
};

/* Value types of a capability, as its capability record announces them. */
enum {
  kNkMAIDCapType_Process = 0, /* an action: has no value and is started */
  kNkMAIDCapType_Boolean = 1,
  kNkMAIDCapType_Integer = 2,
  kNkMAIDCapType_Unsigned = 3,
  kNkMAIDCapType_String = 8,
  kNkMAIDCapType_Enum = 12
};

/* Data types: what the data argument of a call is. */
enum {
  kNkMAIDDataType_Null = 0,         /* nothing */
  kNkMAIDDataType_Unsigned = 3,     /* the unsigned 32-bit value itself */
  kNkMAIDDataType_BooleanPtr = 4,   /* uint8_t* */
  kNkMAIDDataType_IntegerPtr = 5,   /* int32_t* */
  kNkMAIDDataType_UnsignedPtr = 6,  /* uint32_t* */
  kNkMAIDDataType_StringPtr = 11,   /* char[kNkMAIDStringSize], zero-terminated */
  kNkMAIDDataType_CallbackPtr = 13, /* tagNkMAIDCallback*; copied by the module during the call */
  kNkMAIDDataType_EnumPtr = 16,     /* tagNkMAIDEnum* */
  kNkMAIDDataType_ObjectPtr = 17,   /* tagNkMAIDObject* */
  kNkMAIDDataType_CapInfoPtr = 18   /* tagNkMAIDCapInfo[count] */
};

/* Element types of an enumeration. */
enum {
  kNkMAIDArrayType_Integer = 1,      /* int32_t */
  kNkMAIDArrayType_Unsigned = 2,     /* uint32_t */
  kNkMAIDArrayType_PackedString = 7, /* count is the bytes of all strings together, each with its zero byte */
  kNkMAIDArrayType_String = 8        /* char[kNkMAIDStringSize] each */
};

/* Kinds of data objects: bits of an item's DataTypes, and the id under which a data object is opened. */
enum { kNkMAIDDataObjType_Image = 0x01, kNkMAIDDataObjType_File = 0x10 };

/* File data types. */
enum {
  kNkMAIDFileDataType_JPEG = 1,
  kNkMAIDFileDataType_TIFF = 2,
  kNkMAIDFileDataType_NEF = 4,
  kNkMAIDFileDataType_NDF = 257
};

enum { kNkMAIDStringSize = 256 };

/* An opened object. The record belongs to the caller, who zeroes it before the open and keeps it until the close. */
typedef struct tagNkMAIDObject {
  uint64_t sdkHead; /* the module's */
  void* refClient;  /* the caller's; a module leaves it alone */
  uint64_t sdkTail; /* the module's */
} tagNkMAIDObject;

/* One announced capability. */
typedef struct tagNkMAIDCapInfo {
  uint32_t id;
  uint32_t valueType;  /* kNkMAIDCapType_... */
  uint8_t unused[264]; /* not read by the helper; zero where there is nothing to say */
} tagNkMAIDCapInfo;

/* An enumeration. CapGet fills in all but the elements; CapGetArray fills the elements into the caller's block. */
typedef struct tagNkMAIDEnum {
  uint32_t elementType; /* kNkMAIDArrayType_... */
  uint32_t elementCount;
  uint32_t currentIndex; /* which element is the current value */
  uint32_t defaultIndex;
  int16_t elementSize; /* bytes an element */
  uint8_t padding[6];
  void* elements; /* allocated by the caller: elementCount * elementSize bytes */
} tagNkMAIDEnum;

/* What a data procedure is told about one delivery of a file. */
typedef struct tagNkMAIDFileInfo {
  uint32_t dataType;     /* kNkMAIDDataObjType_... bits; File is set for a file's bytes */
  uint32_t fileDataType; /* kNkMAIDFileDataType_... */
  uint32_t totalLength;  /* bytes of the whole file */
  uint32_t ulStart;      /* offset of this delivery in the file */
  uint32_t ulLength;     /* bytes in this delivery */
} tagNkMAIDFileInfo;

/* An event: reference as registered, event, data by event. */
typedef void NkMAIDEventProc(void* reference, uint32_t event, uint64_t data);

/* A delivery: reference as registered, file-info record, the bytes. Both are valid during the call. 0: go on. */
typedef int32_t NkMAIDDataProc(void* reference, void* dataInfo, void* data);

/* The end of an asynchronous command: its arguments, the reference that came with it, and its result. Called once. */
typedef void NkMAIDCompletionProc(tagNkMAIDObject* object, uint32_t command, uint32_t parameter, uint32_t dataType,
                                  uint64_t data, void* reference, int32_t result);

/* A callback as it is registered: procedure is an NkMAIDEventProc or an NkMAIDDataProc, by capability. */
typedef struct tagNkMAIDCallback {
  void (*procedure)(void);
  void* reference;
} tagNkMAIDCallback;

/* The one exported function. object: the addressed object, or null for the module as a whole (opening a module). */
typedef int32_t NkMAIDEntryPoint(tagNkMAIDObject* object, uint32_t command, uint32_t parameter, uint32_t dataType,
                                 uint64_t data, NkMAIDCompletionProc* completion, void* reference);

#ifdef __cplusplus
#define MAID_ASSERT(condition) static_assert(condition, #condition)
#else
#define MAID_ASSERT(condition) _Static_assert(condition, #condition)
#endif

MAID_ASSERT(sizeof(void*) == 8);
MAID_ASSERT(sizeof(tagNkMAIDObject) == 24);
MAID_ASSERT(offsetof(tagNkMAIDObject, sdkHead) == 0);
MAID_ASSERT(offsetof(tagNkMAIDObject, refClient) == 8);
MAID_ASSERT(offsetof(tagNkMAIDObject, sdkTail) == 16);
MAID_ASSERT(sizeof(tagNkMAIDCapInfo) == 272);
MAID_ASSERT(offsetof(tagNkMAIDCapInfo, id) == 0);
MAID_ASSERT(offsetof(tagNkMAIDCapInfo, valueType) == 4);
MAID_ASSERT(offsetof(tagNkMAIDCapInfo, unused) == 8);
MAID_ASSERT(sizeof(tagNkMAIDEnum) == 32);
MAID_ASSERT(offsetof(tagNkMAIDEnum, elementType) == 0);
MAID_ASSERT(offsetof(tagNkMAIDEnum, elementCount) == 4);
MAID_ASSERT(offsetof(tagNkMAIDEnum, currentIndex) == 8);
MAID_ASSERT(offsetof(tagNkMAIDEnum, defaultIndex) == 12);
MAID_ASSERT(offsetof(tagNkMAIDEnum, elementSize) == 16);
MAID_ASSERT(offsetof(tagNkMAIDEnum, padding) == 18);
MAID_ASSERT(offsetof(tagNkMAIDEnum, elements) == 24);
MAID_ASSERT(sizeof(tagNkMAIDFileInfo) == 20);
MAID_ASSERT(offsetof(tagNkMAIDFileInfo, dataType) == 0);
MAID_ASSERT(offsetof(tagNkMAIDFileInfo, fileDataType) == 4);
MAID_ASSERT(offsetof(tagNkMAIDFileInfo, totalLength) == 8);
MAID_ASSERT(offsetof(tagNkMAIDFileInfo, ulStart) == 12);
MAID_ASSERT(offsetof(tagNkMAIDFileInfo, ulLength) == 16);
MAID_ASSERT(sizeof(tagNkMAIDCallback) == 16);
MAID_ASSERT(offsetof(tagNkMAIDCallback, procedure) == 0);
MAID_ASSERT(offsetof(tagNkMAIDCallback, reference) == 8);

#undef MAID_ASSERT

#ifdef __cplusplus
}
#endif

#endif
