#pragma once
// `make bench`: qmd's round trips beside a raw Unix-socket echo of the same
// frame sizes, measured in one run, pinned to one CPU and unpinned.

struct BenchOptions {
    double secondsPerFigure = 1.5;
};

// Prints the table; returns the process exit status.
int runBench(const BenchOptions& options);
