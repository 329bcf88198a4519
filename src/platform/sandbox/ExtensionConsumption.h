#pragma once
// Consuming sandbox extension tokens: a genuine token (ReadExtensions.h)
// whose path still exists gives a handle, which stays live until it is
// released. Handles count up from 1 in each process and are never reused.
// Thread-safe.

#include <cstdint>
#include <string>

namespace qm {

// The handle of a new consumption, or -1 when the token is not genuine (or
// there is no key) or its path no longer exists.
std::int64_t consumeExtension(const std::string& token);

// Ends a consumption; true when the handle was live, false for any other
// value (one released already, -1, 0).
bool releaseExtension(std::int64_t handle);

}  // namespace qm
