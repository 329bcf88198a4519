#pragma once
// Checks that a binary property list is safe to hand to libplist 2.2 before
// it parses it. libplist recurses once per nesting level, copies an object
// once for every reference to it (a few hundred bytes whose objects each
// refer twice to the next expand to billions of nodes), and asserts, which
// aborts the process, on a dictionary key with a NUL character. The check
// walks the object graph from its offset table without building anything.

#include <cstdint>
#include <span>

#include "platform/error/Error.h"

namespace qm::plist {

// Nothing when the list nests at most maxNesting containers deep, expands to
// at most maxNodes nodes, has no cycle and keys only by strings without NUL;
// else a plist-domain error (malformed or too complex).
qm::MaybeError checkBinaryStructure(std::span<const std::uint8_t> bytes, unsigned maxNesting,
                                    std::uint64_t maxNodes);

}  // namespace qm::plist
