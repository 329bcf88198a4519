#include "platform/catalog/CatalogRecords.h"

#include "platform/bundle/BundleDirectory.h"

namespace qm {

std::string PlugInRecord::bundleURL() const {
    return fileURL(bundlePath);
}

std::optional<AppCatalogError> appCatalogErrorOf(const Error& error) {
    if (error.domain != kAppCatalogErrorDomain) {
        return std::nullopt;
    }
    return static_cast<AppCatalogError>(error.code);
}

}  // namespace qm
