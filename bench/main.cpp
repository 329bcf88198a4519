// qmd_bench: see Bench.h.

#include <cstdio>
#include <cstdlib>
#include <string>

#include "Bench.h"

int main(int argc, char** argv) {
    BenchOptions options;
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        if (arg == "--seconds" && i + 1 < argc) {
            options.secondsPerFigure = std::atof(argv[++i]);
        } else {
            std::fputs("usage: qmd_bench [--seconds S]   (S: measuring time per figure, default 1.5)\n",
                       arg == "--help" ? stdout : stderr);
            return arg == "--help" ? 0 : 2;
        }
    }
    if (options.secondsPerFigure <= 0) {
        std::fputs("qmd_bench: --seconds must be positive\n", stderr);
        return 2;
    }
    return runBench(options);
}
