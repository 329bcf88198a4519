// Service registrations: the files D/services/<host pid>/<bundle id>.plist,
// their host folders, and their removal.

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/file/FolderEntries.h"
#include "platform/launcher/ServiceLauncher.h"
#include "platform/plist/PropertyList.h"
#include "platform/process/ProcessInfo.h"
#include "support/ChildProcess.h"
#include "support/TempDir.h"

namespace {

qm::Value registration(const std::string& identifier, const std::string& version, const std::string& profile = "plugin") {
    return qm::Dictionary{{"DuctService", qm::Dictionary{{"_OmitSandboxParameters", true}, {"_SandboxProfile", profile}}},
                          {"MRBundleIdentifier", identifier},
                          {"MRBundleVersion", version}};
}

class ServiceLauncher : public ::testing::Test {
protected:
    qmtest::TempDir runtime;
    const std::string& D = runtime.path();
    pid_t self = ::getpid();

    std::string hostFolder(pid_t pid) const { return D + "/services/" + std::to_string(pid); }
    static std::vector<std::string> namesIn(const std::string& folder) {
        auto found = qm::folderEntryNames(folder);
        std::vector<std::string> names = found ? *found : std::vector<std::string>{};
        std::sort(names.begin(), names.end());
        return names;
    }
    // A host folder as a registration leaves it, for a pid and start time of our choosing.
    void makeHostFolder(const std::string& name, std::optional<std::string> startTime) {
        qmtest::writeFile(D + "/services/" + name + "/com.example.ext.plist", "stale");
        if (startTime) {
            qmtest::writeFile(D + "/services/" + name + "/.host-start-time", *startTime + "\n");
        }
    }
};

TEST_F(ServiceLauncher, ARegistrationIsTheGivenDictionaryAsXmlAndTheLastOneWins) {
    ASSERT_FALSE(qm::addExternalService(D, self, registration("com.example.ext", "1.0")));
    ASSERT_FALSE(qm::addExternalService(D, self, registration("com.example.ext", "2.0", "keyboard")));
    EXPECT_EQ(namesIn(hostFolder(self)), (std::vector<std::string>{".host-start-time", "com.example.ext.plist"}));
    // The launcher's part is the format and the content; how XML spells a
    // dictionary is the property list's.
    std::string file = hostFolder(self) + "/com.example.ext.plist";
    EXPECT_TRUE(qmtest::readFile(file).starts_with("<?xml")) << qmtest::readFile(file);
    auto written = qm::plist::readFile(file);
    ASSERT_TRUE(written.ok()) << written.error().text();
    EXPECT_EQ(*written, registration("com.example.ext", "2.0", "keyboard")) << written->description();
}

TEST_F(ServiceLauncher, RegistrationsThatCannotNameAFileOrAHostAreRefused) {
    qmtest::ChildProcess exited("/bin/sleep", "60");
    exited.kill();
    exited.reap();
    struct Case {
        const char* name;
        pid_t host;
        qm::Value registration;
        int errorNumber;
    } cases[] = {
        {"empty identifier", self, registration("", "1"), EINVAL},
        {"identifier with a slash", self, registration("../escape", "1"), EINVAL},
        {"identifier starting with a dot", self, registration(".host-start-time", "1"), EINVAL},
        {"identifier that is not a string", self,
         qm::Value(qm::Dictionary{{"MRBundleIdentifier", 7}, {"MRBundleVersion", "1"}}), EINVAL},
        {"no identifier", self, qm::Value(qm::Dictionary{{"MRBundleVersion", "1"}}), EINVAL},
        {"not a dictionary", self, qm::Value("com.example.ext"), EINVAL},
        {"exited host", exited.pid(), registration("com.example.ext", "1"), ESRCH},
        {"no such host", -1, registration("com.example.ext", "1"), ESRCH},
    };
    for (const Case& c : cases) {
        auto refused = qm::addExternalService(D, c.host, c.registration);
        ASSERT_TRUE(refused) << c.name;
        EXPECT_EQ(refused->code, c.errorNumber) << c.name;
    }
    EXPECT_FALSE(std::filesystem::exists(D + "/services")) << "a refusal writes nothing";
}

TEST_F(ServiceLauncher, HostsAreToldApartByTheirStartTime) {
    std::this_thread::sleep_for(std::chrono::milliseconds(50));  // five clock ticks
    std::string oddName = runtime.file("sleep) (x");             // the command name holds parentheses
    std::filesystem::copy_file("/bin/sleep", oddName);
    qmtest::ChildProcess child(oddName, "60");
    auto mine = qm::processStartTime(self);
    auto theirs = qm::processStartTime(child.pid());
    ASSERT_TRUE(mine && theirs);
    EXPECT_LT(*mine, *theirs);
    double uptime = 0;
    std::ifstream("/proc/uptime") >> uptime;
    EXPECT_LE(*theirs, static_cast<std::uint64_t>((uptime + 1) * static_cast<double>(::sysconf(_SC_CLK_TCK))));
    child.kill();
    child.reap();
    EXPECT_FALSE(qm::processStartTime(child.pid()));
}

TEST_F(ServiceLauncher, FoldersOfExitedHostsGoAtStartAndAtTheNextRegistration) {
    qmtest::ChildProcess exited("/bin/sleep", "60");
    exited.kill();
    exited.reap();
    std::string myStart = std::to_string(*qm::processStartTime(self));
    auto makeStaleFolders = [&] {
        makeHostFolder(std::to_string(exited.pid()), myStart);    // pid gone
        makeHostFolder(std::to_string(self), myStart + "1");      // pid recycled
        makeHostFolder("1", std::nullopt);                        // start time never recorded
    };
    makeStaleFolders();
    makeHostFolder("notes", std::nullopt);  // not a host's: left alone
    EXPECT_EQ(qm::removeExitedHostRegistrations(D), 3u);
    EXPECT_EQ(namesIn(D + "/services"), std::vector<std::string>{"notes"});

    makeStaleFolders();
    ASSERT_FALSE(qm::addExternalService(D, self, registration("com.example.new", "1")));
    EXPECT_EQ(namesIn(D + "/services"), (std::vector<std::string>{std::to_string(self), "notes"}));
    EXPECT_EQ(namesIn(hostFolder(self)), (std::vector<std::string>{".host-start-time", "com.example.new.plist"}));
    EXPECT_EQ(qm::removeExitedHostRegistrations(D), 0u) << "a running host keeps its folder";
}

TEST_F(ServiceLauncher, RemovalTakesEveryHostsRegistrationOfThatVersion) {
    qmtest::ChildProcess other("/bin/sleep", "60");
    ASSERT_FALSE(qm::addExternalService(D, self, registration("com.example.ext", "1.0")));
    ASSERT_FALSE(qm::addExternalService(D, self, registration("com.example.keep", "1.0")));
    ASSERT_FALSE(qm::addExternalService(D, other.pid(), registration("com.example.ext", "1.0")));

    EXPECT_EQ(qm::removeExternalService(D, "com.example.ext", "2.0"), qm::kNoSuchService);
    EXPECT_EQ(qm::removeExternalService(D, "com.example.ext", "1.0"), qm::kServiceRemoved);
    EXPECT_EQ(namesIn(hostFolder(self)), (std::vector<std::string>{".host-start-time", "com.example.keep.plist"}));
    EXPECT_FALSE(std::filesystem::exists(hostFolder(other.pid()))) << "a host left without registrations";
    EXPECT_EQ(qm::removeExternalService(D, "com.example.ext", "1.0"), qm::kNoSuchService);
    for (const char* identifier : {"", ".host-start-time", "../services"}) {
        EXPECT_EQ(qm::removeExternalService(D, identifier, "1.0"), qm::kNoSuchService) << identifier;
    }
    EXPECT_EQ(namesIn(hostFolder(self)), (std::vector<std::string>{".host-start-time", "com.example.keep.plist"}));
}

}  // namespace
