#pragma once
// Issuing and verifying sandbox extension tokens (the format is in
// ExtensionToken.h), signed with the key D/token.key of the runtime
// directory D (Environment's ductRuntimeDirectory(), read at each call).
// Thread-safe; calls block on file I/O (one stat per call once the key is
// in memory).

#include <optional>
#include <string>

#include "platform/error/Error.h"
#include "platform/sandbox/ExtensionToken.h"

namespace qm {

// A read token for the canonical form (realpath) of path; creates the key
// on first use. Errors, as posix errors: the errno of resolving path (or
// container); EACCES when container is given and the canonical path does
// not lie within the canonical container, judged at a path-component
// boundary (so neither ".." nor a symbolic link leads out of it); the key's
// errors (TokenKey.h).
Result<std::string> issueReadExtension(const std::string& path,
                                       const std::optional<std::string>& container = std::nullopt);

// The grant of a genuine token. Never creates a key: without one no token is
// genuine. Errors: EINVAL for a token that is not genuine, else the key's.
Result<TokenGrant> verifyExtension(const std::string& token);

}  // namespace qm
