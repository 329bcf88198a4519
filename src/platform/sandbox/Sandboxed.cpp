#include "platform/sandbox/Sandboxed.h"

#include <sys/stat.h>

#include <fstream>
#include <optional>
#include <string>

#include "platform/process/ProcessInfo.h"

namespace qm {

namespace {

struct Confinement {
    std::string seccomp;
    std::string noNewPrivileges;
    ino_t userNamespace = 0;
    ino_t mountNamespace = 0;
};

std::optional<std::string> statusField(const std::string& status, const std::string& name) {
    std::ifstream file(status);
    std::string line;
    while (std::getline(file, line)) {
        if (line.starts_with(name + ":")) {
            auto start = line.find_first_not_of(" \t", name.size() + 1);
            return start == std::string::npos ? std::string() : line.substr(start);
        }
    }
    return std::nullopt;
}

std::optional<ino_t> namespaceOf(const std::string& proc, const char* name) {
    struct stat info{};
    if (::stat((proc + "/ns/" + name).c_str(), &info) != 0) {
        return std::nullopt;
    }
    return info.st_ino;
}

std::optional<Confinement> confinementOf(const std::string& proc) {
    auto seccomp = statusField(proc + "/status", "Seccomp");
    auto noNewPrivileges = statusField(proc + "/status", "NoNewPrivs");
    auto user = namespaceOf(proc, "user");
    auto mount = namespaceOf(proc, "mnt");
    if (!seccomp || !noNewPrivileges || !user || !mount) {
        return std::nullopt;
    }
    return Confinement{*seccomp, *noNewPrivileges, *user, *mount};
}

}  // namespace

bool isProcessSandboxed(pid_t pid, int pidfd) {
    static const std::optional<Confinement> daemon = confinementOf("/proc/self");
    auto peer = confinementOf("/proc/" + std::to_string(pid));
    // Read first, then check the process read is still the one accepted.
    if (!daemon || !peer || (pidfd >= 0 && !pidfdProcessAlive(pidfd))) {
        return true;
    }
    return peer->seccomp != daemon->seccomp || peer->noNewPrivileges != daemon->noNewPrivileges ||
           peer->userNamespace != daemon->userNamespace || peer->mountNamespace != daemon->mountNamespace;
}

}  // namespace qm
