// Named notifications: count files posted by the daemon's side and observed
// through inotify by the clients' side.

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <chrono>
#include <fstream>
#include <optional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/file/FolderEntries.h"
#include "platform/notify/NotificationFiles.h"
#include "platform/notify/NotificationPoster.h"
#include "platform/notify/NotificationWatcher.h"
#include "support/TempDir.h"

namespace {

using namespace std::chrono_literals;
using Report = std::pair<std::string, std::uint64_t>;

// A runtime directory with a started poster in it.
class NotificationsTest : public ::testing::Test {
protected:
    NotificationsTest() : poster_(dir_.path()) { EXPECT_FALSE(poster_.reset()); }

    std::string notifyFile(const std::string& name) const { return dir_.file("notify/" + name); }

    std::vector<std::string> sortedEntries() const {
        auto names = qm::folderEntryNames(dir_.file("notify"));
        EXPECT_TRUE(names.ok());
        std::vector<std::string> sorted = names.ok() ? *names : std::vector<std::string>{};
        std::sort(sorted.begin(), sorted.end());
        return sorted;
    }

    static std::vector<Report> wait(qm::NotificationWatcher& watcher, std::chrono::milliseconds timeout = 5s) {
        std::vector<Report> reports;
        auto calls = watcher.waitForPosts(timeout, [&](const std::string& name, std::uint64_t count) {
            reports.emplace_back(name, count);
        });
        EXPECT_TRUE(calls.ok());
        EXPECT_EQ(calls.ok() ? *calls : 0, reports.size());
        return reports;
    }

    qmtest::TempDir dir_;
    qm::NotificationPoster poster_;
};

TEST_F(NotificationsTest, APostIsInItsFileWhenItReturns) {
    std::vector<Report> observed;
    poster_.setObserver([&](const std::string& name, std::uint64_t count) { observed.emplace_back(name, count); });
    for (const char* name : {"ovaro.quamber.annotation-change", "other", "ovaro.quamber.annotation-change"}) {
        ASSERT_FALSE(poster_.post(name));
        EXPECT_EQ(qmtest::readFile(notifyFile(name)), std::to_string(poster_.count(name)));
    }
    EXPECT_EQ(observed, (std::vector<Report>{{"ovaro.quamber.annotation-change", 1}, {"other", 1},
                                             {"ovaro.quamber.annotation-change", 2}}));
    EXPECT_EQ(sortedEntries(), (std::vector<std::string>{"other", "ovaro.quamber.annotation-change"}));
    auto absent = qm::readNotificationCount(dir_.file("notify"), "never-posted");
    ASSERT_TRUE(absent.ok());
    EXPECT_EQ(*absent, 0u);
}

TEST_F(NotificationsTest, NamesThatAreNotPlainFileNamesAreRefused) {
    for (const std::string& name : {std::string(), std::string(".hidden"), std::string("a/b"), std::string(201, 'n'),
                                    std::string("a\0b", 3)}) {
        auto error = poster_.post(name);
        ASSERT_TRUE(error) << name;
        EXPECT_EQ(error->code, EINVAL);
        EXPECT_EQ(poster_.count(name), 0u);
    }
    EXPECT_TRUE(sortedEntries().empty());
}

TEST_F(NotificationsTest, ResetMakesAPrivateFolderAndRestartsTheCounts) {
    ASSERT_FALSE(poster_.post("n"));
    ASSERT_FALSE(poster_.post("n"));
    qmtest::writeFile(notifyFile(".post.leftover"), "");
    ASSERT_EQ(::chmod(dir_.file("notify").c_str(), 0755), 0);

    ASSERT_FALSE(poster_.reset());
    struct stat status {};
    ASSERT_EQ(::stat(dir_.file("notify").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0700u);
    EXPECT_TRUE(sortedEntries().empty());
    EXPECT_EQ(poster_.count("n"), 0u);
    ASSERT_FALSE(poster_.post("n"));
    EXPECT_EQ(qmtest::readFile(notifyFile("n")), "1");

    qm::NotificationPoster nowhere(dir_.file("missing"));
    EXPECT_TRUE(nowhere.reset());
    EXPECT_TRUE(nowhere.post("n"));
    EXPECT_EQ(nowhere.count("n"), 1u);  // counted though not written
}

TEST_F(NotificationsTest, ConcurrentPostsNeverLeaveAnOlderCountBehind) {
    constexpr int kThreads = 4;
    constexpr int kPosts = 100;
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&] {
            for (int i = 0; i < kPosts; ++i) {
                EXPECT_FALSE(poster_.post("busy"));
            }
        });
    }
    for (auto& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(qmtest::readFile(notifyFile("busy")), std::to_string(kThreads * kPosts));
    EXPECT_EQ(sortedEntries(), std::vector<std::string>{"busy"});
}

TEST_F(NotificationsTest, AWatcherReportsEachLandingWithItsCount) {
    auto watcher = qm::NotificationWatcher::open(dir_.path());
    ASSERT_TRUE(watcher.ok());
    EXPECT_TRUE(wait(*watcher, 20ms).empty());

    ASSERT_FALSE(poster_.post("a"));
    EXPECT_EQ(wait(*watcher), (std::vector<Report>{{"a", 1}}));

    for (const char* name : {"a", "b", "a"}) {  // read together: one report per name
        ASSERT_FALSE(poster_.post(name));
    }
    EXPECT_EQ(wait(*watcher), (std::vector<Report>{{"a", 3}, {"b", 1}}));

    // A file merely written in the folder is no post.
    qmtest::writeFile(notifyFile("c"), "5");
    EXPECT_TRUE(wait(*watcher, 20ms).empty());
}

TEST_F(NotificationsTest, AnOverflowReportsEveryName) {
    auto watcher = qm::NotificationWatcher::open(dir_.path());
    ASSERT_TRUE(watcher.ok());
    unsigned long queueLength = 16384;
    std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> queueLength;
    ASSERT_FALSE(poster_.post("first"));
    for (unsigned long i = 0; i <= queueLength; ++i) {
        ASSERT_FALSE(poster_.post("flood"));
    }
    auto reports = wait(*watcher);
    std::sort(reports.begin(), reports.end());
    EXPECT_EQ(reports, (std::vector<Report>{{"first", 1}, {"flood", queueLength + 1}}));
}

TEST_F(NotificationsTest, WatchingNeedsTheFolderAndEndsWithIt) {
    EXPECT_FALSE(qm::NotificationWatcher::open(dir_.file("elsewhere")).ok());
    auto watcher = qm::NotificationWatcher::open(dir_.path());
    ASSERT_TRUE(watcher.ok());
    ASSERT_EQ(::rmdir(dir_.file("notify").c_str()), 0);
    EXPECT_FALSE(watcher->waitForPosts(5s, [](const std::string&, std::uint64_t) {}).ok());
    EXPECT_FALSE(watcher->waitForPosts(0ms, [](const std::string&, std::uint64_t) {}).ok());
}

TEST(NotificationFiles, CountsAreDecimalDigitsThatFit64Bits) {
    const std::pair<const char*, std::optional<std::uint64_t>> cases[] = {
        {"12", 12},
        {"12\n", 12},
        {"0", 0},
        {"18446744073709551615", UINT64_MAX},
        {"18446744073709551616", std::nullopt},
        {"", std::nullopt},
        {"\n", std::nullopt},
        {"-1", std::nullopt},
        {"1a", std::nullopt},
        {" 1", std::nullopt},
    };
    for (const auto& [text, count] : cases) {
        EXPECT_EQ(qm::parseNotificationCount(text), count) << text;
    }
}

}  // namespace
