// A server's answer, and rsync's own output, as any server could make them.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "fuzz/require.h"
#include "platform/tarqrsync/answer_file.h"
#include "platform/tarqrsync/message_keeper.h"
#include "platform/tarqrsync/output_parser.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    using namespace TARQ::Backup;
    const std::string_view text(reinterpret_cast<const char*>(data), size);

    Answer answer;
    if (ParseAnswer(text, &answer)) {
        const std::string again = "status=\"" + std::to_string(answer.status) + "\"\n";
        Require(text.substr(0, again.size()) == again);
        Require(answer.content == text.substr(again.size()));
    }

    RunReport report;
    RunOptions options;
    options.report = &report;
    options.on_change = [](const RunChange& change) { Require(change.kind <= RunChange::OTHER); };
    options.on_progress = [](const RunProgress& progress) { Require(progress.percent <= 100); };
    for (const bool listing : {false, true}) {
        OutputParser parser(options, listing);
        parser.Feed(text.substr(0, size / 2));
        parser.Feed(text.substr(size / 2));
        parser.Finish();
        parser.FillReport(&report);
    }

    MessageKeeper keeper;
    keeper.Feed(text);
    for (const char c : keeper.Text()) {
        Require(static_cast<unsigned char>(c) >= 0x20 || c == '\n' || c == '\t');
    }
    return 0;
}
