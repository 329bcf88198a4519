#include "daemon/Routes.h"

#include "access/AccessRequests.h"
#include "access/LockRequest.h"
#include "discovery/MatchRequest.h"
#include "registry/AnnotateRequest.h"
#include "registry/HoldsRequest.h"
#include "registry/ListRequest.h"
#include "registry/RegistrationRequests.h"

namespace {

// Compared in this order.
constexpr Route kRoutes[] = {
    {"add", &addPlugIns, false},
    {"remove", &removePlugIns, false},
    {"bulk", &bulkPlugIns, true},
    {"match", &matchPlugIns, false},
    {"ready", &readyPlugIns, false},
    {"access", &accessPlugIns, false},
    {"annotate", &annotatePlugIns, false},
    {"lock", &lockDownPlugIns, false},
    // Beyond the design: answered only to clients that are not sandboxed.
    {"holds", &listHolds, false},
    {"list", &listPlugIns, false},
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
