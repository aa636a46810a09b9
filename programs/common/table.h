#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace programs {

/// A column of a table.
struct Column {
    Column(const char* its_heading, size_t may_shrink_to = 0, int leave_out_rank = 0)
        : heading(its_heading), narrowest(may_shrink_to), rank(leave_out_rank) {}

    std::string heading;
    size_t narrowest;  ///< where there is no room its cells are cut to this; 0: never
    int rank;          ///< where that is not enough, the highest is left out first; 0: never
};

/// How many columns the standard output has when it is a terminal; 0: no limit.
size_t OutputWidth();

/// The text, ending in ".." where it has more than `width` characters.
std::string CutTo(const std::string& text, size_t width);

/// Rows of text for a person (aligned columns) or for a program (JSON: an array of objects).
class Table {
public:
    /// Their headings, lower-cased, with "_" for blanks, are the JSON keys.
    explicit Table(std::vector<Column> columns);

    /// Makes room for so many rows.
    void Reserve(size_t rows);
    /// As many cells as there are columns.
    void Add(std::vector<std::string> cells);

    /// Writes all to standard output.
    void Print(bool as_json) const;
    /// What a person sees, headings first, without line ends, in `width` columns as far as the
    /// columns allow (0: no limit).
    std::vector<std::string> Lines(size_t width = 0) const;

private:
    // Hands the lines a person sees to `take`, one after the other.
    template <typename Take>
    void Format(size_t width, Take take) const;
    void Fit(size_t width, std::vector<size_t>& widths) const;

    std::vector<Column> columns_;
    std::vector<std::vector<std::string>> rows_;
};

}  // namespace programs
