/*
 * A camera module to begin from: plain C, the interface's header and the system, nothing else.
 *
 * One camera, some settings, a shutter. A picture comes in pieces, one in each poll of its data object. It may be
 * called on two threads at once; callbacks are made without the lock.
 */
#include <pthread.h>
#include <string.h>

#include "MAID.h"

#define COUNT(array) (sizeof(array) / sizeof((array)[0]))

enum { kObjects = 64, kPictureBytes = 1000, kPieceBytes = 300, kCameraId = 1 };

enum { kModule, kCamera, kItem, kData, kLevels };

typedef struct Object {
  int open;
  int level;
  tagNkMAIDCallback event;
  tagNkMAIDCallback data;
  int started; /* its one action: Capture of a camera, Acquire of a data object */
  NkMAIDCompletionProc* completion;
  void* reference;
  uint32_t offset;
} Object;

typedef struct Announced {
  uint32_t id;
  uint32_t type;
} Announced;

static const Announced kModuleCapabilities[] = {{kNkMAIDCapability_EventProc, kNkMAIDCapType_Process},
                                                {kNkMAIDCapability_Children, kNkMAIDCapType_Enum}};
static const Announced kCameraCapabilities[] = {
    {kNkMAIDCapability_EventProc, kNkMAIDCapType_Process},    {kNkMAIDCapability_Name, kNkMAIDCapType_String},
    {kNkMAIDCapability_IsAlive, kNkMAIDCapType_Boolean},      {kNkMAIDCapability_Capture, kNkMAIDCapType_Process},
    {kNkMAIDCapability_BatteryLevel, kNkMAIDCapType_Integer}, {kNkMAIDCapability_Sensitivity, kNkMAIDCapType_Enum},
    {kNkMAIDCapability_Aperture, kNkMAIDCapType_Enum},        {kNkMAIDCapability_WBMode, kNkMAIDCapType_String},
    {kNkMAIDCapability_ShutterSpeed, kNkMAIDCapType_String}, /* announced, never readable */
};
static const Announced kItemCapabilities[] = {{kNkMAIDCapability_DataTypes, kNkMAIDCapType_Unsigned}};
static const Announced kDataCapabilities[] = {{kNkMAIDCapability_DataProc, kNkMAIDCapType_Process},
                                              {kNkMAIDCapability_StoredBytes, kNkMAIDCapType_Unsigned},
                                              {kNkMAIDCapability_Acquire, kNkMAIDCapType_Process}};

static const struct {
  const Announced* list;
  uint32_t count;
} kCapabilities[kLevels] = {{kModuleCapabilities, COUNT(kModuleCapabilities)},
                            {kCameraCapabilities, COUNT(kCameraCapabilities)},
                            {kItemCapabilities, COUNT(kItemCapabilities)},
                            {kDataCapabilities, COUNT(kDataCapabilities)}};

static pthread_mutex_t lock = PTHREAD_MUTEX_INITIALIZER;
static Object objects[kObjects];
static uint32_t shots;

static void* pointer(uint64_t data) { return (void*)(uintptr_t)data; }

static Object* objectOf(const tagNkMAIDObject* record) {
  if (record == NULL || record->sdkHead == 0 || record->sdkHead > kObjects) return NULL;
  Object* object = &objects[record->sdkHead - 1];
  return object->open ? object : NULL;
}

static int32_t openChild(const Object* parent, tagNkMAIDObject* record) {
  for (uint32_t i = 0; i < kObjects; ++i) {
    Object* object = &objects[i];
    if (object->open) continue;
    memset(object, 0, sizeof *object);
    object->open = 1;
    object->level = parent == NULL ? kModule : parent->level + 1;
    record->sdkHead = i + 1;
    return kNkMAIDResult_NoError;
  }
  return kNkMAIDResult_OutOfMemory;
}

static int32_t getCapabilities(const Object* object, tagNkMAIDCapInfo* infos, uint32_t count) {
  if (count != kCapabilities[object->level].count) return kNkMAIDResult_BufferSize;
  for (uint32_t i = 0; i < count; ++i) {
    infos[i].id = kCapabilities[object->level].list[i].id;
    infos[i].valueType = kCapabilities[object->level].list[i].type;
  }
  return kNkMAIDResult_NoError;
}

static int32_t setCallback(tagNkMAIDCallback* callback, uint64_t data) {
  memset(callback, 0, sizeof *callback);
  if (data != 0) memcpy(callback, pointer(data), sizeof *callback);
  return kNkMAIDResult_NoError;
}

/* The header of a list where there is no array to fill, else its elements, into as much room as the header asked for.
 */
static int32_t getList(uint64_t data, int wantsElements, uint32_t type, const void* elements, uint32_t count,
                       int16_t size, uint32_t current) {
  tagNkMAIDEnum* list = pointer(data);
  if (wantsElements) {
    if (list->elementCount != count || list->elementSize != size) return kNkMAIDResult_BufferSize;
    memcpy(list->elements, elements, (size_t)count * (size_t)size);
    return kNkMAIDResult_NoError;
  }
  list->elementType = type;
  list->elementCount = count;
  list->elementSize = size;
  list->currentIndex = current;
  return kNkMAIDResult_NoError;
}

static int32_t getValue(uint32_t capability, uint64_t data, int wantsElements) {
  static const uint32_t kChildren[] = {kCameraId};
  static const int32_t kSensitivities[] = {100, 200, 400};
  static const char kApertures[] = "f/2.8\0f/4";
  switch (capability) {
    case kNkMAIDCapability_Children:
      return getList(data, wantsElements, kNkMAIDArrayType_Unsigned, kChildren, 1, sizeof kChildren[0], 0);
    case kNkMAIDCapability_Sensitivity:
      return getList(data, wantsElements, kNkMAIDArrayType_Integer, kSensitivities, COUNT(kSensitivities),
                     sizeof kSensitivities[0], 1);
    case kNkMAIDCapability_Aperture:
      return getList(data, wantsElements, kNkMAIDArrayType_PackedString, kApertures, sizeof kApertures, 1, 1);
    case kNkMAIDCapability_Name:
      strcpy(pointer(data), "Example");
      return kNkMAIDResult_NoError;
    case kNkMAIDCapability_WBMode:
      strcpy(pointer(data), "Sunny");
      return kNkMAIDResult_NoError;
    case kNkMAIDCapability_IsAlive:
      *(uint8_t*)pointer(data) = 1;
      return kNkMAIDResult_NoError;
    case kNkMAIDCapability_BatteryLevel:
      *(int32_t*)pointer(data) = -1;
      return kNkMAIDResult_NoError;
    case kNkMAIDCapability_DataTypes:
      *(uint32_t*)pointer(data) = kNkMAIDDataObjType_Image;
      return kNkMAIDResult_NoError;
    case kNkMAIDCapability_StoredBytes:
      *(uint32_t*)pointer(data) = kPictureBytes;
      return kNkMAIDResult_NoError;
    default:
      return kNkMAIDResult_NotSupported;
  }
}

static int32_t setValue(Object* object, uint32_t capability, uint64_t data) {
  if (capability == kNkMAIDCapability_EventProc) return setCallback(&object->event, data);
  if (capability == kNkMAIDCapability_DataProc) return setCallback(&object->data, data);
  return kNkMAIDResult_NotSupported;
}

static int32_t start(Object* object, uint32_t capability, NkMAIDCompletionProc* completion, void* reference) {
  if (capability != (object->level == kCamera ? kNkMAIDCapability_Capture : kNkMAIDCapability_Acquire)) {
    return kNkMAIDResult_NotSupported;
  }
  object->started = 1;
  object->completion = completion;
  object->reference = reference;
  object->offset = 0;
  return kNkMAIDResult_Pending;
}

static void finish(const Object* object, tagNkMAIDObject* record, uint32_t capability) {
  object->completion(record, kNkMAIDCommand_CapStart, capability, kNkMAIDDataType_Null, 0, object->reference,
                     kNkMAIDResult_NoError);
}

/* Called without the lock, with a copy of the object. */
static void deliver(const Object* object, tagNkMAIDObject* record) {
  uint8_t piece[kPieceBytes];
  const uint32_t left = kPictureBytes - object->offset;
  const uint32_t length = left < kPieceBytes ? left : kPieceBytes;
  tagNkMAIDFileInfo info = {kNkMAIDDataObjType_File, kNkMAIDFileDataType_TIFF, kPictureBytes, object->offset, length};
  for (uint32_t i = 0; i < length; ++i) piece[i] = (uint8_t)((object->offset + i) * 7);
  ((NkMAIDDataProc*)object->data.procedure)(object->data.reference, &info, piece);
  if (length == left) finish(object, record, kNkMAIDCapability_Acquire);
}

static int32_t advance(Object* object, tagNkMAIDObject* record) {
  if (!object->started) return kNkMAIDResult_NoError;
  const Object copy = *object;
  object->offset += kPieceBytes;
  if (object->level == kCamera || object->offset >= kPictureBytes) object->started = 0;
  const uint32_t item = object->level == kCamera ? ++shots : 0;
  pthread_mutex_unlock(&lock);
  if (item == 0) {
    deliver(&copy, record);
  } else {
    ((NkMAIDEventProc*)copy.event.procedure)(copy.event.reference, kNkMAIDEvent_AddChild, item);
    finish(&copy, record, kNkMAIDCapability_Capture);
  }
  pthread_mutex_lock(&lock);
  return kNkMAIDResult_NoError;
}

static int32_t handle(tagNkMAIDObject* record, uint32_t command, uint32_t parameter, uint64_t data,
                      NkMAIDCompletionProc* completion, void* reference) {
  Object* object = objectOf(record);
  if (command == kNkMAIDCommand_Open) return openChild(object, pointer(data));
  if (object == NULL) return kNkMAIDResult_ZombieObject;
  switch (command) {
    case kNkMAIDCommand_Close:
      object->open = 0;
      return kNkMAIDResult_NoError;
    case kNkMAIDCommand_GetCapCount:
      *(uint32_t*)pointer(data) = kCapabilities[object->level].count;
      return kNkMAIDResult_NoError;
    case kNkMAIDCommand_GetCapInfo:
      return getCapabilities(object, pointer(data), parameter);
    case kNkMAIDCommand_CapGet:
    case kNkMAIDCommand_CapGetArray:
      return getValue(parameter, data, command == kNkMAIDCommand_CapGetArray);
    case kNkMAIDCommand_CapSet:
      return setValue(object, parameter, data);
    case kNkMAIDCommand_CapStart:
      return start(object, parameter, completion, reference);
    case kNkMAIDCommand_Async:
      return advance(object, record);
    default:
      return kNkMAIDResult_NotSupported;
  }
}

__attribute__((visibility("default"))) NkMAIDEntryPoint MAIDEntryPoint;

int32_t MAIDEntryPoint(tagNkMAIDObject* object, uint32_t command, uint32_t parameter, uint32_t dataType, uint64_t data,
                       NkMAIDCompletionProc* completion, void* reference) {
  (void)dataType;
  pthread_mutex_lock(&lock);
  const int32_t result = handle(object, command, parameter, data, completion, reference);
  pthread_mutex_unlock(&lock);
  return result;
}
