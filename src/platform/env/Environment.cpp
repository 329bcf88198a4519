#include "platform/env/Environment.h"

#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <string_view>

namespace qm {

namespace {

std::optional<std::string> variable(const char* name) {
    const char* value = std::getenv(name);
    if (value == nullptr || *value == '\0') {
        return std::nullopt;
    }
    return std::string(value);
}

std::vector<std::string> splitColons(const std::string& list) {
    std::vector<std::string> parts;
    std::size_t start = 0;
    while (start <= list.size()) {
        std::size_t end = list.find(':', start);
        if (end == std::string::npos) {
            end = list.size();
        }
        if (end > start) {
            parts.push_back(list.substr(start, end - start));
        }
        start = end + 1;
    }
    return parts;
}

std::string home() {
    if (auto h = variable("HOME")) {
        return *h;
    }
    return "/tmp";
}

std::optional<unsigned long> positiveNumber(const std::string& text) {
    char* end = nullptr;
    errno = 0;
    unsigned long n = std::strtoul(text.c_str(), &end, 10);
    if (errno != 0 || end == text.c_str() || *end != '\0' || n == 0 || text[0] == '-') {
        return std::nullopt;
    }
    return n;
}

}  // namespace

const ProcessEnvironment& environment() {
    static const ProcessEnvironment instance = [] {
        ProcessEnvironment e;
        auto v = variable("QM_LOG_STDERR");
        e.logToStderr = v && *v != "0";
        return e;
    }();
    return instance;
}

std::string ductRuntimeDirectory() {
    if (auto dir = variable("QM_DUCT_DIR")) {
        return *dir;
    }
    if (auto xdg = variable("XDG_RUNTIME_DIR")) {
        return *xdg + "/ovaro";
    }
    return "/tmp/ovaro-" + std::to_string(::getuid());
}

Result<std::optional<unsigned>> idleExitSeconds() {
    auto v = variable("QM_IDLE_EXIT");
    if (!v) {
        return std::optional<unsigned>();
    }
    constexpr unsigned kMostSeconds = 1'000'000'000;  // about 31 years
    bool digitsOnly = v->find_first_not_of("0123456789") == std::string::npos && v->size() <= 10;
    unsigned long long seconds = digitsOnly ? std::stoull(*v) : 0;
    if (seconds == 0 || seconds > kMostSeconds) {
        return Error{"environment", EINVAL,
                     "QM_IDLE_EXIT must be a whole number of seconds from 1 to 1000000000, not \"" + *v + "\""};
    }
    return std::optional<unsigned>(static_cast<unsigned>(seconds));
}

std::vector<int> takeSocketActivationDescriptors() {
    std::vector<int> fds;
    auto count = variable("LISTEN_FDS");
    auto pid = variable("LISTEN_PID");
    if (count && pid) {
        auto n = positiveNumber(*count);
        auto owner = positiveNumber(*pid);
        if (n && owner && *owner == static_cast<unsigned long>(::getpid()) && *n < 1024) {
            constexpr int kFirstPassedDescriptor = 3;  // SD_LISTEN_FDS_START
            for (unsigned long i = 0; i < *n; ++i) {
                fds.push_back(kFirstPassedDescriptor + static_cast<int>(i));
            }
        }
    }
    ::unsetenv("LISTEN_FDS");
    ::unsetenv("LISTEN_PID");
    ::unsetenv("LISTEN_FDNAMES");
    return fds;
}

std::optional<std::string> testSdkDirectory() {
    return variable("QMTEST_SDK");
}

std::vector<std::string> sdkSearchPath() {
    if (auto list = variable("QM_SDK_PATH")) {
        return splitColons(*list);
    }
    return {xdgDataHome() + "/ovaro/SDKs", "/usr/share/ovaro/SDKs"};
}

std::vector<std::string> systemRoots() {
    if (auto list = variable("QM_SYSTEM_ROOTS")) {
        return splitColons(*list);
    }
    return {};
}

std::string xdgDataHome() {
    if (auto v = variable("XDG_DATA_HOME")) {
        return *v;
    }
    return home() + "/.local/share";
}

std::string xdgConfigHome() {
    if (auto v = variable("XDG_CONFIG_HOME")) {
        return *v;
    }
    return home() + "/.config";
}

std::string xdgStateHome() {
    if (auto v = variable("XDG_STATE_HOME")) {
        return *v;
    }
    return home() + "/.local/state";
}

std::vector<std::string> xdgDataDirectories() {
    if (auto list = variable("XDG_DATA_DIRS")) {
        auto directories = splitColons(*list);
        if (!directories.empty()) {
            return directories;
        }
    }
    return {"/usr/local/share", "/usr/share"};
}

std::string catalogDatabasePath() {
    if (auto v = variable("QM_CATALOG_DB")) {
        return *v;
    }
    return xdgDataHome() + "/ovaro/AppCatalog.db";
}

std::string userApplicationsRoot() {
    return xdgDataHome() + "/ovaro/Applications";
}

std::string dataContainersDirectory() {
    return xdgDataHome() + "/ovaro/Containers";
}

std::string consentStorePath() {
    return xdgDataHome() + "/ovaro/Consent.plist";
}

std::optional<std::string> userLanguage() {
    for (const char* name : {"LANGUAGE", "LC_ALL", "LC_MESSAGES", "LANG"}) {
        auto v = variable(name);
        if (!v) {
            continue;
        }
        std::size_t cut = v->find_first_of("_.@:");
        std::string language = v->substr(0, cut);
        if (!language.empty()) {
            return language;
        }
    }
    return std::nullopt;
}

}  // namespace qm
