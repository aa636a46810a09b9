// Where a device's serial number comes from, as functions of the folders and texts that tests can
// bring.
#pragma once

#include <string>

namespace tarq_sdk {

/// Whether `text` is a serial number that may travel: not empty, printable ASCII, no quotes,
/// backquotes or backslashes, no blank at either end.
bool IsCleanSerial(const std::string& text);

/// Whether firmware makers leave `text` where nobody entered a number: their known texts, or one
/// character repeated.
bool IsPlaceholder(const std::string& text);

/// `serial` itself when it has at most TARQ_SERIAL_NUMBER_MAX bytes, else the form with its hash.
std::string CompactSerial(const std::string& serial);

/// The serial number that the hardware under `sys` (normally "/sys") reports. True, with an empty
/// text when there is none; false, with errno set, when a source is there but cannot be read.
bool HardwareSerial(const std::string& sys, std::string* serial);

}  // namespace tarq_sdk
