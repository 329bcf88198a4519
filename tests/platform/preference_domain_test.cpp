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

    // Replaces the file by rename, as writeFileAtomically does.
    void store(const qm::Value& root, Format format = Format::xml) {
        qmtest::writeFile(path(), "");
        ASSERT_FALSE(qm::plist::writeFileAtomically(path(), root, format));
    }
    void storeExclusions(const char* text, Format format = Format::xml) {
        store(qm::Dictionary{{"exclusions", qm::Value(text)}}, format);
    }

    // Rewrites the file in place (same inode), as an editor that truncates would.
    void overwrite(const std::string& text) {
        int fd = ::open(path().c_str(), O_WRONLY | O_TRUNC);
        ASSERT_GE(fd, 0);
        ASSERT_EQ(::write(fd, text.data(), text.size()), static_cast<ssize_t>(text.size()));
        ::close(fd);
    }

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
    for (Format format : {Format::xml, Format::binary}) {
        for (bool inPlace : {false, true}) {
            storeExclusions("aaaa", format);
            auto domain = qm::PreferenceDomain::forUser("test.domain");
            domain.synchronize();
            ASSERT_EQ(exclusionsOf(domain), "aaaa");
            if (inPlace) {  // same size, same inode
                auto bytes = qm::plist::serialize(qm::Dictionary{{"exclusions", qm::Value("bbbb")}}, format);
                ASSERT_TRUE(bytes.ok());
                overwrite(std::string(bytes->begin(), bytes->end()));
            } else {
                storeExclusions("bbbb", format);
            }
            domain.synchronize();
            EXPECT_EQ(exclusionsOf(domain), "bbbb") << (format == Format::xml ? "xml" : "binary") << inPlace;
        }
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

    store(qm::Array{qm::Value("x")});
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
