// Measures a contestant of ours and its peer in alternate rounds, and prints both with their ratio.
#pragma once

#include <functional>

namespace bench {

/// Ends the program, with what failed, unless `holds`.
void Require(bool holds, const char* what);

/// The seconds that `work` takes.
double Seconds(const std::function<void()>& work);

/// What one side of a comparison does in a round: its figure, in the comparison's unit.
using Round = std::function<double()>;

/// Prints the heading of the lines that Compare() prints.
void PrintHeading();

/// What a comparison measures, and what is asked of it.
struct Contest {
    const char* name;
    const char* peer;
    const char* unit;
    enum { kLowIsGood, kHighIsGood } sense;
    double wanted;  ///< the bound of ours / peer; 0: nothing is asked, the line is for information
};

/// Runs both in turn, the first rounds unmeasured, and prints the medians and the best of each:
/// the machine has other work too, and turns spread that over both.
void Compare(const Contest& contest, const Round& ours, const Round& peer);

}  // namespace bench
