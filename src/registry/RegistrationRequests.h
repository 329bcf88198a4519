#pragma once
// The registration requests: "bulk" (and, with the catalog, "add" and "remove").

#include "registry/Request.h"

// "bulk": batch options are not supported; it logs the options it was given
// and succeeds. Cheap and blocking nothing, so it may run on the reading thread.
Reply bulkPlugIns(RequestContext& context);
