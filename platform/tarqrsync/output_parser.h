#pragma once

#include <chrono>
#include <string>
#include <string_view>

#include "tarq/rsync_wrapper.h"

namespace TARQ {
namespace Backup {

/// Reads what rsync writes to its standard output: a line for each entry that it has checked,
/// progress, listed files and closing figures. Hands them on as they come, and keeps the text of
/// lines that are none of these.
class OutputParser {
public:
    /// `options` must outlive the parser. `listing`: the run lists files, each of which is handed
    /// on as a change.
    OutputParser(const RunOptions& options, bool listing);

    /// Takes the next piece of output, of any size.
    void Feed(std::string_view bytes);
    /// Hands on the progress of now, with its time without movement, when it is time to.
    void Tick(unsigned int seconds_still);
    /// Whether rsync has said that the copy goes on: the far end has let it in.
    bool Begun() const { return begun_; }
    /// The output has ended: a last line without a newline counts, progress that was held back is
    /// handed on.
    void Finish();

    /// The closing figures, as far as they were seen; status and explanation are left alone.
    void FillReport(RunReport* report) const;
    /// The start of all other lines, at most a few KiB.
    const std::string& OtherText() const { return other_text_; }

private:
    void TakeLine(std::string_view line);
    bool TakeFound(std::string_view line);
    bool TakeProgress(std::string_view line);
    bool TakeEntry(std::string_view line);
    bool TakeListed(std::string_view line);
    bool TakeFigure(std::string_view line);

    void NoteEntry(std::string_view itemized, const RunChange& entry);
    void EndFile();
    void TellProgress();

    const RunOptions& options_;
    const bool listing_;
    std::string line_;           // the start of a line whose end has not come
    bool line_dropped_ = false;  // that line is too long to mean anything

    bool begun_ = false;
    RunProgress progress_;
    unsigned int percent_of_bytes_ = 0;  // as rsync gives it
    uint64_t bytes_before_file_ = 0;
    bool new_copy_ = false;  // nothing that was checked so far had been at the destination
    bool held_back_ = false;
    std::chrono::steady_clock::time_point next_progress_;

    RunReport figures_;
    uint64_t deletions_told_ = 0;  // the closing figure may leave out the last ones
    std::string other_text_;
};

/// A name as rsync writes it, with its \#ooo escapes turned back into the bytes that they stand
/// for.
std::string UnescapeName(std::string_view name);

}  // namespace Backup
}  // namespace TARQ
