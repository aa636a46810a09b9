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

void PrintRow(const std::vector<std::string>& cells, const std::vector<size_t>& widths) {
    std::string line;
    for (size_t i = 0; i < cells.size(); ++i) {
        line += cells[i];
        if (i + 1 < cells.size()) {
            line.append(widths[i] - Width(cells[i]) + 2, ' ');
        }
    }
    puts(line.c_str());
}

}  // namespace

Table::Table(std::vector<std::string> columns) : columns_(std::move(columns)) {}

void Table::Add(std::vector<std::string> cells) {
    rows_.push_back(std::move(cells));
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
    std::vector<std::vector<std::string>> lines = {columns_};
    for (const auto& row : rows_) {
        lines.emplace_back();
        for (const std::string& cell : row) {
            lines.back().push_back(Printable(cell));
        }
    }
    std::vector<size_t> widths(columns_.size(), 0);
    for (const auto& line : lines) {
        for (size_t i = 0; i < line.size(); ++i) {
            widths[i] = std::max(widths[i], Width(line[i]));
        }
    }
    for (const auto& line : lines) {
        PrintRow(line, widths);
    }
}

}  // namespace programs
