#pragma once
// Checks that a document is safe to hand to libplist 2.2 before it parses it.
//
// libplist builds, copies and frees its trees recursively, one stack frame
// per nesting level, and its binary reader copies an object once for every
// reference to it. A few hundred kilobytes of nested arrays therefore crash
// it, and a few hundred bytes of binary list whose objects refer twice to the
// next one make it build billions of nodes. These checks look only at the
// structure (which containers open and close where) and refuse such input
// with a plist-domain error. Anything they let through is at most
// `maxNesting` containers deep; a binary list also expands to at most
// `maxNodes` nodes, and its dictionary keys are strings without NUL (libplist
// asserts on those, which aborts the process).
//
// The XML check follows libplist's own tokenising (comments, CDATA, quoted
// text in tags, processing instructions, DOCTYPE) so that it sees the
// containers libplist will see. Where that tokenising is ambiguous (quoted
// text holding '<' or '>', an internal DTD subset) the document is refused
// rather than guessed at; real property lists contain neither.

#include <cstdint>
#include <span>
#include <string_view>

#include "platform/error/Error.h"

namespace qm::plist {

qm::MaybeError checkXmlStructure(std::string_view text, unsigned maxNesting);

qm::MaybeError checkBinaryStructure(std::span<const std::uint8_t> bytes, unsigned maxNesting,
                                    std::uint64_t maxNodes);

}  // namespace qm::plist
