#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/objects/Object.h"

namespace tamber {

namespace DeviceAnswerKeys {
// A Number holding an integer: one of the device classes below.
inline constexpr std::string_view kDeviceClassNumber = "DeviceClassNumber";
// A Number holding a single-precision float: how many device pixels make one logical pixel.
inline constexpr std::string_view kMainScreenScale = "main-screen-scale";
}  // namespace DeviceAnswerKeys

// Device classes. Linux machines are computers unless their chassis says otherwise.
inline constexpr int64_t kDeviceClassComputer = 0;  // desktop, laptop, server, virtual machine
inline constexpr int64_t kDeviceClassHandset = 1;
inline constexpr int64_t kDeviceClassTablet = 3;

// Answers a question about the device; null for a key it does not know.
// - DeviceClassNumber: from the chassis the administrator set in /etc/machine-info
//   (CHASSIS=tablet or handset), else from the firmware's chassis type
//   (/sys/class/dmi/id/chassis_type; SMBIOS type 30 is a tablet), else a computer.
// - main-screen-scale: GDK_SCALE, else QT_SCALE_FACTOR, from the environment of the graphical
//   session; 1.0 when neither holds a usable positive number.
// An override set for the key is answered instead.
ObjectRef CopyDeviceAnswer(std::string_view key);

// Makes CopyDeviceAnswer answer `value` (null: answer nothing) for `key`, process-wide, until
// cleared. For tests and for hosts that know better.
void SetDeviceAnswerOverride(std::string key, ObjectRef value);
void ClearDeviceAnswerOverrides();

// The device class told by the contents of /etc/machine-info and of the DMI chassis type file
// (either may be empty).
int64_t DeviceClassForChassis(std::string_view machineInfo, std::string_view dmiChassisType);

// The screen scale the current environment asks for, 1.0 when it asks for none.
float ScreenScaleFromEnvironment();

}  // namespace tamber
