#include "model/InfoProvenance.h"

namespace {

struct Walk {
    std::vector<InfoOrigin> origins;
    std::vector<std::string> keyPath;

    static const qm::Value* at(const qm::Value* from, const std::string& key) {
        return from ? from->get(key) : nullptr;
    }

    // `bundle` and `sdk` are the sources' values at the same key path, when they have one.
    void visit(const qm::Value& merged, const qm::Value* bundle, const qm::Value* sdkValue) {
        const qm::Dictionary* dictionary = merged.asDictionary();
        if (dictionary && !dictionary->empty()) {
            for (const auto& [key, value] : *dictionary) {
                keyPath.push_back(key);
                visit(value, at(bundle, key), at(sdkValue, key));
                keyPath.pop_back();
            }
            return;
        }
        InfoOrigin::Source source = InfoOrigin::Source::canonical;
        if (bundle && *bundle == merged) {
            source = InfoOrigin::Source::bundle;
        } else if (sdkValue && *sdkValue == merged) {
            source = InfoOrigin::Source::sdk;
        } else if (bundle && sdkValue) {
            source = InfoOrigin::Source::bundleAndSdk;
        }
        origins.push_back({keyPath, merged, source});
    }
};

}  // namespace

std::vector<InfoOrigin> infoProvenance(const qm::Value& merged, const qm::Value& bundle,
                                       const std::optional<qm::Dictionary>& sdk) {
    Walk walk;
    const qm::Value sdkValue = sdk ? qm::Value(*sdk) : qm::Value();
    walk.visit(merged, &bundle, sdk ? &sdkValue : nullptr);
    return std::move(walk.origins);
}
