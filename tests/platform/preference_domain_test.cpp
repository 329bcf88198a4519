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
    std::string path() const { return dir_.file("config/ovaro/test.domain.plist"); }

    // Replaces the file by rename.
    void storeExclusions(const char* text, Format format = Format::xml) {
        qmtest::writePlist(path(), qm::Dictionary{{"exclusions", qm::Value(text)}}, format);
    }

    // Rewrites the file in place (same inode), as an editor that truncates would.
    void overwrite(const std::string& text) { qmtest::writeFile(path(), text); }

    void setModifiedSecondsAgo(std::time_t seconds) {
        struct timespec times[2] = {{0, UTIME_OMIT}, {std::time(nullptr) - seconds, 0}};
        ASSERT_EQ(::utimensat(AT_FDCWD, path().c_str(), times, 0), 0);
    }

    static std::string exclusionsOf(const qm::PreferenceDomain& domain) {
        auto value = domain.valueForKey("exclusions");
        return value && value->asString() ? *value->asString() : "(none)";
    }

    qmtest::TempDir dir_;
    qmtest::ScopedEnvironment config_{"XDG_CONFIG_HOME", dir_.file("config")};
};

TEST_F(PreferenceDomainTest, ChangesWrittenBeforeSynchronizeAreSeenByIt) {
    for (bool inPlace : {false, true}) {
        storeExclusions("aaaa");
        auto domain = qm::PreferenceDomain::forUser("test.domain");
        domain.synchronize();
        ASSERT_EQ(exclusionsOf(domain), "aaaa");
        if (inPlace) {  // same size, same inode
            auto bytes = qm::plist::serialize(qm::Dictionary{{"exclusions", qm::Value("bbbb")}}, Format::xml);
            overwrite(std::string(bytes->begin(), bytes->end()));
        } else {
            storeExclusions("bbbb");
        }
        domain.synchronize();
        EXPECT_EQ(exclusionsOf(domain), "bbbb") << (inPlace ? "in place" : "replaced");
    }
}

TEST_F(PreferenceDomainTest, OnlyAChangedOrRecentlyModifiedFileIsReadAgain) {
    storeExclusions("x");
    setModifiedSecondsAgo(3600);
    auto domain = qm::PreferenceDomain::forUser("test.domain");
    EXPECT_TRUE(domain.synchronize());
    EXPECT_FALSE(domain.synchronize());  // unchanged for an hour
    setModifiedSecondsAgo(0);            // within the tick that may hide a write
    EXPECT_TRUE(domain.synchronize());
    EXPECT_TRUE(domain.synchronize());
    EXPECT_EQ(exclusionsOf(domain), "x");
}

TEST_F(PreferenceDomainTest, AMissingOrDamagedFileMeansNoneAndDamageIsLoggedOncePerState) {
    qmtest::LogCapture log;
    auto domain = qm::PreferenceDomain::forUser("test.domain");
    EXPECT_EQ(domain.path(), path());
    EXPECT_FALSE(domain.synchronize());  // no folder
    EXPECT_EQ(exclusionsOf(domain), "(none)");
    storeExclusions("x");
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

    qmtest::writePlist(path(), qm::Array{qm::Value("x")});
    domain.synchronize();
    EXPECT_TRUE(domain.values().empty());
    EXPECT_EQ(log.countContaining("not a dictionary"), 1u);
    storeExclusions("y", Format::binary);
    domain.synchronize();
    EXPECT_EQ(exclusionsOf(domain), "y");
    ASSERT_EQ(::unlink(path().c_str()), 0);
    EXPECT_FALSE(domain.synchronize());
    EXPECT_TRUE(domain.values().empty());
    EXPECT_EQ(log.countContaining("damaged"), 3u);
}

}  // namespace
