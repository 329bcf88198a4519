#include "platform/sandbox/ReadExtensions.h"

#include <cerrno>

#include "platform/env/Environment.h"
#include "platform/file/PathFacts.h"

namespace qm {

Result<std::string> issueReadExtension(const std::string& path, const std::optional<std::string>& container) {
    auto canonical = resolvedPath(path);
    if (!canonical) {
        return canonical.error();
    }
    if (container) {
        auto canonicalContainer = resolvedPath(*container);
        if (!canonicalContainer) {
            return canonicalContainer.error();
        }
        if (!isPathWithin(*canonical, *canonicalContainer)) {
            return posixError(EACCES, *canonical + " lies outside " + *canonicalContainer);
        }
    }
    auto key = processTokenKeyCache().key(tokenKeyPath(ductRuntimeDirectory()), TokenKeyCreation::createWhenMissing);
    if (!key) {
        return key.error();
    }
    return signToken(TokenGrant{kReadTokenClass, std::move(*canonical)}, *key);
}

Result<TokenGrant> verifyExtension(const std::string& token) {
    auto key = processTokenKeyCache().key(tokenKeyPath(ductRuntimeDirectory()), TokenKeyCreation::existingOnly);
    if (!key) {
        return key.error();
    }
    auto grant = openToken(token, *key);
    if (!grant) {
        return posixError(EINVAL, "not a genuine sandbox extension token");
    }
    return std::move(*grant);
}

}  // namespace qm
