#include "programs/common/table.h"

#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <nlohmann/json.hpp>
#include <string_view>

#include "base/text.h"
#include "programs/common/json_text.h"
#include "programs/common/text.h"

namespace programs {

namespace {

constexpr size_t kGap = 2;  // blanks between columns
constexpr std::string_view kCut = "..";

std::string JsonKey(std::string heading) {
    for (char& c : heading) {
        c = c == ' ' ? '_' : base::Lower(c);
    }
    return heading;
}

// Columns on a terminal: continuation bytes of UTF-8 take none.
size_t Width(const std::string& text) {
    return static_cast<size_t>(std::count_if(text.begin(), text.end(), [](char c) {
        return (static_cast<unsigned char>(c) & 0xc0) != 0x80;
    }));
}

}  // namespace

size_t OutputWidth() {
    struct winsize window = {};
    constexpr size_t kUsual = 80;
    return isatty(STDOUT_FILENO) == 0                                            ? 0
           : ioctl(STDOUT_FILENO, TIOCGWINSZ, &window) == 0 && window.ws_col > 0 ? window.ws_col
                                                                                 : kUsual;
}

std::string CutTo(const std::string& text, size_t width) {
    if (Width(text) <= width) {
        return text;
    }
    const size_t kept = width > kCut.size() ? width - kCut.size() : width;
    size_t end = 0;
    for (size_t used = 0; end < text.size(); ++end) {
        const bool begins = (static_cast<unsigned char>(text[end]) & 0xc0) != 0x80;
        if (begins && used++ == kept) {
            break;
        }
    }
    return text.substr(0, end).append(width > kCut.size() ? kCut : "");
}

Table::Table(std::vector<Column> columns) : columns_(std::move(columns)) {}

void Table::Reserve(size_t rows) {
    rows_.reserve(rows);
}

void Table::Add(std::vector<std::string> cells) {
    rows_.push_back(std::move(cells));
}

// Narrows the widest of the columns that may be cut; then, if needed, drops columns (width 0).
void Table::Fit(size_t width, std::vector<size_t>& widths) const {
    std::vector<size_t> whole = widths;
    const auto total = [&] {
        size_t sum = 0;
        for (const size_t column : widths) {
            sum += column == 0 ? 0 : column + (sum == 0 ? 0 : kGap);
        }
        return sum;
    };
    for (;;) {
        size_t over = total() > width ? total() - width : 0;
        for (; over > 0; --over) {
            size_t widest = columns_.size();
            for (size_t i = 0; i < columns_.size(); ++i) {
                const bool may = columns_[i].narrowest > 0 && widths[i] > columns_[i].narrowest;
                widest =
                    may && (widest == columns_.size() || widths[i] > widths[widest]) ? i : widest;
            }
            if (widest == columns_.size()) {
                break;
            }
            --widths[widest];
        }
        size_t spare = columns_.size();
        for (size_t i = 0; i < columns_.size(); ++i) {
            const bool may = columns_[i].rank > 0 && widths[i] > 0;
            spare = may && (spare == columns_.size() || columns_[i].rank > columns_[spare].rank)
                        ? i
                        : spare;
        }
        if (over == 0 || spare == columns_.size()) {
            return;
        }
        // The remaining columns get its space, so start again from their full widths.
        whole[spare] = 0;
        widths = whole;
    }
}

template <typename Take>
void Table::Format(size_t width, Take take) const {
    std::vector<std::string> headings;
    for (const Column& column : columns_) {
        headings.push_back(column.heading);
    }
    // Cells rarely need escaping, so rows without special characters are not copied.
    std::vector<std::vector<std::string>> escaped;
    std::vector<const std::vector<std::string>*> lines = {&headings};
    lines.reserve(rows_.size() + 1);
    escaped.reserve(rows_.size());
    for (const auto& row : rows_) {
        if (std::all_of(row.begin(), row.end(), IsPrintable)) {
            lines.push_back(&row);
        } else {
            escaped.emplace_back(row);
            for (std::string& cell : escaped.back()) {
                cell = Printable(cell);
            }
            lines.push_back(&escaped.back());
        }
    }
    std::vector<size_t> widths(columns_.size(), 0);
    for (const auto* line : lines) {
        for (size_t i = 0; i < line->size(); ++i) {
            widths[i] = std::max(widths[i], Width((*line)[i]));
        }
    }
    if (width > 0) {
        Fit(width, widths);
    }
    std::string text;
    for (const auto* line : lines) {
        text.clear();
        size_t blanks = 0;  // padding before the next cell
        for (size_t i = 0; i < line->size(); ++i) {
            if (widths[i] > 0) {
                const size_t shown = Width((*line)[i]);
                text.append(blanks, ' ');
                text += shown > widths[i] ? CutTo((*line)[i], widths[i]) : (*line)[i];
                blanks = widths[i] - std::min(shown, widths[i]) + kGap;
            }
        }
        take(text);
    }
}

std::vector<std::string> Table::Lines(size_t width) const {
    std::vector<std::string> lines;
    Format(width, [&](const std::string& line) { lines.push_back(line); });
    return lines;
}

void Table::Print(bool as_json) const {
    if (as_json) {
        nlohmann::ordered_json array = nlohmann::ordered_json::array();
        for (const auto& row : rows_) {
            nlohmann::ordered_json object;
            for (size_t i = 0; i < columns_.size(); ++i) {
                object[JsonKey(columns_[i].heading)] = row[i];
            }
            array.push_back(std::move(object));
        }
        puts(JsonText(array).c_str());
        return;
    }
    std::string text;
    Format(0, [&](const std::string& line) { (text += line) += '\n'; });
    fwrite(text.data(), 1, text.size(), stdout);
}

}  // namespace programs
