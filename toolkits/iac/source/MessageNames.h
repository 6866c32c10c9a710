// The names of all messages and of the keys in their payloads. docs/host-protocol.md says what each carries.
#pragma once

// From the host. The answer, where there is one, has the request's id.
inline constexpr const char* kMessageListDevices = "listDevices";
inline constexpr const char* kMessageGetDeviceInfo = "getDeviceInfo";
inline constexpr const char* kMessageConnectDevice = "connectDevice";
inline constexpr const char* kMessageDisconnectDevice = "disconnectDevice";
inline constexpr const char* kMessageDoCapture = "doCapture";
inline constexpr const char* kMessageDownloadThumbnail = "downloadThumbnail";
inline constexpr const char* kMessageGetCaptureInfo = "getCaptureInfo";
inline constexpr const char* kMessageStartDownload = "startDownload";
inline constexpr const char* kMessageGetCameraSettings = "getCameraSettings";
inline constexpr const char* kMessageShutdown = "shutdown";

// To the host: the two answers,
inline constexpr const char* kMessageOk = "ok";
inline constexpr const char* kMessageError = "error";
// and what it is told of its own accord, with id 0.
inline constexpr const char* kMessageHeartbeat = "heartbeat";
inline constexpr const char* kMessageDeviceAdded = "deviceAdded";
inline constexpr const char* kMessageDeviceRemoved = "deviceRemoved";
inline constexpr const char* kMessageCameraSettingsChanged = "cameraSettingsChanged";
inline constexpr const char* kMessageObjectWasAdded = "objectWasAdded";
inline constexpr const char* kMessageFileDownloadComplete = "fileDownloadComplete";

// Keys.
inline constexpr const char* kKeyDeviceId = "device_id";
inline constexpr const char* kKeyName = "name";
inline constexpr const char* kKeyCaptureId = "capture_id";
inline constexpr const char* kKeyHasSidecar = "has_sidecar";
inline constexpr const char* kKeyFileName = "file_name";
inline constexpr const char* kKeyFileSize = "file_size";
inline constexpr const char* kKeyFilePath = "file_path";
inline constexpr const char* kKeyErrorCode = "error_code";
inline constexpr const char* kKeyErrorDescription = "error_description";

// The settings of a camera.
inline constexpr const char* kKeyIsoSpeed = "isoSpeed";
inline constexpr const char* kKeyBatteryLevel = "batteryLevel";
inline constexpr const char* kKeyAvailableShots = "availableShots";
inline constexpr const char* kKeyAeMode = "aeMode";
inline constexpr const char* kKeyAperture = "aperture";
inline constexpr const char* kKeyShutter = "shutter";
inline constexpr const char* kKeyWhiteBalance = "whiteBalance";
