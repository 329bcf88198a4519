#pragma once
// Whether a host process may use a plug-in (`allowForClient:`): the host's
// own restriction entitlement, then the entitlement the plug-in demands of
// its hosts. Used by "match" and again by "ready".

#include <optional>
#include <string>

#include "discovery/MatchRules.h"
#include "registry/ClientIdentity.h"

// None when the client may use the plug-in; otherwise the reason, in words.
std::optional<std::string> allowForClient(const MatchRules& rules, const PlugInFacts& plugIn,
                                          const qm::Value& plugInDictionary, const ClientIdentity& client);
