#include "platform/types/UniformTypes.h"

#include <algorithm>
#include <set>
#include <utility>

#include "platform/env/Environment.h"
#include "platform/types/MimeTypePairs.h"

namespace qm {

namespace {

constexpr std::string_view kAnyData = "application/octet-stream";
constexpr std::string_view kPlainText = "text/plain";
constexpr std::string_view kTextFamily = "text/";

std::string asciiLowercase(std::string_view text) {
    std::string lower(text);
    for (char& c : lower) {
        if (c >= 'A' && c <= 'Z') {
            c = static_cast<char>(c - 'A' + 'a');
        }
    }
    return lower;
}

template <class Map>
std::string lookUpAlias(const Map& aliases, std::string type) {
    auto found = aliases.find(type);
    return found == aliases.end() ? type : found->second;
}

// Follows alias -> alias chains (two directories may each add a step) to
// their end; a cycle stops at the last type not yet seen.
std::map<std::string, std::string, std::less<>> followedAliases(
    const std::map<std::string, std::string, std::less<>>& direct) {
    std::map<std::string, std::string, std::less<>> followed;
    for (const auto& [alias, target] : direct) {
        std::set<std::string_view> seen{alias};
        std::string_view current = target;
        for (auto next = direct.find(current); next != direct.end() && !seen.contains(next->second);
             next = direct.find(current)) {
            seen.insert(current);
            current = next->second;
        }
        if (current != alias) {
            followed.emplace(alias, std::string(current));
        }
    }
    return followed;
}

}  // namespace

UniformTypes UniformTypes::fromMimeDirectories(const std::vector<std::string>& mimeDirectories) {
    TypeMap direct;
    for (const std::string& directory : mimeDirectories) {
        for (auto& pair : readMimeTypePairs(directory + "/aliases")) {
            // emplace keeps the meaning from the more important directory
            direct.emplace(asciiLowercase(pair.first), asciiLowercase(pair.second));
        }
    }
    TypeMap aliases = followedAliases(direct);

    ParentMap parents;
    for (const std::string& directory : mimeDirectories) {
        for (auto& pair : readMimeTypePairs(directory + "/subclasses")) {
            std::string child = lookUpAlias(aliases, asciiLowercase(pair.first));
            std::string parent = lookUpAlias(aliases, asciiLowercase(pair.second));
            auto& list = parents[child];
            if (child != parent && std::find(list.begin(), list.end(), parent) == list.end()) {
                list.push_back(std::move(parent));
            }
        }
    }
    return UniformTypes(std::move(aliases), std::move(parents));
}

const UniformTypes& UniformTypes::shared() {
    static const UniformTypes instance = [] {
        std::vector<std::string> directories{xdgDataHome() + "/mime"};
        for (const std::string& dataDirectory : xdgDataDirectories()) {
            directories.push_back(dataDirectory + "/mime");
        }
        return fromMimeDirectories(directories);
    }();
    return instance;
}

std::string UniformTypes::canonicalType(std::string_view type) const {
    return lookUpAlias(aliases_, asciiLowercase(type));
}

bool UniformTypes::conforms(std::string_view type, std::string_view toType) const {
    std::string from = canonicalType(type);
    std::string to = canonicalType(toType);
    if (from.empty() || to.empty()) {
        return false;
    }
    if (from == to || to == kAnyData) {
        return true;
    }
    // Breadth-first over the ancestors; the seen list keeps cycles finite.
    std::vector<std::string_view> seen{from};
    for (std::size_t next = 0; next < seen.size(); ++next) {
        std::string_view current = seen[next];
        std::vector<std::string_view> parents;
        if (auto declared = parents_.find(current); declared != parents_.end()) {
            parents.assign(declared->second.begin(), declared->second.end());
        }
        if (current.starts_with(kTextFamily)) {
            parents.push_back(kPlainText);
        }
        for (std::string_view parent : parents) {
            if (parent == to) {
                return true;
            }
            if (std::find(seen.begin(), seen.end(), parent) == seen.end()) {
                seen.push_back(parent);
            }
        }
    }
    return false;
}

bool UniformTypes::isType(std::string_view type, std::string_view otherType) const {
    std::string first = canonicalType(type);
    return !first.empty() && first == canonicalType(otherType);
}

}  // namespace qm
