#include "model/SdkRegistry.h"

#include <utility>

#include "platform/env/Environment.h"
#include "platform/log/SystemLog.h"
#include "platform/plist/PropertyList.h"

namespace {

bool isSafeFileName(std::string_view name) {
    return !name.empty() && name != "." && name != ".." && name.find('/') == std::string_view::npos &&
           name.find('\0') == std::string_view::npos;
}

// A missing, unreadable or non-dictionary file is simply not this SDK: the
// lookup goes on to the next place without a message.
std::optional<qm::Dictionary> readDictionaryFile(const std::string& path) {
    auto value = qm::plist::readFile(path);
    if (!value.ok()) {
        return std::nullopt;
    }
    if (const qm::Dictionary* dictionary = value->asDictionary()) {
        return *dictionary;
    }
    return std::nullopt;
}

}  // namespace

SdkRegistry::SdkRegistry(std::vector<std::string> extraDirectories) : extraDirectories_(std::move(extraDirectories)) {}

SdkLookup SdkRegistry::locate(std::string_view name) const {
    SdkLookup lookup;
    if (!isSafeFileName(name)) {
        return lookup;
    }
    std::vector<std::string> files;
    if (auto testDirectory = qm::testSdkDirectory()) {
        files.push_back(*testDirectory + "/" + std::string(name));
    }
    for (const std::string& directory : extraDirectories_) {
        files.push_back(directory + "/" + std::string(name) + ".plist");
    }
    for (const std::string& directory : qm::sdkSearchPath()) {
        files.push_back(directory + "/" + std::string(name) + ".plist");
    }
    for (std::string& file : files) {
        lookup.placesLooked.push_back(file);
        if (auto sdk = readDictionaryFile(file)) {
            lookup.file = std::move(file);
            lookup.dictionary = std::move(sdk);
            break;
        }
    }
    return lookup;
}

std::optional<qm::Dictionary> SdkRegistry::readSDKDictionary(std::string_view name) const {
    SdkLookup lookup = locate(name);
    if (!lookup.dictionary) {
        qm::systemLogf(qm::kLogNotice, "plug-in sdk \"%@\" not registered", name);
    }
    return std::move(lookup.dictionary);
}
