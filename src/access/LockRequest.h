#pragma once
// "lock": takes a hold on plug-ins named by paths (flags 1: every plug-in of
// each application, refused with "conflicts" when one runs busy; flags 2:
// the plug-in bundles themselves), answering the hold's token under "uuids";
// or, given "uuids", releases the holds those tokens name, whoever took
// them. A hold lives until released or until its client's connection ends.

#include "registry/Request.h"

Reply lockDownPlugIns(RequestContext& context);
