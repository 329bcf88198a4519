#pragma once
// How qmkit prints values: JSON for scripts (--json), an indented
// "key: value" rendering for people.

#include <string>

#include "platform/value/Value.h"

// Pretty JSON, with a trailing newline.
std::string replyAsJson(const qm::Value& value);

// One "key: value" line per dictionary entry and one "- item" line per array
// element, nested containers indented by two spaces; strings unquoted, UUIDs
// and dates as text, data as its size, a packed property list as its content.
// An empty dictionary prints as "{}". Ends with a newline.
std::string replyAsText(const qm::Value& value);
