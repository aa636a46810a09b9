#include "programs/common/wire_text.h"

#include "programs/common/text.h"

namespace programs {

using ZEL::PObject;

std::string KeyOfTooLong(const PObject& value, const std::string& key) {
    if (value.isString() && value.asString().size() > kMaxWireText) {
        return key;
    }
    for (const PObject& element : value.asArray()) {
        std::string found = KeyOfTooLong(element, key);
        if (!found.empty()) {
            return found;
        }
    }
    for (const auto& [name, element] : value.asMap()) {
        std::string found = KeyOfTooLong(element, name);
        if (!found.empty()) {
            return found;
        }
    }
    return "";
}

void CutTooLong(PObject& value) {
    if (value.isString()) {
        if (value.asString().size() > kMaxWireText) {
            value = Shortened(value.asString(), kMaxWireText);
        }
    } else if (value.isArray()) {
        for (PObject& element : value.asArray()) {
            CutTooLong(element);
        }
    } else if (value.isMap()) {
        for (auto& [name, element] : value.asMap()) {
            CutTooLong(element);
        }
    }
}

}  // namespace programs
