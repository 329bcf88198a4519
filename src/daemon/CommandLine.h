#pragma once
// The daemon's command line: qmd [-S servicename] [-d database-path] [-v ...],
// parsed POSIX getopt style with the option string "d:S:v".

#include <cstdint>
#include <optional>
#include <string>

struct QMDOptions {
    std::string serviceName = "ovaro.quamber.qmd";
    std::optional<std::string> databasePath;
    std::uint32_t verbosity = 0;
};

// The options, or nothing after printing the usage line on standard error
// (the caller then exits with status 2). getopt's own diagnostic stays on.
std::optional<QMDOptions> parseCommandLine(int argc, char** argv);

inline constexpr int kUsageExitStatus = 2;

// `qmd --help` and `qmd --version`, as the only argument: prints and yields
// exit status 0. Nothing for any other command line.
std::optional<int> handleInformationalOption(int argc, char** argv);
