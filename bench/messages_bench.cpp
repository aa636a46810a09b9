// The message layers beside named peers, in one run: build/bench/bin/messages_bench
//
// With arguments only the parts that they name: map, calls, blocks, log.
#include <cstdio>
#include <cstring>

#include "bench/messages/contests.h"

int main(int argc, char** argv) {
    const struct {
        const char* name;
        void (*run)();
    } parts[] = {{"map", bench::CompareTaskMap},
                 {"calls", bench::CompareCalls},
                 {"blocks", bench::CompareBlocks},
                 {"log", bench::CompareLogLines}};
    bench::PrintHeading();
    for (const auto& part : parts) {
        bool chosen = argc == 1;
        for (int i = 1; i < argc; ++i) {
            chosen = chosen || strcmp(argv[i], part.name) == 0;
        }
        if (chosen) {
            part.run();
        }
    }
}
