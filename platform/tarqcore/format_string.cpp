#include "platform/tarqcore/format_string.h"

#include <stdlib.h>
#include <string.h>

#include "platform/internal/error.h"

namespace tarqcore {

std::optional<std::string> FormatStrings(std::string_view format,
                                         std::initializer_list<std::string_view> arguments) {
    std::string text;
    const std::string_view* next = arguments.begin();
    for (;;) {
        const size_t percent = format.find('%');
        text += format.substr(0, percent);
        if (percent == std::string_view::npos) {
            break;
        }
        const char conversion = percent + 1 < format.size() ? format[percent + 1] : '\0';
        if (conversion == '%') {
            text += '%';
        } else if (conversion == 's' && next != arguments.end()) {
            text += *next++;
        } else {
            return std::nullopt;
        }
        format.remove_prefix(percent + 2);
    }
    if (next != arguments.end()) {
        return std::nullopt;
    }
    return text;
}

}  // namespace tarqcore

using tarq_internal::Fail;

char* KAPICStrGet(const char* format, const char* argument) {
    if (format == nullptr || argument == nullptr) {
        Fail(TARQ_ERR_BAD_PARAMETER);
        return nullptr;
    }
    return tarq_internal::Guarded<char*>(nullptr, [&]() -> char* {
        const std::optional<std::string> text = tarqcore::FormatStrings(format, {argument});
        if (!text) {
            Fail(TARQ_ERR_BAD_PARAMETER);
            return nullptr;
        }
        char* copy = strdup(text->c_str());
        if (copy == nullptr) {
            Fail(TARQ_ERR_NO_MEMORY);
        }
        return copy;
    });
}

void KAPICStrPut(char* text) {
    free(text);
}
