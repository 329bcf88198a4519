#include "daemon/Routes.h"

#include "registry/RegistrationRequests.h"

namespace {

// Compared in this order.
constexpr Route kRoutes[] = {
    {"add", nullptr, false},
    {"remove", nullptr, false},
    {"bulk", &bulkPlugIns, true},
    {"match", nullptr, false},
    {"ready", nullptr, false},
    {"access", nullptr, false},
    {"annotate", nullptr, false},
    {"lock", nullptr, false},
};

}  // namespace

const Route* routeFor(std::string_view name) {
    for (const Route& route : kRoutes) {
        if (route.name == name) {
            return route.handler ? &route : nullptr;
        }
    }
    return nullptr;
}
