#pragma once
// The keys of a plug-in's configuration, in new-style names, and the Info
// keys of its bundle that the model reads.

// Keys of the plug-in configuration, new-style names.
namespace qmkey {
inline constexpr const char* kTop = "VTExtension";
inline constexpr const char* kOldTop = "Quamber";
inline constexpr const char* kMultiple = "Multiple";
inline constexpr const char* kHubProtocolVersion = "HubProtocolVersion";
inline constexpr const char* kAttributes = "VTExtensionAttributes";
inline constexpr const char* kProtocol = "VTExtensionProtocol";
inline constexpr const char* kPointIdentifier = "VTExtensionPointIdentifier";
inline constexpr const char* kPrincipalClass = "PrincipalClass";
inline constexpr const char* kEmbeddedCode = "EmbeddedCode";
inline constexpr const char* kEmbeddedProtocol = "EmbeddedProtocol";
inline constexpr const char* kDedicated = "Dedicated";
inline constexpr const char* kPassProxy = "PassProxy";
inline constexpr const char* kShared = "Shared";
inline constexpr const char* kCleanTimeout = "CleanTimeout";
inline constexpr const char* kHostEntitlement = "VTExtensionHostEntitlement";
inline constexpr const char* kExtensionIdentifier = "VTExtensionIdentifier";
inline constexpr const char* kPointName = "VTExtensionPointName";
inline constexpr const char* kPointVersion = "VTExtensionPointVersion";
inline constexpr const char* kFormat = "ovaro.format";
inline constexpr const char* kBundleIdentifier = "MRBundleIdentifier";
inline constexpr const char* kBundleVersion = "MRBundleVersion";
inline constexpr const char* kBundleExecutable = "MRBundleExecutable";
inline constexpr const char* kBundleName = "MRBundleName";
inline constexpr const char* kBundleDisplayName = "MRBundleDisplayName";
inline constexpr const char* kInfoPlistUrl = "MRBundleInfoPlistURL";
inline constexpr const char* kObjectClass = "VTObject";
inline constexpr const char* kDataProtocol = "#Data";
}  // namespace qmkey
