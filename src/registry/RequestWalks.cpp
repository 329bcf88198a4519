#include "registry/RequestWalks.h"

#include "model/QMError.h"
#include "model/ValueHelpers.h"
#include "platform/file/PathFacts.h"
#include "protocol/WireKeys.h"

std::optional<Reply> marshalPaths(const qm::Value& request, const PathStep& step) {
    const qm::Array* paths = QMGetDuctArray(request, wire::kPaths);
    if (paths == nullptr) {
        return Reply::fail(kQMErrorInvalidRequest, "invalid request format");
    }
    for (const qm::Value& element : *paths) {
        const std::string* path = element.asString();
        if (path == nullptr) {
            return Reply::fail(kQMErrorInvalidRequest, "invalid request format");
        }
        if (path->empty() || (*path)[0] != '/') {
            return Reply::fail(kQMErrorPath, qm::format("absolute path required: %s", path->c_str()));
        }
        auto resolved = qm::resolvedPath(*path);
        if (auto failure = resolved ? step(*resolved, true) : step(*path, false)) {
            return failure;
        }
    }
    return std::nullopt;
}

Reply processPaths(const qm::Value& request, const PathStep& step) {
    if (auto failure = marshalPaths(request, step)) {
        return std::move(*failure);
    }
    return Reply::success();
}

std::optional<Reply> processUuidList(const qm::Value& request, QMDatabase& registry, const PlugInStep& step) {
    const qm::Array* uuids = QMGetDuctArray(request, wire::kUuids);
    if (uuids == nullptr) {
        return Reply::fail(kQMErrorInvalidRequest, "invalid request format (uuid)");
    }
    for (const qm::Value& element : *uuids) {
        auto uuid = element.asUuid();
        if (!uuid) {
            return Reply::fail(kQMErrorInvalidRequest, "invalid request (bad uuid array)");
        }
        QMDPlugInPtr plugIn = registry.findPlugIn(*uuid);
        if (!plugIn) {
            return Reply::fail(kQMErrorInvalidRequest, "no such plugin (uuid not found)");
        }
        if (auto failure = step(plugIn)) {
            return failure;
        }
    }
    return std::nullopt;
}
