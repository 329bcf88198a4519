// Consent grants: the per-user Consent.plist, read on every query.

#include <gtest/gtest.h>

#include <filesystem>
#include <functional>

#include "platform/consent/ConsentStore.h"
#include "platform/plist/PropertyList.h"
#include "support/ScopedEnvironment.h"
#include "support/TempDir.h"

namespace {

using qm::ConsentRecord;
using Records = std::vector<ConsentRecord>;

class ConsentStore : public ::testing::Test {
protected:
    qmtest::TempDir home;
    qmtest::ScopedEnvironment dataHome{"XDG_DATA_HOME", home.path()};
    std::string file = home.file("ovaro/Consent.plist");

    void store(const qm::Value& content) {
        std::filesystem::create_directories(home.file("ovaro"));
        ASSERT_FALSE(qm::plist::writeFileAtomically(file, content, qm::plist::Format::xml));
    }
};

TEST_F(ConsentStore, OnlyBooleanTrueGrantsAndEachQueryRereadsTheFile) {
    EXPECT_EQ(*qm::consentRecordsForApplication("com.example.app"), Records{}) << "no file";
    store(qm::Dictionary{
        {"com.example.app", qm::Dictionary{{qm::kKeyboardNetworkConsentService, true},
                                           {"svc.denied", false},
                                           {"svc.number", 1},
                                           {"svc.text", "true"},
                                           {"svc.nested", qm::Dictionary{{"granted", true}}}}},
        {"com.example.other", qm::Dictionary{{"svc.other", true}}},
    });
    EXPECT_EQ(*qm::consentRecordsForApplication("com.example.app"),
              (Records{{"ovaro.pvc.keyboard-network", true},
                       {"svc.denied", false},
                       {"svc.nested", false},
                       {"svc.number", false},
                       {"svc.text", false}}));
    EXPECT_EQ(*qm::consentRecordsForApplication("com.example.unknown"), Records{});

    store(qm::Dictionary{{"com.example.app", qm::Dictionary{{"ovaro.pvc.keyboard-network", false}}}});
    EXPECT_EQ(*qm::consentRecordsForApplication("com.example.app"),
              (Records{{"ovaro.pvc.keyboard-network", false}})) << "a withdrawal counts at once";
}

TEST_F(ConsentStore, AFileThatCannotBeReadAsGrantsFailsTheQuery) {
    // Why a file does not read is the property list's to say; here, that its
    // error is the query's, and that only a missing file means no grants.
    struct Case {
        const char* name;
        std::function<void()> make;
        const char* domain;
    } cases[] = {
        {"a folder in its place", [&] { std::filesystem::create_directories(file); }, qm::kPosixErrorDomain},
        {"not a property list", [&] { qmtest::writeFile(file, "<plist><dict><key>x"); }, qm::plist::kErrorDomain},
        {"a root that is not a dictionary", [&] { store(qm::Array{qm::Value("com.example.app")}); }, qm::kConsentErrorDomain},
        {"an application entry that is not a dictionary", [&] { store(qm::Dictionary{{"com.example.app", true}}); },
         qm::kConsentErrorDomain},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        std::filesystem::remove_all(home.file("ovaro"));
        c.make();
        auto records = qm::consentRecordsForApplication("com.example.app");
        ASSERT_FALSE(records.ok());
        EXPECT_EQ(records.error().domain, c.domain) << records.error().text();
    }
}

}  // namespace
