// SDK resolution: the defaults of the SDK a plug-in names are merged under
// its bundle's Info dictionary, then canonical values are filled in.

#include "model/QMPlugInCore.h"

#include <string>
#include <unordered_set>
#include <utility>

#include "model/SdkRegistry.h"
#include "platform/log/SystemLog.h"

namespace {

// "Shared" may be declared as one path or as an array of paths; either way it
// is a set of paths. Anything else has no set meaning.
std::optional<qm::Array> sharedPaths(const qm::Value& shared) {
    if (const qm::Array* paths = shared.asArray()) {
        return *paths;
    }
    if (shared.isString()) {
        return qm::Array{shared};
    }
    return std::nullopt;
}

}  // namespace

std::optional<qm::Dictionary> QMPlugInCore::readSDKDictionary(std::string_view name) {
    return SdkRegistry().readSDKDictionary(name);
}

void QMPlugInCore::resolveSDK() {
    resolveSDK(SdkRegistry());
}

void QMPlugInCore::resolveSDK(const SdkRegistry& registry) {
    // Read before merging, so that an SDK cannot name another SDK.
    const qm::Value sdkName = sdkSpec();
    if (!sdkName.isNull()) {
        const std::string* name = sdkName.asString();
        if (name == nullptr) {
            qm::systemLogf(qm::kLogNotice, "invalid SDK key:%@", sdkName.description());
            return;
        }
        if (auto sdk = registry.readSDKDictionary(*name)) {
            const qm::Value info = bundleInfoDictionary();
            if (const qm::Dictionary* bundle = info.asDictionary()) {
                // Derives the top and plug-in dictionaries again, a "Multiple" entry included.
                (void)setDictionaries(qm::Value(mergeDictionaryInto(*sdk, *bundle)));
            }
        }
    }
    canonicalize();
}

bool QMPlugInCore::sdkOverridesKey(std::string_view key) {
    return key == qmkey::kCleanTimeout;
}

qm::Dictionary QMPlugInCore::mergeDictionaryInto(const qm::Dictionary& sdk, const qm::Dictionary& bundle) {
    qm::Dictionary merged = bundle;
    for (const auto& [key, sdkValue] : sdk) {
        const qm::Value* bundleValue = bundle.find(key);
        if (bundleValue == nullptr || sdkOverridesKey(key)) {
            merged.set(key, sdkValue);
            continue;
        }
        if (key == qmkey::kShared) {
            auto sdkPaths = sharedPaths(sdkValue);
            auto bundlePaths = sharedPaths(*bundleValue);
            if (sdkPaths && bundlePaths) {
                merged.set(key, mergeSharedResourcesInto(*sdkPaths, *bundlePaths));
            } else {
                qm::systemLogf(qm::kLogNotice, "keeping the bundle's \"%@\" %@: SDK default %@ is not a set of paths",
                               key, *bundleValue, sdkValue);
            }
            continue;
        }
        if (const qm::Dictionary* sdkDictionary = sdkValue.asDictionary()) {
            if (const qm::Dictionary* bundleDictionary = bundleValue->asDictionary()) {
                merged.set(key, mergeDictionaryInto(*sdkDictionary, *bundleDictionary));
            } else {
                qm::systemLogf(qm::kLogNotice,
                               "keeping the bundle's \"%@\" %@: it is not a dictionary like the SDK default %@", key,
                               *bundleValue, sdkValue);
            }
        }
        // Otherwise the bundle's own value stands.
    }
    return merged;
}

qm::Array QMPlugInCore::mergeSharedResourcesInto(const qm::Array& sdk, const qm::Array& bundle) {
    qm::Array merged;
    merged.reserve(bundle.size() + sdk.size());
    // Paths are strings: a set of them keeps a long list from costing a
    // quadratic merge. Values of other types are compared one by one.
    std::unordered_set<std::string> paths;
    auto add = [&](const qm::Value& element) {
        if (const std::string* path = element.asString()) {
            if (paths.insert(*path).second) {
                merged.push_back(element);
            }
            return;
        }
        for (const qm::Value& present : merged) {
            if (present == element) {
                return;
            }
        }
        merged.push_back(element);
    };
    for (const qm::Value& element : bundle) {
        add(element);
    }
    for (const qm::Value& element : sdk) {
        add(element);
    }
    return merged;
}
