#pragma once
// Checks that an XML document is safe to hand to libplist 2.2 before it
// parses it. libplist builds and frees its trees recursively, one stack frame
// per nesting level, so a few hundred kilobytes of nested arrays crash it.
//
// The check follows libplist's own tokenising (comments, CDATA, quoted text
// in tags, processing instructions, DOCTYPE) so that it sees the containers
// libplist will see, counting an empty root as open since libplist keeps
// adding to it. Where that tokenising is ambiguous (quoted text holding '<'
// or '>', an internal DTD subset) the document is refused rather than
// guessed at; real property lists contain neither.

#include <string_view>

#include "platform/error/Error.h"

namespace qm::plist {

// Nothing when the document nests at most maxNesting containers deep as
// libplist will read it; else a plist-domain error (malformed or too complex).
qm::MaybeError checkXmlStructure(std::string_view text, unsigned maxNesting);

}  // namespace qm::plist
