// Limits of messages between the programs: the length of a text has 16 bits, and a longer text
// would corrupt the framing of everything after it.
#pragma once

#include <string>

#include "ZEL/pobject.h"

namespace programs {

constexpr size_t kMaxWireText = 65535;  ///< bytes

/// The key of a text in `value` that is too long for a message; empty when there is none.
std::string KeyOfTooLong(const ZEL::PObject& value, const std::string& key);

/// Cuts and marks each text of `value` that is too long for a message. Keys are short constants and
/// are not checked.
void CutTooLong(ZEL::PObject& value);

}  // namespace programs
