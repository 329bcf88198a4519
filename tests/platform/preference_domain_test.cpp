// Preference domains: per-user property lists re-read when they change.

#include "platform/prefs/PreferenceDomain.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <ctime>
#include <string>

#include "platform/plist/PropertyList.h"
#include "support/LogCapture.h"
#include "support/ScopedEnvironment.h"
#include "support/TempDir.h"

namespace {

using qm::plist::Format;

class PreferenceDomainTest : public ::testing::Test {
protected:
    PreferenceDomainTest() : config_("XDG_CONFIG_HOME", dir_.file("config")) {}

    std::string path() const { return dir_.file("config/ovaro/test.domain.plist"); }

    void store(const qm::Value& exclusions, Format format = Format::xml) {
        qmtest::writeFile(path(), "");
        ASSERT_FALSE(qm::plist::writeFileAtomically(path(), qm::Dictionary{{"exclusions", exclusions}}, format));
    }

    // Rewrites the file in place (same inode), as an editor that truncates would.
    void overwrite(const std::string& text) {
        int fd = ::open(path().c_str(), O_WRONLY | O_TRUNC);
        ASSERT_GE(fd, 0);
        ASSERT_EQ(::write(fd, text.data(), text.size()), static_cast<ssize_t>(text.size()));
        ::close(fd);
    }

    void ageBy(std::time_t seconds) {
        struct timespec times[2] = {{0, UTIME_OMIT}, {std::time(nullptr) - seconds, 0}};
        ASSERT_EQ(::utimensat(AT_FDCWD, path().c_str(), times, 0), 0);
    }

    static std::string exclusionsOf(const qm::PreferenceDomain& domain) {
        auto value = domain.valueForKey("exclusions");
        return value && value->asString() ? *value->asString() : "(none)";
    }

    qmtest::TempDir dir_;
    qmtest::ScopedEnvironment config_;
};

TEST_F(PreferenceDomainTest, AMissingFolderOrFileMeansNoPreferences) {
    auto domain = qm::PreferenceDomain::forUser("test.domain");
    EXPECT_EQ(domain.path(), path());
    EXPECT_FALSE(domain.synchronize());
    EXPECT_EQ(exclusionsOf(domain), "(none)");
    store("x");
    EXPECT_TRUE(domain.synchronize());
    EXPECT_EQ(exclusionsOf(domain), "x");
    ASSERT_EQ(::unlink(path().c_str()), 0);
    EXPECT_FALSE(domain.synchronize());
    EXPECT_TRUE(domain.values().empty());
}

TEST_F(PreferenceDomainTest, ChangesWrittenBeforeSynchronizeAreSeenByIt) {
    struct Case {
        const char* name;
        bool inPlace;
        Format format;
    };
    for (const Case& c : {Case{"rename, XML", false, Format::xml}, Case{"rename, binary", false, Format::binary},
                          Case{"in place, same size", true, Format::xml}}) {
        store("aaaa", c.format);
        auto domain = qm::PreferenceDomain::forUser("test.domain");
        ASSERT_TRUE(domain.synchronize());
        ASSERT_EQ(exclusionsOf(domain), "aaaa") << c.name;
        if (c.inPlace) {
            auto bytes = qm::plist::serialize(qm::Dictionary{{"exclusions", qm::Value("bbbb")}}, c.format);
            ASSERT_TRUE(bytes.ok());
            overwrite(std::string(bytes->begin(), bytes->end()));
        } else {
            store("bbbb", c.format);
        }
        domain.synchronize();
        EXPECT_EQ(exclusionsOf(domain), "bbbb") << c.name;
    }
}

TEST_F(PreferenceDomainTest, OnlyAChangedOrRecentlyModifiedFileIsReadAgain) {
    store("x");
    ageBy(3600);
    auto domain = qm::PreferenceDomain::forUser("test.domain");
    EXPECT_TRUE(domain.synchronize());
    EXPECT_FALSE(domain.synchronize());  // unchanged, modified an hour ago
    ageBy(0);                            // modified now: within the tick that may hide a write
    EXPECT_TRUE(domain.synchronize());
    EXPECT_TRUE(domain.synchronize());
    EXPECT_EQ(exclusionsOf(domain), "x");
}

TEST_F(PreferenceDomainTest, ADamagedFileMeansNoneAndIsLoggedOncePerState) {
    qmtest::LogCapture log;
    store("x");
    auto domain = qm::PreferenceDomain::forUser("test.domain");
    domain.synchronize();
    ASSERT_EQ(exclusionsOf(domain), "x");

    overwrite("not a property list");
    for (int i = 0; i < 3; ++i) {  // a fresh file is read each time, logged once
        domain.synchronize();
        EXPECT_TRUE(domain.values().empty());
    }
    EXPECT_EQ(log.countContaining("damaged"), 1u);

    overwrite("still not one");
    domain.synchronize();
    EXPECT_EQ(log.countContaining("damaged"), 2u);

    qmtest::writeFile(path(), "");
    ASSERT_FALSE(qm::plist::writeFileAtomically(path(), qm::Array{qm::Value("x")}, Format::xml));
    domain.synchronize();
    EXPECT_TRUE(domain.values().empty());
    EXPECT_EQ(log.countContaining("not a dictionary"), 1u);

    store("y", Format::binary);
    domain.synchronize();
    EXPECT_EQ(exclusionsOf(domain), "y");
    EXPECT_EQ(log.countContaining("damaged"), 3u);
}

}  // namespace
