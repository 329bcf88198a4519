#pragma once
// A registry over a catalog kept in a test's private folder: its database,
// user root, containers and annotations all under `dir`.

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "registry/QMDatabase.h"
#include "support/TempDir.h"

namespace qmtest {

// The registry, not started; null (after a test failure) when it cannot open.
inline std::unique_ptr<QMDatabase> openTestRegistry(const TempDir& dir, std::vector<std::string> systemRoots = {}) {
    qm::AppCatalogOptions options;
    options.databasePath = dir.file("catalog.db");
    options.systemRoots = std::move(systemRoots);
    options.userRoot = dir.file("Applications");
    options.containersDirectory = dir.file("Containers");
    auto catalog = qm::AppCatalog::open(options);
    EXPECT_TRUE(catalog) << catalog.error().text();
    if (!catalog) {
        return nullptr;
    }
    auto registry = QMDatabase::initWithDatabase(dir.file("Annotations"), std::move(catalog).value());
    EXPECT_TRUE(registry) << registry.error().text();
    return registry ? std::move(registry).value() : nullptr;
}

}  // namespace qmtest
