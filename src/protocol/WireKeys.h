#pragma once
// The keys of the request and reply dictionaries, the protocol versions and
// the default service name: what the daemon and its clients agree on.

#include <cstdint>

namespace wire {

inline constexpr const char* kRequest = "request";
inline constexpr const char* kVersion = "version";
inline constexpr const char* kPaths = "paths";
inline constexpr const char* kFlags = "flags";
inline constexpr const char* kUuids = "uuids";
inline constexpr const char* kRules = "rules";
inline constexpr const char* kAnnotations = "annotations";
inline constexpr const char* kErrorCode = "errorcode";
inline constexpr const char* kError = "error";
inline constexpr const char* kMatches = "matches";
inline constexpr const char* kConflicts = "conflicts";
inline constexpr const char* kExtensions = "extensions";

inline constexpr std::uint64_t kCurrentVersion = 3;
inline constexpr std::uint64_t kOldestVersion = 2;

inline bool isSupportedVersion(std::uint64_t version) noexcept {
    return version == kOldestVersion || version == kCurrentVersion;
}

inline constexpr const char* kDefaultServiceName = "ovaro.quamber.qmd";

// Posted after every change of annotations and every hold taken or released.
inline constexpr const char* kAnnotationChangeNotification = "ovaro.quamber.annotation-change";
// Posted once the daemon has taken in plug-ins installed or uninstalled.
inline constexpr const char* kPlugInsChangeNotification = "ovaro.quamber.plugins-change";

}  // namespace wire
