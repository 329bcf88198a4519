#pragma once
// The facts the rules read of a registry record; the election is read from
// the registry only when a rule asks for it.

#include "discovery/MatchRules.h"
#include "registry/QMDatabase.h"

// The record and the registry must outlive the facts.
PlugInFacts factsOf(const QMDPlugIn& plugIn, QMDatabase& registry);
