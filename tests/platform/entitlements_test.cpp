#include "platform/codesign/Entitlements.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <tuple>

#include "support/LogCapture.h"
#include "support/TempDir.h"

namespace {

using qmtest::LogCapture;

constexpr uid_t kNobody = 65534;

const qm::Value kGranted(qm::Dictionary{{"ovaro.developer.replace-plugin", true},
                                        {"ovaro.developer.quamber.allowedplugins", qm::Value(qm::Array{"com.example.a"})}});

// A bundle whose info folder and Entitlements.plist have trustworthy modes.
struct Bundle {
    explicit Bundle(bool desktopStyle) {
        path = dir.file(desktopStyle ? "Desk.app" : "Flat.app");
        infoFolder = desktopStyle ? path + "/Contents" : path;
        entitlements = infoFolder + "/Entitlements.plist";
        qmtest::writePlist(infoFolder + "/Info.plist", qm::Dictionary{{"MRBundleIdentifier", "x"}});
        write(kGranted);
        EXPECT_EQ(::chmod(infoFolder.c_str(), 0755), 0);
    }
    void write(const qm::Value& value) {
        qmtest::writePlist(entitlements, value);
        EXPECT_EQ(::chmod(entitlements.c_str(), 0644), 0);
    }
    std::optional<qm::Value> read() const { return qm::readEntitlements(*qm::BundleDirectory::atPath(path)); }

    qmtest::TempDir dir;
    std::string path, infoFolder, entitlements;
};

TEST(Entitlements, ATrustedFileBesideEitherLayoutsInfoIsHonouredSilently) {
    for (bool desktopStyle : {false, true}) {
        Bundle bundle(desktopStyle);
        LogCapture log;
        EXPECT_EQ(bundle.read(), kGranted);
        EXPECT_TRUE(log.lines().empty()) << log.text();
        ASSERT_EQ(::unlink(bundle.entitlements.c_str()), 0);
        EXPECT_EQ(bundle.read(), std::nullopt) << "no file: no entitlements, and nothing to say";
        EXPECT_TRUE(log.lines().empty()) << log.text();
    }
}

// An untrusted or unreadable file gives no entitlements and exactly one line.
TEST(Entitlements, AFileThatCannotBeTrustedIsRefusedWithOneLine) {
    // {what, how the bundle is spoilt, what its one line says}
    const std::tuple<const char*, std::function<void(Bundle&)>, std::string> cases[] = {
        {"group-writable folder", [](Bundle& b) { ::chmod(b.infoFolder.c_str(), 0775); }, "writable by group or others"},
        {"world-writable folder", [](Bundle& b) { ::chmod(b.infoFolder.c_str(), 0757); }, "writable by group or others"},
        {"group-writable file", [](Bundle& b) { ::chmod(b.entitlements.c_str(), 0664); }, "writable by group or others"},
        {"world-writable file", [](Bundle& b) { ::chmod(b.entitlements.c_str(), 0646); }, "writable by group or others"},
        {"symbolic link",
         [](Bundle& b) {
             std::string elsewhere = b.dir.file("trusted-elsewhere.plist");
             ::rename(b.entitlements.c_str(), elsewhere.c_str());
             ::symlink(elsewhere.c_str(), b.entitlements.c_str());
         },
         "symbolic link"},
        {"a folder in its place",
         [](Bundle& b) {
             ::unlink(b.entitlements.c_str());
             ::mkdir(b.entitlements.c_str(), 0755);
         },
         "not a regular file"},
        {"not a dictionary", [](Bundle& b) { b.write(qm::Value(qm::Array{"ovaro.developer.replace-plugin"})); }, "not a dictionary"},
        {"broken",
         [](Bundle& b) {
             qmtest::writeFile(b.entitlements, "<plist version=\"1.0\"><dict><key>oops</key>");
             ::chmod(b.entitlements.c_str(), 0644);
         },
         "entitlements unreadable"},
        {"file of another user", [](Bundle& b) { EXPECT_EQ(::chown(b.entitlements.c_str(), kNobody, kNobody), 0); },
         "owned by uid 65534"},
        {"folder of another user", [](Bundle& b) { EXPECT_EQ(::chown(b.infoFolder.c_str(), kNobody, kNobody), 0); },
         "owned by uid 65534"},
    };
    for (const auto& [what, spoil, logged] : cases) {
        SCOPED_TRACE(what);
        if (logged.starts_with("owned by") && ::geteuid() != 0) {
            continue;  // changing an owner needs root
        }
        Bundle bundle(false);
        spoil(bundle);
        LogCapture log;
        EXPECT_EQ(bundle.read(), std::nullopt);
        ASSERT_EQ(log.lines().size(), 1u) << log.text();
        EXPECT_NE(log.lines()[0].find(logged), std::string::npos) << log.lines()[0];
    }
}

}  // namespace
