#include "platform/consent/ConsentStore.h"

#include <cerrno>

#include "platform/plist/PropertyList.h"

namespace qm {

Result<std::vector<ConsentRecord>> consentRecordsForApplication(const std::string& applicationIdentifier,
                                                                const std::string& consentFile) {
    std::vector<ConsentRecord> records;
    auto store = plist::readFile(consentFile);
    if (!store) {
        const Error& error = store.error();
        if (error.domain == kPosixErrorDomain && error.code == ENOENT) {
            return records;
        }
        return error;
    }
    const Dictionary* applications = store->asDictionary();
    if (applications == nullptr) {
        return Error{kConsentErrorDomain, kConsentErrorDamaged, consentFile + ": the root is not a dictionary"};
    }
    const Value* entry = applications->find(applicationIdentifier);
    if (entry == nullptr) {
        return records;
    }
    const Dictionary* services = entry->asDictionary();
    if (services == nullptr) {
        return Error{kConsentErrorDomain, kConsentErrorDamaged,
                     consentFile + ": the entry of " + applicationIdentifier + " is not a dictionary"};
    }
    records.reserve(services->size());
    for (const auto& [service, granted] : *services) {
        records.push_back(ConsentRecord{service, granted.asBool() == true});
    }
    return records;
}

}  // namespace qm
