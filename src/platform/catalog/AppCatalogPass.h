#pragma once
// Private to the catalog's implementation files.

#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/catalog/AppCatalog.h"

namespace qm {

// The changes of one unit of work, staged on top of the catalog's state and
// applied only once the database has committed them.
struct AppCatalog::Pass {
    std::map<std::string, std::optional<CatalogBundle>> bundles;  // nothing: removed
    std::map<std::string, std::optional<CatalogApplication>> applications;
    std::optional<std::string> language;
    std::set<std::string> foldersDone;
    std::set<std::string> applicationsDone;
    std::optional<std::map<std::string, std::vector<std::string>>> bySource;  // built on first use
    bool applicationsMoved = false;  // an application joined or left a root: publish even without changes
};

}  // namespace qm
