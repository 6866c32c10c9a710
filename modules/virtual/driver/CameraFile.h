// camera.json: what a camera's folder says about the camera. All of it is optional; an unknown key is an error, as
// is a file above 1 MiB.
//
// {
//   "name": "Studio",                     instead of the folder's; read when the camera is plugged in
//   "pairs": true,                        own pictures are RAW and JPEG; a picture in the folder waits for its partner
//   "alive": true,                        what IsAlive reads as
//   "transfer": {"deliveryBytes": 1048576, "deliveriesPerPoll": 1, "pollsPerDelivery": 1, "bytesPerSecond": 0,
//                "inModulePolls": false},
//   "capture": {"polls": 1, "completeEvent": true, "answer": "Pending"},
//   "fileTypes": {".xyz": 99},            further extensions taken as pictures, and their file data types
//   "settings": {                         by capability, a name or a number such as "0x8113"
//     "BatteryLevel": 50,                 a new value for a setting that is there
//     "Aperture": "f/8",                  of an enumeration, the entry to select
//     "FreeBytes": null,                  not announced
//     "WBMode": {"type": "strings", "values": ["Auto", "Shade"], "current": 1},
//     "0x9001": {"type": "integer", "value": -3},
//     "0x9002": {"type": 4}               announced with this value type, never readable
//   },                                    types: boolean, integer, unsigned, string; enumerations: integers, unsigneds,
//                                         packedStrings, strings
//   "faults": [
//     {"object": "data",                  module, camera, item, data; left out: any object of this camera
//      "item": 2, "command": "CapStart", "capability": "Acquire", "skip": 1, "times": 1,      which calls
//      "answer": "HardwareError", "doAnyway": false, "delayMs": 0,                            any call
//      "children": [1, 256], "unterminated": true, "anyArraySize": true,                      values
//      "enum": {"elementType": 7, "elementCount": 9, "currentIndex": 3, "elementSize": 2},    header as shown
//      "completion": {"result": "DataTransFailure", "none": true, "polls": 10, "afterClose": true, "twice": true},
//      "ownThread": true, "stopAfter": 3,                                                     started actions
//      "delivery": {"first": 0, "count": 1, "drop": true, "twice": true, "cutTo": 100,
//                   "record": {"dataType": 16, "fileDataType": 3, "totalLength": 5, "ulStart": 0, "ulLength": 7}}}
//   ]
// }
//
// Commands, capabilities and results are the header's names without their prefix, or numbers; "parameter" may stand for
// "capability" where it is a child's id (of an Open). What a fault's parts do is said in Faults.h.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "VirtualCamera.h"

namespace virtualcamera {

struct CameraFile {
  std::optional<std::string> name;
  bool pairs = false;
  bool alive = true;
  TransferOptions transfer;
  CaptureOptions capture;
  std::map<std::string, uint32_t> fileTypes;  // extension in small letters, with its dot
  std::vector<Capability> settings = defaultSettings();
  std::vector<uint32_t> withoutCapabilities;
  std::vector<Fault> faults;
};

// Throws std::exception with a message for people. The camera's id is what faults that name an object below the module
// are limited to.
CameraFile parseCameraFile(const std::string& text, uint32_t camera);

}  // namespace virtualcamera
