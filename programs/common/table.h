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
    size_t narrowest;  ///< the width to which cells may be cut to save space; 0: never
    int rank;  ///< if that is not enough, columns are dropped from the highest rank down; 0: never
};

/// The width of standard output when it is a terminal; 0: no limit.
size_t OutputWidth();

/// The text, ending in ".." where it has more than `width` characters.
std::string CutTo(const std::string& text, size_t width);

/// Rows of text for a person (aligned columns) or for a program (JSON: an array of objects).
class Table {
public:
    /// The JSON keys are the headings in lower case, with "_" for blanks.
    explicit Table(std::vector<Column> columns);

    /// Reserves memory for this number of rows.
    void Reserve(size_t rows);
    /// Adds a row; it must have a cell for each column.
    void Add(std::vector<std::string> cells);

    /// Writes the table to standard output.
    void Print(bool as_json) const;
    /// The lines of the aligned form, headings first, without line ends, in `width` columns (0: no
    /// limit) as far as the columns can be cut or dropped.
    std::vector<std::string> Lines(size_t width = 0) const;

private:
    // Calls `take` for each line of the aligned form.
    template <typename Take>
    void Format(size_t width, Take take) const;
    void Fit(size_t width, std::vector<size_t>& widths) const;

    std::vector<Column> columns_;
    std::vector<std::vector<std::string>> rows_;
};

}  // namespace programs
