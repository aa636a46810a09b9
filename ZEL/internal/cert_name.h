#pragma once

#include <string>

namespace ZEL {

/// Whether a certificate's name covers a host name, ASCII letters compared without regard to case.
///
/// A name that begins with '*' covers one leading label: *.x.y covers a.x.y, not a.b.x.y. It covers
/// the bare parent x.y as well. Its second character, normally '.', is not looked at. A '*'
/// elsewhere is a plain character.
bool CertNameCovers(const std::string& name, const std::string& host);

}  // namespace ZEL
