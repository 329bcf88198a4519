#pragma once
// The secret that signs sandbox extension tokens: 32 random bytes in the
// file D/token.key, private to the user (0600).
//
// A new key is written in full under a temporary name made with O_EXCL and
// mode 0600, then link()ed into place, so no other user can ever read it and
// no reader ever sees half a key; when two processes race to create it, the
// loser reads the winner's key. A key file that is not a private regular
// file of this user with exactly 32 bytes is refused, never used or
// replaced: a key others could read forges tokens.
//
// The cache keeps the key in memory and checks it with one stat per use,
// reading it again when the file is another one: another inode, or the same
// inode number with other times or size (a file system may hand a deleted
// key's inode number to its replacement at once), or another path asked.
// Thread-safe; calls block on file I/O.

#include <array>
#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <sys/types.h>

#include "platform/error/Error.h"
#include "platform/file/FileStamp.h"

namespace qm {

inline constexpr std::size_t kTokenKeyBytes = 32;
using TokenKeyBytes = std::array<std::uint8_t, kTokenKeyBytes>;

// The key file in the runtime directory D.
std::string tokenKeyPath(const std::string& runtimeDirectory);

enum class TokenKeyCreation {
    createWhenMissing,  // issuers: make the key (and its folder, 0700) on first use
    existingOnly,       // verifiers: no key file means no genuine token
};

class TokenKeyCache {
public:
    // The key at keyPath. Errors are posix errors: the errno of stat, open,
    // read or creation, ENOENT for a missing key that may not be created,
    // EACCES for a key file that is not private to this user, EINVAL for one
    // that is not a regular file of 32 bytes.
    Result<TokenKeyBytes> key(const std::string& keyPath, TokenKeyCreation creation);

private:
    struct Loaded {
        std::string path;
        dev_t device = 0;
        FileStamp stamp;
        TokenKeyBytes bytes{};
    };

    std::mutex mutex_;
    std::optional<Loaded> loaded_;
};

// The process's cache, shared by every issuer and verifier in it.
TokenKeyCache& processTokenKeyCache();

}  // namespace qm
