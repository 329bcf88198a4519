#pragma once
// Where applications and plug-ins lie, by folder layout alone:
//   <install root>/<name>.app                       an application
//   <application>/PlugIns/<bundle>                  a plug-in (flat)
//   <application>/Contents/PlugIns/<bundle>         a plug-in (desktop style)
// Every function works on the paths as given; resolve them first where
// that matters. Safe on any thread.

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/file/PathFacts.h"

namespace qm {

// The directories directly inside folder (symbolic links to directories
// included), as folder/name, sorted by name; empty when folder cannot be read.
std::vector<std::string> subdirectoriesOf(const std::string& folder);

// The application bundles of an install root: its subdirectories whose
// names end in ".app".
std::vector<std::string> applicationsInRoot(const std::string& root);

// The application's plug-ins folders that exist: PlugIns/ and Contents/PlugIns/.
std::vector<std::string> plugInsFoldersOf(const std::string& application);

// Whether the directory looks like an application: its name ends in ".app"
// or it has a plug-ins folder.
bool looksLikeApplication(const std::string& path);

// The application whose plug-ins folder holds the bundle, by the layout
// above; nothing when the bundle lies elsewhere.
std::optional<std::string> containingApplicationPath(const std::string& bundlePath);

// Whether the (resolved) path lies in one of the (resolved) roots, at a
// path-component boundary.
bool isUnderAnyRoot(std::string_view path, const std::vector<std::string>& roots);


}  // namespace qm
