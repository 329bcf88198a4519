#include "platform/sandbox/ExtensionConsumption.h"

#include <sys/stat.h>

#include <mutex>
#include <set>

#include "platform/sandbox/ReadExtensions.h"

namespace qm {

namespace {

struct Consumptions {
    std::mutex mutex;
    std::int64_t lastHandle = 0;
    std::set<std::int64_t> live;
};

Consumptions& consumptions() {
    static Consumptions instance;
    return instance;
}

}  // namespace

std::int64_t consumeExtension(const std::string& token) {
    auto grant = verifyExtension(token);
    struct stat status {};
    if (!grant || ::stat(grant->path.c_str(), &status) != 0) {
        return -1;
    }
    Consumptions& all = consumptions();
    std::lock_guard lock(all.mutex);
    std::int64_t handle = ++all.lastHandle;
    all.live.insert(handle);
    return handle;
}

bool releaseExtension(std::int64_t handle) {
    Consumptions& all = consumptions();
    std::lock_guard lock(all.mutex);
    return all.live.erase(handle) == 1;
}

}  // namespace qm
