// Named notifications: count files posted by the daemon's side and observed
// through inotify by the clients' side.

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <filesystem>
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
#include "support/ScopedEnvironment.h"
#include "support/TempDir.h"

namespace {

using namespace std::chrono_literals;
using Report = std::pair<std::string, std::uint64_t>;
using Names = std::vector<std::string>;

Names sortedEntries(const std::string& folder) {
    auto names = qm::folderEntryNames(folder);
    Names sorted = names.ok() ? *names : Names{"(unreadable)"};
    std::sort(sorted.begin(), sorted.end());
    return sorted;
}

// Runtime directories live on tmpfs, as $XDG_RUNTIME_DIR does, where a
// rename costs microseconds rather than a journal entry.
std::optional<std::string> memoryBackedTemporaries() {
    if (std::filesystem::is_directory("/dev/shm")) {
        return "/dev/shm";
    }
    const char* current = std::getenv("TMPDIR");
    return current ? std::optional<std::string>(current) : std::nullopt;
}

// A runtime directory with a started poster in it.
class NotificationsTest : public ::testing::Test {
protected:
    NotificationsTest() : poster_(dir_.path()) { EXPECT_FALSE(poster_.reset()); }

    std::string notifyFile(const std::string& name) const { return dir_.file("notify/" + name); }

    static std::vector<Report> wait(qm::NotificationWatcher& watcher, std::chrono::milliseconds timeout = 5s) {
        std::vector<Report> reports;
        auto calls = watcher.waitForPosts(timeout, [&](const std::string& name, std::uint64_t count) {
            reports.emplace_back(name, count);
        });
        EXPECT_TRUE(calls.ok());
        EXPECT_EQ(calls.ok() ? *calls : 0, reports.size());
        return reports;
    }

    qmtest::ScopedEnvironment temporaries_{"TMPDIR", memoryBackedTemporaries()};
    qmtest::TempDir dir_;
    qm::NotificationPoster poster_;
};

TEST_F(NotificationsTest, APostIsInItsFileWhenItReturnsUntilAResetStartsAgain) {
    std::vector<Report> observed;
    poster_.setObserver([&](const std::string& name, std::uint64_t count) { observed.emplace_back(name, count); });
    for (const char* name : {"ovaro.quamber.annotation-change", "other", "ovaro.quamber.annotation-change"}) {
        ASSERT_FALSE(poster_.post(name));
        EXPECT_EQ(qmtest::readFile(notifyFile(name)), std::to_string(poster_.count(name)));
    }
    for (const std::string& bad : {std::string(), std::string(".hidden"), std::string("a/b"), std::string(201, 'n'),
                                   std::string("a\0b", 3)}) {
        EXPECT_EQ(poster_.post(bad).value_or(qm::Error{}).code, EINVAL) << bad;
    }
    EXPECT_EQ(observed, (std::vector<Report>{{"ovaro.quamber.annotation-change", 1}, {"other", 1},
                                             {"ovaro.quamber.annotation-change", 2}}));
    EXPECT_EQ(sortedEntries(dir_.file("notify")), (Names{"other", "ovaro.quamber.annotation-change"}));
    auto absent = qm::readNotificationCount(dir_.file("notify"), "never-posted");
    EXPECT_TRUE(absent.ok() && *absent == 0);

    // A reset makes a private folder again and restarts the counts.
    qmtest::writeFile(notifyFile(".post.leftover"), "");
    ASSERT_EQ(::chmod(dir_.file("notify").c_str(), 0755), 0);

    ASSERT_FALSE(poster_.reset());
    EXPECT_EQ(static_cast<unsigned>(std::filesystem::status(dir_.file("notify")).permissions()), 0700u);
    EXPECT_TRUE(sortedEntries(dir_.file("notify")).empty());
    EXPECT_EQ(poster_.count("other"), 0u);
    ASSERT_FALSE(poster_.post("other"));
    EXPECT_EQ(qmtest::readFile(notifyFile("other")), "1");

    qm::NotificationPoster nowhere(dir_.file("missing"));
    EXPECT_TRUE(nowhere.reset());
    EXPECT_TRUE(nowhere.post("n"));
    EXPECT_EQ(nowhere.count("n"), 1u);  // counted though not written
}

// On the disk-backed temporary folder, where each write takes long enough
// for posts from several threads to overlap.
TEST(NotificationPoster, ConcurrentPostsNeverPutAnOlderCountBack) {
    qmtest::TempDir dir;
    qm::NotificationPoster poster(dir.path());
    ASSERT_FALSE(poster.reset());
    std::atomic<bool> posting{true};
    int regressions = 0;
    std::thread reader([&] {
        for (std::uint64_t last = 0; posting.load();) {
            auto count = qm::readNotificationCount(dir.file("notify"), "busy");
            regressions += count.ok() && *count < last ? 1 : 0;
            last = count.ok() ? std::max(last, *count) : last;
        }
    });
    {
        std::vector<std::jthread> posters;
        for (int t = 0; t < 3; ++t) {
            posters.emplace_back([&] {
                for (int i = 0; i < 300; ++i) {
                    EXPECT_FALSE(poster.post("busy"));
                }
            });
        }
    }
    posting = false;
    reader.join();
    EXPECT_EQ(regressions, 0);
    EXPECT_EQ(qmtest::readFile(dir.file("notify/busy")), "900");
    EXPECT_EQ(sortedEntries(dir.file("notify")), Names{"busy"});
}

TEST_F(NotificationsTest, AWatcherReportsEachLandingWithItsCountUntilTheFolderGoes) {
    EXPECT_FALSE(qm::NotificationWatcher::open(dir_.file("elsewhere")).ok());
    auto watcher = qm::NotificationWatcher::open(dir_.path());
    ASSERT_TRUE(watcher.ok());
    EXPECT_TRUE(wait(*watcher, 20ms).empty());

    ASSERT_FALSE(poster_.post("a"));
    EXPECT_EQ(wait(*watcher), (std::vector<Report>{{"a", 1}}));
    for (const char* name : {"a", "b", "a"}) {  // read together: one report per name
        ASSERT_FALSE(poster_.post(name));
    }
    EXPECT_EQ(wait(*watcher), (std::vector<Report>{{"a", 3}, {"b", 1}}));

    qmtest::writeFile(notifyFile("c"), "5");  // written in place: no post
    EXPECT_TRUE(wait(*watcher, 20ms).empty());

    ASSERT_FALSE(poster_.reset());
    ASSERT_EQ(::rmdir(dir_.file("notify").c_str()), 0);
    EXPECT_FALSE(watcher->waitForPosts(5s, [](const std::string&, std::uint64_t) {}).ok());
    EXPECT_FALSE(watcher->waitForPosts(0ms, [](const std::string&, std::uint64_t) {}).ok());
}

TEST_F(NotificationsTest, AnOverflowReportsEveryName) {
    auto watcher = qm::NotificationWatcher::open(dir_.path());
    ASSERT_TRUE(watcher.ok());
    unsigned long queueLength = 16384;
    std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> queueLength;
    // Two names in turn: the kernel folds an event into an identical last one.
    for (unsigned long i = 0; i <= queueLength; ++i) {
        ASSERT_FALSE(poster_.post(i % 2 == 0 ? "even" : "odd"));
    }
    ASSERT_FALSE(poster_.post("late"));  // its event is lost to the full queue
    auto reports = wait(*watcher);
    std::sort(reports.begin(), reports.end());
    EXPECT_EQ(reports,
              (std::vector<Report>{{"even", poster_.count("even")}, {"late", 1}, {"odd", poster_.count("odd")}}));
}

TEST(NotificationFiles, CountsAreDecimalDigitsThatFit64Bits) {
    const std::pair<const char*, std::optional<std::uint64_t>> cases[] = {
        {"12", 12}, {"12\n", 12}, {"0", 0}, {"18446744073709551615", UINT64_MAX},
        {"18446744073709551616", std::nullopt}, {"", std::nullopt}, {"\n", std::nullopt},
        {"-1", std::nullopt}, {"1a", std::nullopt}, {" 1", std::nullopt},
    };
    for (const auto& [text, count] : cases) {
        EXPECT_EQ(qm::parseNotificationCount(text), count) << text;
    }
}

}  // namespace
