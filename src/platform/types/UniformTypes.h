#pragma once
// Uniform-type conformance over the freedesktop shared-mime-info database:
// the "subclasses" and "aliases" files of one or more mime directories.
//
// Both types of a question are lower-cased (ASCII) and resolved through the
// aliases. A type conforms to itself, to its declared parents and theirs
// (cycles in the data are harmless), every text/* type to text/plain, and
// every type to application/octet-stream. A type the database does not know
// conforms only to those. The empty string is no type: it conforms to
// nothing and nothing conforms to it.
//
// Immutable once built; every member may be called from any thread.

#include <functional>
#include <map>
#include <string>
#include <string_view>
#include <vector>

namespace qm {

class UniformTypes {
public:
    // Reads <dir>/subclasses and <dir>/aliases of each directory, the most
    // important first: an alias defined twice keeps its first meaning, parents
    // declared in several directories all count. Missing files are skipped.
    static UniformTypes fromMimeDirectories(const std::vector<std::string>& mimeDirectories);

    // The process-wide relation over $XDG_DATA_HOME/mime and the mime/ folder
    // of each $XDG_DATA_DIRS entry, read at the first call (the daemon makes
    // it at start) and kept unchanged for the life of the process.
    static const UniformTypes& shared();

    // The type lower-cased and resolved through the aliases.
    std::string canonicalType(std::string_view type) const;

    // Whether type is a kind of toType ("?TY-CONFORMS:" asks whether a value
    // conforms to its operand, "?TY-IS:" whether its operand conforms to the value).
    bool conforms(std::string_view type, std::string_view toType) const;

    // Whether both name the same type once lower-cased and de-aliased.
    bool isType(std::string_view type, std::string_view otherType) const;

private:
    using TypeMap = std::map<std::string, std::string, std::less<>>;
    using ParentMap = std::map<std::string, std::vector<std::string>, std::less<>>;

    UniformTypes(TypeMap aliases, ParentMap parents) : aliases_(std::move(aliases)), parents_(std::move(parents)) {}

    TypeMap aliases_;    // alias -> canonical type, chains already followed
    ParentMap parents_;  // canonical type -> its declared parents, canonical
};

}  // namespace qm
