#pragma once
// UUIDs given to qmkit as arguments (plug-in UUIDs, hold tokens).

#include <string>
#include <vector>

#include "platform/error/Error.h"
#include "platform/value/Uuid.h"

// One or more UUIDs in canonical text, in order; otherwise a message for a
// usage error that names what was expected (`what`, e.g. "UUID").
qm::Result<std::vector<qm::Uuid>, std::string> parseUuidArguments(const std::vector<std::string>& args,
                                                                   const std::string& what);
