#pragma once
// The registration requests: "add" and "remove" register and unregister
// plug-in bundles with the catalog; "bulk" is a placeholder for batch
// options that are not supported. "add" and "remove" wait for the catalog's
// commit; "bulk" blocks nothing and may run on the reading thread.

#include "registry/Request.h"

Reply addPlugIns(RequestContext& context);
Reply removePlugIns(RequestContext& context);
Reply bulkPlugIns(RequestContext& context);
