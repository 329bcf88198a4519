#pragma once
// "holds" (an extension request, for clients that are not sandboxed): every
// hold with its token, its holder's pid and executable, when it was taken
// and the plug-ins it holds.

#include "registry/Request.h"

Reply listHolds(RequestContext& context);
