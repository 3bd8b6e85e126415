// Small timing helpers shared by the benchmarks: run a piece of work repeatedly, take the median,
// and print rows of "ours vs peer" side by side.
#pragma once

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <string>
#include <vector>

namespace tavrix::bench {

// Median wall time of one call of work, in microseconds, over the given number of runs.
template <typename Work>
double medianMicros(int runs, Work&& work) {
    std::vector<double> samples;
    samples.reserve(static_cast<std::size_t>(runs));
    for (int i = 0; i < runs; ++i) {
        auto start = std::chrono::steady_clock::now();
        work();
        auto end = std::chrono::steady_clock::now();
        samples.push_back(std::chrono::duration<double, std::micro>(end - start).count());
    }
    std::sort(samples.begin(), samples.end());
    return samples[samples.size() / 2];
}

inline void printHeader(const char* title) {
    std::printf("\n%s\n", title);
    std::printf("  %-44s %14s %14s %8s %8s\n", "measure", "ours", "peer", "ratio", "goal");
}

// One comparison row; the ratio is ours / peer.
inline void printRow(const std::string& what, double ours, double peer, const char* unit,
                     const char* goal) {
    std::string oursText = std::to_string(ours).substr(0, 9) + " " + unit;
    std::string peerText = std::to_string(peer).substr(0, 9) + " " + unit;
    std::printf("  %-44s %14s %14s %7.2fx %8s\n", what.c_str(), oursText.c_str(), peerText.c_str(),
                peer > 0 ? ours / peer : 0.0, goal);
}

}  // namespace tavrix::bench
