// The annotation store: what a damaged file leaves, how annotations merge,
// and that a writer killed at any instant leaves a whole file.

#include <gtest/gtest.h>

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <random>

#include "platform/plist/PropertyList.h"
#include "registry/QMDAnnotationStore.h"
#include "support/LogCapture.h"
#include "support/ScopedEnvironment.h"
#include "support/TempDir.h"

namespace {

using qm::Dictionary;
using qm::Value;

std::unique_ptr<QMDAnnotationStore> openStore(const std::string& path) {
    auto store = QMDAnnotationStore::initWithDatabase(path);
    EXPECT_TRUE(store) << store.error().text();
    return std::move(store).value();
}

TEST(AnnotationStore, AFileItCannotUseStartsAnEmptyTableAndSaysWhy) {
    struct Case {
        const char* name;
        std::optional<std::string> content;  // none: no file
        std::string logged;                  // empty: nothing logged
    };
    const Case cases[] = {
        {"absent", std::nullopt, ""},
        {"version 15", R"(<plist version="1.0"><dict><key>version</key><integer>15</integer><key>data</key><dict><key>x</key><dict/></dict></dict></plist>)",
         "found database version 15 needed version 16"},
        {"no version", R"(<plist version="1.0"><dict><key>data</key><dict/></dict></plist>)",
         "found database version 0 needed version 16"},
        {"not a property list", "garbage", "unable to load annotation database:"},
        {"data not a dictionary", R"(<plist version="1.0"><dict><key>version</key><integer>16</integer><key>data</key><string>x</string></dict></plist>)",
         "no \"data\" dictionary"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        qmtest::TempDir dir;
        std::string path = dir.file("Annotations");
        if (c.content) {
            qmtest::writeFile(path, *c.content);
        }
        qmtest::LogCapture log;
        auto store = openStore(path);
        EXPECT_FALSE(store->annotationForIdentifier("x"));
        if (c.logged.empty()) {
            EXPECT_TRUE(log.lines().empty()) << log.text();
        } else {
            EXPECT_TRUE(log.contains(c.logged)) << log.text();
            EXPECT_TRUE(log.contains("(resetting)")) << log.text();
        }
        // The next change writes a whole, current file.
        store->setAnnotationForIdentifier(Dictionary{{"election", Value(1)}}, "x");
        auto written = qm::plist::readFile(path);
        ASSERT_TRUE(written);
        EXPECT_EQ(*written, Value(Dictionary{{"version", Value(16)},
                                             {"data", Value(Dictionary{{"x", Value(Dictionary{{"election", Value(1)}})}})}}));
    }
}

TEST(AnnotationStore, ChangesMergeByKeyAndSurviveAReopen) {
    qmtest::TempDir dir;
    std::string path = dir.file("Annotations");
    auto store = openStore(path);
    store->setAnnotationForIdentifier(Dictionary{{"election", Value(2)}}, "p");
    store->setAnnotationForIdentifier(Dictionary{{"extension", Value(Dictionary{{"a", Value(1)}})}}, "p");
    store->setAnnotationForIdentifier(Dictionary{{"extension", Value(Dictionary{{"b", Value(2)}})}}, "p");
    Value expected(Dictionary{{"election", Value(2)}, {"extension", Value(Dictionary{{"b", Value(2)}})}});
    EXPECT_EQ(store->annotationForIdentifier("p"), expected);
    EXPECT_EQ(openStore(path)->annotationForIdentifier("p"), expected) << "not what the file holds";
}

TEST(AnnotationStore, AFailedSaveIsLoggedAndTheChangeKeptInMemory) {
    qmtest::TempDir dir;
    qmtest::LogCapture log;
    auto store = openStore(dir.file("missing-folder/Annotations"));
    EXPECT_TRUE(log.lines().empty()) << "a file that is not there loads silently: " << log.text();
    store->setAnnotationForIdentifier(Dictionary{{"election", Value(3)}}, "p");
    EXPECT_TRUE(log.contains("unable to save annotations:")) << log.text();
    EXPECT_EQ(store->annotationForIdentifier("p"), Value(Dictionary{{"election", Value(3)}}));
}

TEST(AnnotationStore, TheDefaultFileLiesInAPrivateFolderOfTheStateDirectory) {
    qmtest::TempDir dir;
    qmtest::ScopedEnvironment state("XDG_STATE_HOME", dir.file("state"));
    auto path = QMDAnnotationStore::defaultDatabasePath();
    ASSERT_TRUE(path) << path.error().text();
    EXPECT_EQ(*path, dir.file("state") + "/ovaro.quamber/Annotations");
    struct stat info{};
    ASSERT_EQ(::stat((dir.file("state") + "/ovaro.quamber").c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 07777, 0700u);
}

// A writer killed at any instant leaves either the old or the new file, whole.
TEST(AnnotationStore, AWriterKilledAtAnyInstantLeavesAWholeFile) {
    qmtest::TempDir dir;
    std::string path = dir.file("Annotations");
    openStore(path)->setAnnotationForIdentifier(Dictionary{{"election", Value(0)}}, "p");
    std::mt19937 random(12345);
    for (int round = 0; round < 20; ++round) {
        pid_t child = ::fork();
        if (child == 0) {
            auto store = QMDAnnotationStore::initWithDatabase(path);
            for (std::int64_t i = 1;; ++i) {
                (*store)->setAnnotationForIdentifier(Dictionary{{"election", Value(i)}}, "p");
            }
        }
        ::usleep(static_cast<useconds_t>(std::uniform_int_distribution<int>(1000, 20000)(random)));
        ::kill(child, SIGKILL);
        ::waitpid(child, nullptr, 0);
        auto file = qm::plist::readFile(path);
        ASSERT_TRUE(file) << "round " << round << ": " << file.error().text();
        const qm::Value* data = file->get("data");
        ASSERT_TRUE(data && data->get("p") && data->get("p")->get("election")) << file->description();
    }
}

}  // namespace
