#pragma once
// The two walks over request arrays that handlers share. A step answers
// nothing to go on, or the reply that ends the request; a walk stops at the
// first such reply, and what earlier steps did stays done.

#include <functional>
#include <optional>
#include <string>

#include "registry/QMDatabase.h"
#include "registry/Request.h"

// Given the path (resolved with realpath when it could be, else as sent)
// and whether it resolved.
using PathStep = std::function<std::optional<Reply>(const std::string& path, bool resolved)>;
// Given the registry's record of each UUID in turn.
using PlugInStep = std::function<std::optional<Reply>(const QMDPlugInPtr& plugIn)>;

// `marshalPaths:` over "paths": the failure that ended the walk, or none
// when every path was accepted (an empty array included).
std::optional<Reply> marshalPaths(const qm::Value& request, const PathStep& step);
// `processPaths:`: marshalPaths, then the empty success reply.
Reply processPaths(const qm::Value& request, const PathStep& step);
// `processUuidList:` over "uuids", looking each plug-in up in the registry.
std::optional<Reply> processUuidList(const qm::Value& request, QMDatabase& registry, const PlugInStep& step);
