// Busy extension instances: running processes whose executable is that of
// a plug-in bundle with an asked identifier.

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>

#include "platform/file/PathFacts.h"
#include "platform/wardend/BusyInstances.h"
#include "support/ChildProcess.h"
#include "support/TempDir.h"

namespace qm {
void PrintTo(const BusyInstance& instance, std::ostream* out) {
    *out << "{pid " << instance.pid << ", " << instance.bundleIdentifier << "}";
}
}  // namespace qm

namespace {

using qm::BusyInstance;

const qm::Value kPlugInDeclaration = qm::Dictionary{{"VTExtensionPointName", "com.example.point"}};

class BusyInstances : public ::testing::Test {
protected:
    qmtest::TempDir temp;
    std::string root = *qm::resolvedPath(temp.path());
    // The scan sees every process: tests running beside this one must not
    // share its identifiers.
    std::string ext = "com.example.ext." + std::to_string(::getpid());
    std::string host = "com.example.host." + std::to_string(::getpid());

    // A bundle at root/<path> whose Info is `info`, and beside that Info its
    // executable, a copy of /bin/sleep.
    std::string makeBundle(const std::string& path, const qm::Dictionary& info, const std::string& executable) {
        qmtest::writePlist(root + "/" + path + "/Info.plist", info);
        std::filesystem::copy_file("/bin/sleep", root + "/" + path + "/" + executable);
        return root + "/" + path + "/" + executable;
    }

    qm::Dictionary plugInInfo(const std::string& identifier, const std::string& executable = "Ext") {
        return {{"MRBundleIdentifier", identifier}, {"MRBundleExecutable", executable}, {"VTExtension", kPlugInDeclaration}};
    }

    static std::vector<BusyInstance> busy(const std::set<std::string>& identifiers) {
        auto instances = qm::busyExtensionInstances(identifiers);
        EXPECT_TRUE(instances.ok());
        return instances ? *instances : std::vector<BusyInstance>{};
    }
};

// Which file /proc names and which bundle lies around it is
// BundleDirectory's to tell, for either layout: one layout is enough here.
TEST_F(BusyInstances, ARunningPlugInIsBusyUntilItIsKilled) {
    std::string program = makeBundle("Flat.app/PlugIns/Ext.xbun", plugInInfo(ext), "Ext");
    qmtest::ChildProcess first(program, "60");
    qmtest::ChildProcess second(program, "60");
    ASSERT_GT(first.pid(), 0);
    ASSERT_GT(second.pid(), 0);
    std::vector<BusyInstance> both = {{first.pid(), ext}, {second.pid(), ext}};
    std::sort(both.begin(), both.end(), [](const auto& a, const auto& b) { return a.pid < b.pid; });
    EXPECT_EQ(busy({ext, "com.example.other"}), both);
    EXPECT_EQ(busy({"com.example.other"}), std::vector<BusyInstance>{});
    first.kill();  // a zombie until reaped: no longer running the plug-in
    second.kill();
    EXPECT_EQ(busy({ext}), std::vector<BusyInstance>{});
}

// Each bundle holds an idle plug-in of the asked identifier, so an
// application's own process (the "not a plug-in" case) is seen to leave it idle.
TEST_F(BusyInstances, ProcessesOfNoIdentifiablePlugInAreNotBusy) {
    struct Case {
        const char* name;
        qm::Dictionary info;
        const char* running;  // the file started, beside the Info file
    } cases[] = {
        {"no identifier", {{"MRBundleExecutable", "Ext"}, {"VTExtension", kPlugInDeclaration}}, "Ext"},
        {"empty identifier", plugInInfo(""), "Ext"},
        {"not a plug-in", {{"MRBundleIdentifier", host}, {"MRBundleExecutable", "Host"}}, "Host"},
        {"not the bundle's executable", plugInInfo(ext, "Other"), "Ext"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        std::string program = makeBundle(std::string(c.name) + ".app", c.info, c.running);
        makeBundle(std::string(c.name) + ".app/PlugIns/Ext.xbun", plugInInfo(ext), "Ext");
        qmtest::ChildProcess child(program, "60");
        ASSERT_GT(child.pid(), 0);
        EXPECT_EQ(busy({ext, host, ""}), std::vector<BusyInstance>{});
    }

    std::string damaged = makeBundle("Damaged.xbun", plugInInfo(ext), "Ext");
    qmtest::writeFile(root + "/Damaged.xbun/Info.plist", "<plist><dict><key>");
    qmtest::ChildProcess unreadableInfo(damaged, "60");
    std::string deleted = makeBundle("Deleted.xbun", plugInInfo(ext), "Ext");
    qmtest::ChildProcess running(deleted, "60");
    ASSERT_EQ(::unlink(deleted.c_str()), 0);
    EXPECT_EQ(busy({ext}), std::vector<BusyInstance>{});
}

}  // namespace
