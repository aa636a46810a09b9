#pragma once

#include <string>
#include <vector>

namespace programs {

/// Rows of text for a person (aligned columns) or for a program (JSON: an array of objects).
class Table {
public:
    /// `columns`: the headings; lower-cased, with "_" for blanks, they are the JSON keys.
    explicit Table(std::vector<std::string> columns);

    /// Makes room for so many rows.
    void Reserve(size_t rows);
    /// As many cells as there are columns.
    void Add(std::vector<std::string> cells);

    /// Writes all to standard output.
    void Print(bool as_json) const;
    /// What a person sees, headings first, without line ends.
    std::vector<std::string> Lines() const;

private:
    // Hands the lines a person sees to `take`, one after the other.
    template <typename Take>
    void Format(Take take) const;

    std::vector<std::string> columns_;
    std::vector<std::vector<std::string>> rows_;
};

}  // namespace programs
