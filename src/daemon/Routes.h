#pragma once
// The route table: which handler serves each request name, and whether the
// handler may run on the thread that read the request (the event loop's,
// when mainQueue is idle). Only handlers that block nothing may: no file
// writes, no database, no /proc scans, no waiting on another queue.

#include <string_view>

#include "registry/Request.h"

struct Route {
    std::string_view name;
    RequestHandler handler;  // null: the request is not served yet, answered like an unknown one
    bool runsInline;
};

// The route of a request name, compared byte for byte; null for an unknown name.
const Route* routeFor(std::string_view name);
