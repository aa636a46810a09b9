#include "programs/zelctl/base/setting_option.h"

#include "base/text.h"

namespace zelctl {

using programs::FieldKind;
using programs::TaskField;

void AddSetting(CLI::App& command, const TaskField& field, ZEL::PObject& said, bool is_new) {
    const std::string names = field.option;
    ZEL::PObject* const settings = &said;
    if (field.kind == FieldKind::kSwitch) {
        command.add_flag_function(
            names + ",!--no-" + names.substr(2),
            [=](int64_t count) { (*settings)[field.key] = count > 0; }, field.about);
        return;
    }
    CLI::Option* option = nullptr;
    if (field.kind == FieldKind::kTexts) {
        const auto take = [=](const std::vector<std::string>& texts) {
            (*settings)[field.key].asArray().assign(texts.begin(), texts.end());
        };
        option = command.add_option_function<std::vector<std::string>>(names, take, field.about);
    } else {
        const auto take = [=](const std::string& word) {
            if (field.take != nullptr) {
                field.take(field, word, *settings);
            } else if (field.kind == FieldKind::kNumber) {
                (*settings)[field.key] = *base::ParseNumber(word, field.max);
            } else {
                (*settings)[field.key] = word;
            }
        };
        option = command.add_option_function<std::string>(names, take, field.about);
    }
    if (field.take != nullptr) {
        option->check(CLI::Validator(
            [=](const std::string& word) {
                ZEL::PObject ignored;
                return field.take(field, word, ignored);
            },
            ""));
    } else if (field.kind == FieldKind::kNumber) {
        const CLI::Validator bounds = programs::Between(field.min, field.max);
        const bool any = field.min == 0 && field.max == programs::kAnyNumber;
        option->check(any ? CLI::Validator(bounds).description("") : bounds);
    }
    const bool required = field.required || field.must_be_said;
    option->option_text(field.value)
        ->default_str(is_new ? field.unless_given : "")
        ->required(is_new && required);
    if (!is_new && !required && field.kind == FieldKind::kTexts) {
        command
            .add_flag_callback(
                "--no-" + names.substr(2), [=] { (*settings)[field.key].asArray().clear(); },
                "No " + names + " any more")
            ->excludes(option);
    }
}

}  // namespace zelctl
