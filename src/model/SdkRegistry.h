#pragma once
// Where plug-in SDK dictionaries come from. An SDK is found, by name, in this
// order: the test SDK directory ($QMTEST_SDK, files named exactly by the SDK),
// then the extra directories given to the registry, then the platform's SDK
// directories (files named "<SDK>.plist"); the first file that holds a
// dictionary wins. Lookups read the disk each time: nothing is cached, so an
// SDK installed while the daemon runs is seen by the next resolution.

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/Value.h"

// Where one SDK was looked for and found.
struct SdkLookup {
    std::vector<std::string> placesLooked;  // every file tried, in order
    std::optional<std::string> file;        // the one that held it (the last place looked)
    std::optional<qm::Dictionary> dictionary;
};

class SdkRegistry {
public:
    // extraDirectories are searched, in order, before the platform's SDK
    // directories (qmkit inspect --sdk-dir).
    explicit SdkRegistry(std::vector<std::string> extraDirectories = {});

    // The SDK dictionary registered under name, or nothing, with the line
    // "plug-in sdk \"NAME\" not registered" in the log. A name that could
    // leave an SDK directory ("", ".", "..", anything holding "/" or NUL) is
    // never registered.
    std::optional<qm::Dictionary> readSDKDictionary(std::string_view name) const;
    // The same lookup, told in full and never logged (qmkit inspect).
    SdkLookup locate(std::string_view name) const;

    const std::vector<std::string>& extraDirectories() const { return extraDirectories_; }

private:
    std::vector<std::string> extraDirectories_;
};
