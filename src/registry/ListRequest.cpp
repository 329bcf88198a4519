#include "registry/ListRequest.h"

#include "model/QMError.h"
#include "registry/QMDatabase.h"

namespace {

// The unsigned argument named key, its fallback when absent; nothing when
// it is present and not an unsigned integer.
std::optional<std::uint64_t> unsignedArgument(const qm::Value& request, const char* key, std::uint64_t fallback) {
    const qm::Value* value = request.get(key);
    return value ? value->asUnsigned() : fallback;
}

qm::Dictionary entryFor(const QMDatabase::ListedPlugIn& listed) {
    qm::Dictionary entry{{"path", qm::Value(listed.path)}, {"valid", qm::Value(!listed.invalidReason)}};
    const qm::PlugInRecord* record = listed.record.get();
    entry.set("identifier", qm::Value(record ? record->identifier : std::string()));
    entry.set("point", qm::Value(record ? record->extensionPoint.value_or("") : std::string()));
    entry.set("version", qm::Value(record ? record->bundleVersion.value_or("") : std::string()));
    if (record) {
        entry.set("uuid", qm::Value(record->uuid));
    }
    if (listed.invalidReason) {
        entry.set("reason", qm::Value(*listed.invalidReason));
    }
    if (listed.election) {
        entry.set("election", *listed.election);
    }
    return entry;
}

}  // namespace

Reply listPlugIns(RequestContext& context) {
    if (context.client.sandboxed) {
        return Reply::fail(kQMErrorDenied, "unauthorized request");
    }
    std::optional<std::string> point;
    if (const qm::Value* given = context.request.get("point")) {
        if (!given->isString()) {
            return Reply::fail(kQMErrorInvalidRequest, "\"point\" must be a string");
        }
        point = *given->asString();
    }
    auto offset = unsignedArgument(context.request, "offset", 0);
    auto limit = unsignedArgument(context.request, "limit", kListPageLimit);
    if (!offset || !limit || *limit > kListPageLimit) {
        return Reply::fail(kQMErrorInvalidRequest,
                           "\"offset\" and \"limit\" must be unsigned integers, \"limit\" at most 1000");
    }
    auto listing = context.registry.listPlugIns(point, static_cast<std::size_t>(*offset),
                                                static_cast<std::size_t>(*limit));
    qm::Array plugIns;
    plugIns.reserve(listing.page.size());
    for (const auto& listed : listing.page) {
        plugIns.emplace_back(entryFor(listed));
    }
    return Reply::success(qm::Dictionary{{"plugins", qm::Value(std::move(plugIns))},
                                         {"total", qm::Value(static_cast<std::uint64_t>(listing.total))}});
}
