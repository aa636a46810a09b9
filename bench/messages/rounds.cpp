#include "bench/messages/rounds.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

namespace bench {

namespace {

constexpr int kRounds = 11;

struct Figures {
    double median;
    double best;
};

Figures Sum(std::vector<double> rounds, bool low_is_good) {
    std::sort(rounds.begin(), rounds.end());
    return {rounds[rounds.size() / 2], low_is_good ? rounds.front() : rounds.back()};
}

void Print(const char* what, const Contest& contest, double ours, double peer) {
    const double ratio = ours / peer;
    const bool low_is_good = contest.sense == Contest::kLowIsGood;
    std::string verdict;
    if (contest.wanted > 0) {
        char text[64];
        snprintf(
            text, sizeof text, "%s %.2f  %s", low_is_good ? "<=" : ">=", contest.wanted,
            (low_is_good ? ratio <= contest.wanted : ratio >= contest.wanted) ? "ok" : "MISSED");
        verdict = text;
    }
    printf("%-32s %-31s %-6s %10.2f %10.2f %-6s %6.2f  %s\n", contest.name, contest.peer, what,
           ours, peer, contest.unit, ratio, verdict.c_str());
}

}  // namespace

void Require(bool holds, const char* what) {
    if (!holds) {
        fprintf(stderr, "%s failed\n", what);
        exit(1);
    }
}

double Seconds(const std::function<void()>& work) {
    const auto start = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

void PrintHeading() {
    printf("%-32s %-31s %-6s %10s %10s %-6s %6s  %s\n", "name", "peer", "of 11", "ours", "peer",
           "unit", "ratio", "wanted");
}

void Compare(const Contest& contest, const Round& ours, const Round& peer) {
    ours();
    peer();
    std::vector<double> our_rounds;
    std::vector<double> peer_rounds;
    for (int i = 0; i < kRounds; ++i) {
        our_rounds.push_back(ours());
        peer_rounds.push_back(peer());
    }
    const bool low_is_good = contest.sense == Contest::kLowIsGood;
    const Figures our_sum = Sum(our_rounds, low_is_good);
    const Figures peer_sum = Sum(peer_rounds, low_is_good);
    Print("median", contest, our_sum.median, peer_sum.median);
    Print("best", contest, our_sum.best, peer_sum.best);
    fflush(stdout);
}

}  // namespace bench
