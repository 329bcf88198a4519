#pragma once
// "annotate": merges an annotation ("election", "extension") into the
// stored annotation of each plug-in named by "uuids".

#include "registry/Request.h"

Reply annotatePlugIns(RequestContext& context);
