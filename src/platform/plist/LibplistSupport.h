#pragma once
// Pieces shared by the files that talk to libplist: owning handles for what
// it allocates, the plist-domain error, and a path into a tree for messages.

#include <plist/plist.h>

#include <cstdlib>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/error/Error.h"
#include "platform/plist/PropertyList.h"

namespace qm::plist {

struct PlistFree {
    void operator()(void* node) const {
        if (node) {
            plist_free(node);
        }
    }
};
using PlistPtr = std::unique_ptr<void, PlistFree>;

// libplist allocates iterators, keys and output buffers with malloc.
struct MallocFree {
    void operator()(void* p) const { std::free(p); }
};
using MallocPtr = std::unique_ptr<void, MallocFree>;

inline qm::Error plistError(ErrorCode code, std::string text) {
    return qm::Error{kErrorDomain, code, std::move(text)};
}

// The two refusals shared by the structure checks of both formats.
inline qm::Error malformed(const std::string& what) {
    return plistError(kErrorMalformed, "not a property list: " + what);
}

inline qm::Error tooDeep(unsigned maxNesting) {
    return plistError(kErrorTooComplex, "property list nested deeper than " + std::to_string(maxNesting) + " levels");
}

// A path like "/Plugins/3/name" that says where in a tree an error lies.
class TreePath {
public:
    void push(std::string component) { components_.push_back(std::move(component)); }
    void pop() { components_.pop_back(); }
    std::string text() const {
        if (components_.empty()) {
            return "/";
        }
        std::string out;
        for (const auto& component : components_) {
            out += '/';
            out += component;
        }
        return out;
    }
    std::size_t depth() const { return components_.size(); }

private:
    std::vector<std::string> components_;
};

}  // namespace qm::plist
