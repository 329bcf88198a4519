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

std::optional<qm::Dictionary> SdkRegistry::readSDKDictionary(std::string_view name) const {
    if (isSafeFileName(name)) {
        if (auto testDirectory = qm::testSdkDirectory()) {
            if (auto sdk = readDictionaryFile(*testDirectory + "/" + std::string(name))) {
                return sdk;
            }
        }
        std::vector<std::string> directories = extraDirectories_;
        for (std::string& directory : qm::sdkSearchPath()) {
            directories.push_back(std::move(directory));
        }
        for (const std::string& directory : directories) {
            if (auto sdk = readDictionaryFile(directory + "/" + std::string(name) + ".plist")) {
                return sdk;
            }
        }
    }
    qm::systemLogf(qm::kLogNotice, "plug-in sdk \"%@\" not registered", name);
    return std::nullopt;
}
