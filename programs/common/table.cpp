#include "programs/common/table.h"

#include <algorithm>
#include <cstdio>
#include <nlohmann/json.hpp>

#include "programs/common/text.h"

namespace programs {

namespace {

std::string JsonKey(std::string heading) {
    for (char& c : heading) {
        c = c == ' ' ? '_' : static_cast<char>(c >= 'A' && c <= 'Z' ? c - 'A' + 'a' : c);
    }
    return heading;
}

// Columns that a terminal shows: bytes that continue a UTF-8 character take none.
size_t Width(const std::string& text) {
    return static_cast<size_t>(std::count_if(text.begin(), text.end(), [](char c) {
        return (static_cast<unsigned char>(c) & 0xc0) != 0x80;
    }));
}

}  // namespace

Table::Table(std::vector<std::string> columns) : columns_(std::move(columns)) {}

void Table::Reserve(size_t rows) {
    rows_.reserve(rows);
}

void Table::Add(std::vector<std::string> cells) {
    rows_.push_back(std::move(cells));
}

template <typename Take>
void Table::Format(Take take) const {
    // Hardly any cell needs escapes: the others are taken as they stand.
    std::vector<std::vector<std::string>> escaped;
    std::vector<const std::vector<std::string>*> lines = {&columns_};
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
    std::string text;
    for (const auto* line : lines) {
        text.clear();
        for (size_t i = 0; i < line->size(); ++i) {
            text += (*line)[i];
            if (i + 1 < line->size()) {
                text.append(widths[i] - Width((*line)[i]) + 2, ' ');
            }
        }
        take(text);
    }
}

std::vector<std::string> Table::Lines() const {
    std::vector<std::string> lines;
    Format([&](const std::string& line) { lines.push_back(line); });
    return lines;
}

void Table::Print(bool as_json) const {
    if (as_json) {
        nlohmann::ordered_json array = nlohmann::ordered_json::array();
        for (const auto& row : rows_) {
            nlohmann::ordered_json object;
            for (size_t i = 0; i < columns_.size(); ++i) {
                object[JsonKey(columns_[i])] = row[i];
            }
            array.push_back(std::move(object));
        }
        // Bytes that are not UTF-8 are replaced rather than refused.
        puts(array.dump(2, ' ', false, nlohmann::ordered_json::error_handler_t::replace).c_str());
        return;
    }
    std::string text;
    Format([&](const std::string& line) { (text += line) += '\n'; });
    fwrite(text.data(), 1, text.size(), stdout);
}

}  // namespace programs
