#pragma once
// Extension activation rules: does a plug-in accept what a host offers?
//
// The plug-in's rule is a dictionary from type to the most items of that
// type it takes; the host's description a dictionary from type to the number
// of items it offers. The rule matches when the description offers at least
// one item (some count is positive) and every type offered with a positive
// count conforms to some key of the rule whose count is at least that count.
// Types offered with count 0 or less are not offered and need no key.
//
// Anything else does not match: a rule or description that is not a
// dictionary, or any count in either that is not an integer (a real, even a
// whole one, a Boolean, a string). A negative maximum in the rule admits nothing.
// Rule keys are tried in sorted order. Pure function; any thread.

#include "platform/types/UniformTypes.h"
#include "platform/value/Value.h"

namespace qm {

bool activationRuleMatches(const Value& rule, const Value& description, const UniformTypes& types);

}  // namespace qm
