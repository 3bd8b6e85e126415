// Small timing helpers shared by the benchmarks: run a piece of work repeatedly, take the median,
// and print rows of "ours vs peer" side by side. With TAVRIX_BENCH_SUMMARY naming a file, every
// row is also appended to it as one JSON object a line (bench/run.sh gathers them).
#pragma once

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
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

// The title of the rows being printed, for the summary.
inline std::string& currentTitle() {
    static std::string title;
    return title;
}

inline std::string jsonText(const std::string& text) {
    std::string quoted = "\"";
    for (char c : text) {
        if (c == '"' || c == '\\') {
            quoted += '\\';
        }
        quoted += c;
    }
    return quoted + "\"";
}

inline void appendToSummary(const std::string& what, double ours, double peer, const char* unit,
                            const char* goal) {
    const char* path = std::getenv("TAVRIX_BENCH_SUMMARY");
    if (path == nullptr || *path == '\0') {
        return;
    }
    if (std::FILE* file = std::fopen(path, "a")) {
        std::fprintf(file,
                     "{\"group\": %s, \"measure\": %s, \"ours\": %.6g, \"peer\": %.6g, "
                     "\"unit\": %s, \"ratio\": %.4g, \"goal\": %s}\n",
                     jsonText(currentTitle()).c_str(), jsonText(what).c_str(), ours, peer,
                     jsonText(unit).c_str(), peer > 0 ? ours / peer : 0.0, jsonText(goal).c_str());
        std::fclose(file);
    }
}

inline void printHeader(const char* title) {
    currentTitle() = title;
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
    std::fflush(stdout);
    appendToSummary(what, ours, peer, unit, goal);
}

}  // namespace tavrix::bench
