#include "programs/common/help.h"

#include <algorithm>
#include <cctype>
#include <iostream>
#include <memory>
#include <sstream>
#include <utility>

#include "base/text.h"
#include "programs/common/failure.h"
#include "programs/common/text.h"

namespace programs {

namespace {

constexpr size_t kWidth = 80;
constexpr size_t kColumn = 26;  // where descriptions begin

std::string Upper(std::string text) {
    std::transform(text.begin(), text.end(), text.begin(),
                   [](unsigned char c) { return static_cast<char>(toupper(c)); });
    return text;
}

// "  name     about", with `about` wrapped in a column of its own.
std::string Entry(const std::string& name, const std::string& about) {
    std::string text = "  " + name;
    size_t column = text.size();
    const auto break_line = [&] {
        text += "\n" + std::string(kColumn, ' ');
        column = kColumn;
    };
    if (column + 2 > kColumn) {
        break_line();
    } else {
        text.resize(kColumn, ' ');
        column = kColumn;
    }
    std::istringstream words(about);
    for (std::string word; words >> word;) {
        if (column != kColumn && column + 1 + word.size() > kWidth) {
            break_line();
        }
        if (column != kColumn) {
            text += ' ';
            ++column;
        }
        text += word;
        column += word.size();
    }
    return text + "\n";
}

/// Writes a command's help without the parser's internal notation.
class PlainFormatter : public CLI::Formatter {
public:
    PlainFormatter() {
        label("Positionals", "Arguments");
        label("SUBCOMMAND", "COMMAND");
    }

    std::string make_option_name(const CLI::Option* option, bool positional) const override {
        if (positional) {
            return Upper(option->get_name(true, false));
        }
        // The name of a negated option includes its value: --no-ssh{false}.
        std::string name;
        bool inside = false;
        for (const char c : option->get_name(false, true)) {
            inside = inside || c == '{';
            if (!inside) {
                name += c == ',' ? ", " : std::string(1, c);
            }
            inside = inside && c != '}';
        }
        return name;
    }

    std::string make_option_opts(const CLI::Option* option) const override {
        if (option->get_items_expected_max() == 0) {
            return "";  // a switch
        }
        const bool several = option->get_expected_max() == CLI::detail::expected_max_vector_size;
        return " " + ValueWord(option) + (several ? "..." : "");
    }

    std::string make_option_desc(const CLI::Option* option) const override {
        std::string facts;
        const auto add = [&facts](const std::string& fact) {
            facts += (facts.empty() ? "" : "; ") + fact;
        };
        if (option->nonpositional() && option->get_required()) {
            add("required");
        }
        // The bounds follow the type's name.
        const std::string type = option->get_type_name();
        const size_t colon = type.find(':');
        if (colon != std::string::npos) {
            add(type.substr(colon + 1));
        }
        if (!option->get_default_str().empty()) {
            add(option->get_default_str() + " unless given");
        }
        return option->get_description() + (facts.empty() ? "" : " (" + facts + ")");
    }

    std::string make_option(const CLI::Option* option, bool positional) const override {
        return Entry(
            make_option_name(option, positional) + (positional ? "" : make_option_opts(option)),
            make_option_desc(option));
    }

    std::string make_description(const CLI::App* app) const override {
        return app->get_description() + "\n\n";
    }

    std::string make_help(const CLI::App* app, std::string name,
                          CLI::AppFormatMode mode) const override {
        std::string text = CLI::Formatter::make_help(app, std::move(name), mode);
        for (size_t at = 0; (at = text.find("\n\n\n", at)) != std::string::npos;) {
            text.erase(at, 1);
        }
        return text.substr(0, text.find_last_not_of('\n') + 1) + "\n";
    }

    std::string make_subcommands(const CLI::App* app, CLI::AppFormatMode) const override {
        std::string text;
        for (const CLI::App* const command : app->get_subcommands({})) {
            text += Entry(command->get_name(), command->get_description());
        }
        return text.empty() ? text : "\nCommands:\n" + text;
    }

private:
    static std::string ValueWord(const CLI::Option* option) {
        if (!option->get_option_text().empty()) {
            return option->get_option_text();
        }
        const std::string name = option->get_name();
        return Upper(name.substr(name.rfind('-') + 1));
    }
};

// "zelctl task add": the commands that `app` has recognised.
std::string CommandPath(const CLI::App* app, const CLI::App*& last) {
    std::string path = app->get_name();
    for (last = app; !last->get_subcommands().empty();) {
        last = last->get_subcommands().front();
        path += " " + last->get_name();
    }
    return path;
}

bool Has(const std::string& text, const char* part) {
    return text.find(part) != std::string::npos;
}

// The error text, reworded where the parser's own mentions its types and counts.
std::string Complaint(const CLI::ParseError& error, const CLI::App& app) {
    std::string text = error.what();
    const auto kind = static_cast<CLI::ExitCodes>(error.get_exit_code());
    const std::vector<std::string> unknown = app.remaining(true);
    // An unknown word is reported first: what seems to be missing may only be misspelled.
    if (!unknown.empty() &&
        (kind == CLI::ExitCodes::RequiredError || kind == CLI::ExitCodes::ExtrasError)) {
        const std::string& word = unknown.front();
        return (word.size() > 1 && word.front() == '-' ? "there is no option '"
                                                       : "there is one word too many: '") +
               word + "'";
    }
    if (kind == CLI::ExitCodes::RequiredError) {
        const size_t end = text.find(' ');
        return text.front() == '-' ? text : Upper(text.substr(0, end)) + text.substr(end);
    }
    if (kind == CLI::ExitCodes::ArgumentMismatch) {
        const std::string option = text.substr(0, text.find(": "));
        return Has(text, " missing")      ? option + " needs a value"
               : Has(text, " At Most 1 ") ? option + " is given more than once"
                                          : text;
    }
    return text;
}

}  // namespace

std::vector<std::string> CommandWords(int argc, char** argv) {
    std::vector<std::string> words(argv + std::min(argc, 1), argv + argc);
    const auto first = std::find_if(words.begin(), words.end(), [](const std::string& word) {
        return word.empty() || word.front() != '-';
    });
    if (first != words.end() && *first == "help") {
        words.erase(first);
        words.emplace_back("--help");
    }
    return words;
}

void SpeakPlainly(CLI::App& app, bool has_commands) {
    app.formatter(std::make_shared<PlainFormatter>());
    app.set_help_flag("-h,--help", "Show this help");
    if (has_commands) {
        app.add_subcommand("help", "Show the help of a command: help COMMAND...");
    }
}

void Parse(CLI::App& app, const std::vector<std::string>& words) {
    try {
        app.parse(std::vector<std::string>(words.rbegin(), words.rend()));
    } catch (const CLI::ParseError& error) {
        if (error.get_exit_code() == 0) {
            app.exit(error);
            return;
        }
        const CLI::App* last = nullptr;
        const std::string path = CommandPath(&app, last);
        // Only options were given where a command is required.
        if (last->get_require_subcommand_min() > 0 &&
            error.get_exit_code() == static_cast<int>(CLI::ExitCodes::RequiredError)) {
            std::cerr << app.help();
            throw ReportedFailure(FailureKind::kUsage);
        }
        throw Failure(FailureKind::kUsage, Printable(Complaint(error, app)) + "\n'" + path +
                                               " --help' tells what it takes.");
    }
}

CLI::Validator Between(uint64_t min, uint64_t max) {
    const std::string bounds = std::to_string(min) + " to " + std::to_string(max);
    return CLI::Validator(
        [min, max, bounds](const std::string& text) {
            const auto number = base::ParseNumber(text, max);
            return number && *number >= min
                       ? std::string()
                       : "must be a whole number from " + bounds + ", not '" + text + "'";
        },
        bounds);
}

CLI::Validator OneOf(std::vector<std::pair<std::string, int>> words) {
    return CLI::Validator(
        [words = std::move(words)](std::string& text) {
            std::string list;
            for (const auto& [word, number] : words) {
                if (word == text) {
                    text = std::to_string(number);
                    return std::string();
                }
                const char* const between = list.empty()                 ? ""
                                            : word == words.back().first ? " or "
                                                                         : ", ";
                list += between + word;
            }
            return "must be " + list + ", not '" + text + "'";
        },
        "");
}

CLI::Validator WholeNumber() {
    return Between(0, UINT32_MAX).description("");
}

}  // namespace programs
