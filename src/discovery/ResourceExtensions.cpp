#include "discovery/ResourceExtensions.h"

#include <cstring>

#include "platform/log/SystemLog.h"
#include "platform/sandbox/ReadExtensions.h"

qm::Dictionary issueResourceExtensions(const QMDPlugIn& plugIn, const qm::Value& shared) {
    qm::Array one;
    const qm::Array* paths = shared.asArray();
    if (shared.isString()) {
        one.push_back(shared);
        paths = &one;
    }
    qm::Dictionary tokens;
    const std::string bundle = plugIn.url().value_or("");
    for (const qm::Value& element : paths ? *paths : qm::Array{}) {
        const std::string* relative = element.asString();
        if (relative == nullptr) {
            continue;
        }
        std::string path = *relative == "." ? bundle : bundle + "/" + *relative;
        auto token = qm::issueReadExtension(path, bundle);
        if (!token) {
            qm::systemLogf(qm::kLogNotice, "failed to make extension for %@ in plug-in at %@: %s", path, bundle,
                           std::strerror(static_cast<int>(token.error().code)));
            continue;
        }
        tokens.set(*relative, qm::Value(std::move(token).value()));
    }
    return tokens;
}

void augmentForm(const QMDPlugIn& plugIn, qm::Dictionary& form) {
    const qm::Value* shared = plugIn.plugInDictionary().get("Shared");
    if (shared == nullptr) {
        return;
    }
    form.set("extensions", qm::Value(issueResourceExtensions(plugIn, *shared)));
}
