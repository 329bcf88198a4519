#include "platform/catalog/AppCatalog.h"
#include "platform/catalog/PlugInBundleReader.h"
#include "platform/catalog/PlugInDeclarations.h"

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cmath>
#include <filesystem>
#include <functional>
#include <mutex>
#include <set>
#include <tuple>

#include "platform/file/PathFacts.h"
#include "platform/plist/PropertyList.h"
#include "support/LogCapture.h"
#include "support/TempDir.h"

namespace {

namespace fs = std::filesystem;
using qm::AppCatalog;
using qm::PlugInRecordPtr;
using qm::Value;
using qmtest::eventually;
using qmtest::LogCapture;
using qmtest::writePlist;

using Dict = qm::Dictionary;

// A plug-in bundle's Info: new style unless told, with an executable unless
// it is a data plug-in.
Dict plugInInfo(const std::string& identifier, const std::string& point, bool oldStyle = false,
                bool executable = true) {
    Dict info{{"MRBundleIdentifier", identifier}, {"MRBundleName", identifier + " name"}};
    if (oldStyle) {
        info.set("Quamber", Dict{{"Attributes", Dict{{"ovaro.protocol", point}}}});
    } else {
        info.set("VTExtension", Dict{{"VTExtensionAttributes", Dict{{"VTExtensionPointName", point}}}});
    }
    if (executable) {
        info.set("MRBundleExecutable", "run");
    }
    return info;
}

// Writes Info.plist (desktop style: Contents/Info.plist); returns the bundle.
std::string writeBundle(const std::string& bundle, const Dict& info, bool desktop = false) {
    writePlist(bundle + (desktop ? "/Contents/Info.plist" : "/Info.plist"), info);
    return bundle;
}

// Records what it is told; checks that lookups, which never wait for the
// catalog's thread, already answer for what it is told was installed.
class Recorder : public qm::AppCatalogObserver {
public:
    using Records = std::vector<PlugInRecordPtr>;
    const AppCatalog* catalog = nullptr;
    std::atomic<int> unseen{0};

    void pluginsDidInstall(const Records& records) override {
        for (const auto& record : records) {
            unseen += catalog->plugInWithUuid(record->uuid) == record ? 0 : 1;
        }
        add(installed_, records);
    }
    void pluginsWillUninstall(const Records& records) override { add(uninstalled_, records); }
    Records installed() const { return copy(installed_); }
    Records uninstalled() const { return copy(uninstalled_); }

private:
    void add(Records& list, const Records& records) {
        std::lock_guard lock(mutex_);
        list.insert(list.end(), records.begin(), records.end());
    }
    Records copy(const Records& list) const {
        std::lock_guard lock(mutex_);
        return list;
    }
    mutable std::mutex mutex_;
    Records installed_, uninstalled_;
};

std::set<std::string> identifiers(const Recorder::Records& records) {
    std::set<std::string> ids;
    for (const auto& r : records) {
        ids.insert(r->identifier);
    }
    return ids;
}

// A system root, a user root, a database and a containers folder in one
// temporary directory; catalogs opened on them with a fresh observer each.
class AppCatalogTest : public ::testing::Test {
protected:
    AppCatalogTest() : base(*qm::resolvedPath(dir.path())) {}

    qm::AppCatalogOptions options() const {
        return {.databasePath = databasePath, .systemRoots = {systemRoot, base + "/missing-root"}, .userRoot = userRoot,
                .containersDirectory = containers, .language = "fr", .lockTimeout = std::chrono::milliseconds(200)};
    }

    void open(const std::optional<qm::AppCatalogOptions>& given = std::nullopt) {
        catalog.reset();
        recorder = std::make_shared<Recorder>();
        auto opened = AppCatalog::open(given ? *given : options());
        ASSERT_TRUE(opened) << opened.error().text();
        catalog = std::move(opened).value();
        recorder->catalog = catalog.get();
        catalog->addObserver(recorder);
        catalog->start();
        catalog->waitUntilReady();
    }

    void TearDown() override {
        ASSERT_TRUE(recorder);
        EXPECT_EQ(recorder->unseen.load(), 0);
    }

    PlugInRecordPtr byIdentifier(const std::string& identifier) const {
        for (const auto& record : catalog->installedPlugIns()) {
            if (record->identifier == identifier) {
                return record;
            }
        }
        return nullptr;
    }

    qmtest::TempDir dir;
    std::string base;
    std::string systemRoot = base + "/system";
    std::string userRoot = base + "/user/Applications";
    std::string containers = base + "/data/Containers";
    std::string databasePath = base + "/data/AppCatalog.db";
    std::shared_ptr<Recorder> recorder;
    std::unique_ptr<AppCatalog> catalog;
};

TEST_F(AppCatalogTest, ScanFindsPlugInsOfBothLayoutsAndEveryMultipleEntry) {
    std::string flatApp = systemRoot + "/Flat.app";
    std::string deskApp = systemRoot + "/Desk.app";
    writeBundle(flatApp, {{"MRBundleName", "Flat"}, {"MRBundleDisplayName", "Flat Display"}});
    writePlist(flatApp + "/fr.lproj/InfoPlist.strings", Dict{{"MRBundleDisplayName", "Plat"}});
    writeBundle(flatApp + "/PlugIns/New.bundle", plugInInfo("com.new", "point.a"));
    writePlist(flatApp + "/PlugIns/New.bundle/Entitlements.plist", Dict{{"ent.x", true}});
    writePlist(flatApp + "/PlugIns/New.bundle/fr.lproj/InfoPlist.strings", Dict{{"MRBundleName", "Nouveau"}});
    writeBundle(flatApp + "/PlugIns/Data.bundle", plugInInfo("com.data", "point.a", false, false));
    writeBundle(flatApp + "/PlugIns/Plain.bundle", {{"MRBundleIdentifier", "com.plain"}});
    writeBundle(deskApp + "/Contents/PlugIns/Old.bundle", plugInInfo("com.old", "point.b", true), true);
    Dict multiple = plugInInfo("com.multi.bundle", "point.top");
    Dict entryOwn{{"VTExtensionAttributes", Dict{{"VTExtensionPointName", "point.own"}}}};
    multiple.set("VTExtension", multiple.find("VTExtension")->asDictionary()->changing(
                                    "Multiple", Dict{{"com.multi.b", entryOwn}, {"com.multi.a", Dict{{"Other", 1}}}}));
    writeBundle(deskApp + "/Contents/PlugIns/Multi.bundle", multiple, true);
    writeBundle(systemRoot + "/NotAnApp/PlugIns/Lost.bundle", plugInInfo("com.lost", "point.a"));
    writeBundle(userRoot + "/User.app/PlugIns/User.bundle", plugInInfo(".hidden", "point.a"));
    fs::create_directories(systemRoot + "/Empty.app");

    LogCapture log;
    open();
    EXPECT_TRUE(log.contains("missing-root")) << log.text();

    struct Expected {
        const char *identifier, *bundle, *point, *application;
        bool system, container;
    };
    const Expected table[] = {
        {"com.new", "/system/Flat.app/PlugIns/New.bundle", "point.a", "/system/Flat.app", true, true},
        {"com.data", "/system/Flat.app/PlugIns/Data.bundle", "point.a", "/system/Flat.app", true, false},
        {"com.old", "/system/Desk.app/Contents/PlugIns/Old.bundle", "point.b", "/system/Desk.app", true, true},
        {"com.multi.a", "/system/Desk.app/Contents/PlugIns/Multi.bundle", "point.top", "/system/Desk.app", true, true},
        {"com.multi.b", "/system/Desk.app/Contents/PlugIns/Multi.bundle", "point.own", "/system/Desk.app", true, true},
        {".hidden", "/user/Applications/User.app/PlugIns/User.bundle", "point.a", "/user/Applications/User.app", false,
         false},
    };
    ASSERT_EQ(catalog->installedPlugIns().size(), std::size(table));
    EXPECT_EQ(recorder->installed().size(), std::size(table));
    for (const auto& expected : table) {
        SCOPED_TRACE(expected.identifier);
        PlugInRecordPtr record = byIdentifier(expected.identifier);
        ASSERT_TRUE(record);
        EXPECT_EQ(record->bundlePath, base + expected.bundle);
        EXPECT_EQ(record->extensionPoint, expected.point);
        ASSERT_TRUE(record->containingApplication);
        EXPECT_EQ(record->containingApplication->path, base + expected.application);
        EXPECT_EQ(record->onSystemVolume, expected.system);
        EXPECT_EQ(record->dataContainerPath.has_value(), expected.container);
        EXPECT_EQ(catalog->plugInWithUuid(record->uuid), record);
        EXPECT_TRUE(qm::stringAt(record->infoDictionary, "MRBundleInfoPlistURL").value_or("").starts_with("file://" + base));
    }

    PlugInRecordPtr fresh = byIdentifier("com.new");
    EXPECT_EQ(fresh->localizedShortName, "Nouveau");
    EXPECT_EQ(fresh->localizedName, "Nouveau");
    EXPECT_EQ(fresh->containingApplication->localizedName, "Plat");
    EXPECT_EQ(fresh->entitlements, Value(Dict{{"ent.x", true}}));
    EXPECT_EQ(fresh->dataContainerPath, containers + "/com.new");
    EXPECT_EQ(byIdentifier("com.multi.b")->plugInDictionary, Value(entryOwn));

    // A bundle with several plug-ins answers the first by identifier.
    EXPECT_EQ(catalog->plugInAtPath(deskApp + "/Contents/PlugIns/Multi.bundle/")->identifier, "com.multi.a");
    auto desk = catalog->applicationAtPath(deskApp);
    ASSERT_TRUE(desk);
    ASSERT_EQ(desk->plugIns.size(), 3u);
    EXPECT_EQ(desk->plugIns[0]->identifier, "com.multi.a");
    EXPECT_EQ(desk->plugIns[2]->identifier, "com.old");
    auto empty = catalog->applicationAtPath(systemRoot + "/Empty.app");
    ASSERT_TRUE(empty);
    EXPECT_TRUE(empty->plugIns.empty());
    EXPECT_FALSE(catalog->applicationAtPath(systemRoot + "/NotAnApp"));
}

TEST_F(AppCatalogTest, ExtensionPointQueryFiltersOnIdentifierAndEntitlements) {
    for (const char* name : {"b", "a", "c"}) {
        std::string bundle = writeBundle(userRoot + "/Q.app/PlugIns/" + name + ".bundle",
                                         plugInInfo(std::string("q.") + name, name == std::string("c") ? "other" : "p"));
        writePlist(bundle + "/Entitlements.plist", Dict{{"grade", name}});
    }
    open();
    struct Case {
        std::vector<std::string> points;
        qm::PlugInFilter filter;
        std::vector<std::string> expected;
    };
    auto notB = [](const std::string& id, const std::optional<Value>&) { return id != "q.b"; };
    auto gradeC = [](const std::string&, const std::optional<Value>& entitlements) {
        return entitlements && *entitlements->get("grade")->asString() == "c";
    };
    const Case cases[] = {
        {{"p"}, {}, {"q.a", "q.b"}},
        {{"p", "other", "p"}, {}, {"q.a", "q.b", "q.c"}},
        {{"p", "other"}, notB, {"q.a", "q.c"}},
        {{"p", "other"}, gradeC, {"q.c"}},
        {{"nowhere"}, {}, {}},
    };
    for (const auto& c : cases) {
        std::vector<std::string> got;
        for (const auto& record : catalog->plugInsForExtensionPoints(c.points, c.filter)) {
            got.push_back(record->identifier);
        }
        EXPECT_EQ(got, c.expected);
    }
}

TEST_F(AppCatalogTest, RestartKeepsIdentityAndReadsOnlyWhatChanged) {
    std::string plugIns = userRoot + "/R.app/PlugIns/";
    writeBundle(plugIns + "Same.bundle", plugInInfo("r.same", "p"));
    writeBundle(plugIns + "Changed.bundle", plugInInfo("r.changed", "p"));
    std::string entitled = writeBundle(plugIns + "Entitled.bundle", plugInInfo("r.entitled", "p"));
    writePlist(plugIns + "Same.bundle/de.lproj/InfoPlist.strings", Dict{{"MRBundleName", "Gleich"}});
    writeBundle(plugIns + "Gone.bundle", plugInInfo("r.gone", "p"));
    std::string outside = writeBundle(base + "/loose/Added.bundle", plugInInfo("r.added", "p"));
    open();
    ASSERT_FALSE(catalog->registerPlugIn(outside));
    auto before = catalog->installedPlugIns();
    ASSERT_EQ(before.size(), 5u);
    PlugInRecordPtr same = byIdentifier("r.same");
    EXPECT_EQ(same->localizedShortName, "r.same name");
    EXPECT_FALSE(byIdentifier("r.added")->onSystemVolume);

    open();  // nothing changed
    EXPECT_EQ(catalog->infoFilesParsed(), 0u);
    EXPECT_TRUE(recorder->installed().empty());
    EXPECT_TRUE(recorder->uninstalled().empty());
    auto after = catalog->installedPlugIns();
    ASSERT_EQ(after.size(), before.size());
    for (std::size_t i = 0; i < after.size(); ++i) {
        EXPECT_EQ(after[i]->uuid, before[i]->uuid);
        EXPECT_EQ(after[i]->registrationDate, before[i]->registrationDate);
        double seconds = after[i]->registrationDate.secondsSince1970;
        EXPECT_EQ(std::trunc(seconds), seconds) << "stored in whole seconds";
    }

    catalog.reset();
    writeBundle(plugIns + "Changed.bundle", plugInInfo("r.changed", "p2"));
    writePlist(entitled + "/Entitlements.plist", Dict{{"e", true}});
    fs::remove_all(plugIns + "Gone.bundle");
    auto moved = options();
    moved.systemRoots = {base + "/loose"};  // the added bundle now lies on the system volume
    open(moved);
    EXPECT_EQ(catalog->infoFilesParsed(), 2u);
    EXPECT_EQ(identifiers(recorder->uninstalled()), (std::set<std::string>{"r.changed", "r.entitled", "r.gone"}));
    EXPECT_EQ(identifiers(recorder->installed()), (std::set<std::string>{"r.changed", "r.entitled"}));
    for (const auto& old : before) {
        if (PlugInRecordPtr now = byIdentifier(old->identifier)) {
            bool renewed = old->identifier == "r.changed" || old->identifier == "r.entitled";
            EXPECT_EQ(now->uuid != old->uuid, renewed) << old->identifier;
        }
    }
    EXPECT_EQ(byIdentifier("r.changed")->extensionPoint, "p2");
    EXPECT_TRUE(byIdentifier("r.entitled")->entitlements);
    EXPECT_TRUE(byIdentifier("r.added")->onSystemVolume);

    // Another language renames without re-registering.
    auto german = moved;
    german.language = "de";
    open(german);
    EXPECT_EQ(byIdentifier("r.same")->localizedShortName, "Gleich");
    EXPECT_EQ(byIdentifier("r.same")->uuid, same->uuid);
    EXPECT_TRUE(recorder->installed().empty());
}

TEST_F(AppCatalogTest, WatchedFoldersShowInstallsUpdatesAndRemovals) {
    open();
    std::string app = userRoot + "/Live.app";
    // An application appears with a desktop-style bundle written piece by piece.
    fs::create_directories(app + "/Contents/PlugIns/Live.bundle/Contents");
    ASSERT_TRUE(eventually([&] { return catalog->applicationAtPath(app) != nullptr; }));
    writeBundle(app + "/Contents/PlugIns/Live.bundle", plugInInfo("live.one", "p"), true);
    ASSERT_TRUE(eventually([&] { return byIdentifier("live.one") != nullptr; }));
    EXPECT_EQ(identifiers(recorder->installed()), std::set<std::string>{"live.one"});
    PlugInRecordPtr first = byIdentifier("live.one");

    // An update replaces the bundle: a new registration.
    std::string staged = writeBundle(base + "/staging/Live.bundle", plugInInfo("live.one", "p2"), true);
    fs::rename(app + "/Contents/PlugIns/Live.bundle", base + "/staging/Old.bundle");
    fs::rename(staged, app + "/Contents/PlugIns/Live.bundle");
    ASSERT_TRUE(eventually([&] {
        auto now = byIdentifier("live.one");
        return now && now->uuid != first->uuid;
    }));
    EXPECT_EQ(byIdentifier("live.one")->extensionPoint, "p2");
    EXPECT_EQ(recorder->uninstalled().at(0)->uuid, first->uuid);

    // A plug-ins folder made after the application, in the flat layout.
    writeBundle(app + "/PlugIns/Flat.bundle", plugInInfo("live.flat", "p"));
    ASSERT_TRUE(eventually([&] { return byIdentifier("live.flat") != nullptr; }));

    fs::remove_all(app);
    ASSERT_TRUE(eventually([&] { return catalog->installedPlugIns().empty(); }));
    EXPECT_EQ(identifiers(recorder->uninstalled()), (std::set<std::string>{"live.one", "live.flat"}));
    EXPECT_FALSE(catalog->applicationAtPath(app));
}

TEST_F(AppCatalogTest, RegisterAndUnregisterByPath) {
    std::string installed = writeBundle(userRoot + "/In.app/PlugIns/In.bundle", plugInInfo("reg.in", "p"));
    std::string looseApp = base + "/elsewhere/Loose.app";
    writeBundle(looseApp, {{"MRBundleName", "Loose"}});
    std::string inLooseApp = writeBundle(looseApp + "/Contents/PlugIns/X.bundle", plugInInfo("reg.x", "p"));
    std::string alone = writeBundle(base + "/elsewhere/Alone.bundle", plugInInfo("reg.alone", "p"));
    fs::create_directory_symlink(alone, base + "/link");
    writeBundle(base + "/elsewhere/Plain.bundle", {{"MRBundleIdentifier", "plain"}});
    fs::create_directories(base + "/elsewhere/Empty");
    open();

    using E = qm::AppCatalogError;
    const std::pair<std::string, E> refusals[] = {
        {base + "/nothing-here", E::notAPlugIn}, {base + "/elsewhere/Empty", E::notAPlugIn},
        {base + "/elsewhere/Plain.bundle", E::notAPlugIn}, {looseApp, E::applicationBundle},
        {userRoot + "/In.app", E::applicationBundle},
    };
    for (const auto& [path, expected] : refusals) {
        auto error = catalog->registerPlugIn(path);
        ASSERT_TRUE(error) << path;
        EXPECT_EQ(qm::appCatalogErrorOf(*error), expected) << path << ": " << error->text();
    }
    EXPECT_EQ(qm::appCatalogErrorOf(*catalog->unregisterPlugIn(alone)), E::notRegistered);

    ASSERT_FALSE(catalog->registerPlugIn(base + "/link"));  // stored resolved
    PlugInRecordPtr record = catalog->plugInAtPath(alone);
    ASSERT_TRUE(record);
    EXPECT_EQ(record->bundlePath, alone);
    EXPECT_FALSE(record->containingApplication);
    EXPECT_EQ(identifiers(recorder->installed()), (std::set<std::string>{"reg.in", "reg.alone"}));
    ASSERT_FALSE(catalog->registerPlugIn(alone));
    EXPECT_EQ(catalog->plugInAtPath(alone)->uuid, record->uuid);
    ASSERT_FALSE(catalog->registerPlugIn(inLooseApp));
    EXPECT_EQ(byIdentifier("reg.x")->containingApplication->localizedName, "Loose");
    EXPECT_EQ(catalog->applicationAtPath(looseApp)->plugIns.size(), 1u);

    // Registrations outlive a restart; one whose bundle is gone is dropped.
    open();
    EXPECT_EQ(catalog->plugInAtPath(alone)->uuid, record->uuid);
    catalog.reset();
    fs::remove_all(inLooseApp);
    open();
    EXPECT_EQ(identifiers(recorder->uninstalled()), std::set<std::string>{"reg.x"});
    EXPECT_FALSE(catalog->applicationAtPath(looseApp));

    // A registered bundle deleted while the catalog runs is dropped.
    fs::remove_all(alone);
    ASSERT_TRUE(eventually([&] { return !catalog->plugInAtPath(alone); }));

    // An installed plug-in unregistered comes back at the next event in its folder.
    PlugInRecordPtr scanned = catalog->plugInAtPath(installed);
    ASSERT_FALSE(catalog->unregisterPlugIn(installed));
    EXPECT_FALSE(catalog->plugInAtPath(installed));
    EXPECT_EQ(recorder->uninstalled().back()->uuid, scanned->uuid);
    fs::create_directories(userRoot + "/In.app/PlugIns/Unrelated");
    ASSERT_TRUE(eventually([&] { return catalog->plugInAtPath(installed) != nullptr; }));
    EXPECT_NE(catalog->plugInAtPath(installed)->uuid, scanned->uuid);
}

TEST_F(AppCatalogTest, DamagedDatabaseIsMovedAsideAndRebuilt) {
    writeBundle(userRoot + "/D.app/PlugIns/D.bundle", plugInInfo("damage.d", "p"));
    auto foreign = [this](int applicationId, int version) {
        sqlite3* db = nullptr;
        ASSERT_EQ(sqlite3_open(databasePath.c_str(), &db), SQLITE_OK);
        std::string sql = "CREATE TABLE t (x); PRAGMA application_id=" + std::to_string(applicationId) +
                          "; PRAGMA user_version=" + std::to_string(version) + ";";
        EXPECT_EQ(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK);
        sqlite3_close(db);
    };
    const std::pair<const char*, std::function<void()>> cases[] = {
        {"garbage", [this] { qmtest::writeFile(databasePath, std::string(8192, 'x')); }},
        {"another application_id", [&] { foreign(42, 1); }},
        {"another user_version", [&] { foreign(0x514D4341, 9); }},
    };
    for (const auto& [name, damage] : cases) {
        SCOPED_TRACE(name);
        fs::remove_all(base + "/data");
        fs::create_directories(base + "/data");
        damage();
        LogCapture log;
        open();
        EXPECT_TRUE(log.contains("is damaged")) << log.text();
        EXPECT_EQ(identifiers(recorder->installed()), std::set<std::string>{"damage.d"});
        auto isAside = [](const fs::directory_entry& e) { return e.path().filename().string().starts_with("AppCatalog.db.bad-"); };
        EXPECT_GE(std::count_if(fs::directory_iterator(base + "/data"), fs::directory_iterator(), isAside), 1);
        PlugInRecordPtr record = byIdentifier("damage.d");
        open();  // the rebuilt file is sound and keeps the identity
        EXPECT_EQ(byIdentifier("damage.d")->uuid, record->uuid);
        EXPECT_TRUE(recorder->installed().empty());
        catalog.reset();
    }
}

TEST_F(AppCatalogTest, SecondOpenerWaitsThenFails) {
    open();
    LogCapture log;
    auto second = AppCatalog::open(options());
    ASSERT_FALSE(second);
    EXPECT_EQ(second.error().code, EBUSY);
    EXPECT_TRUE(log.contains("locked by another process")) << log.text();
}

TEST(PlugInDeclarations, BothVocabulariesAndTheirFallbacks) {
    const Dict newAttributes{{"VTExtensionIdentifier", "n.id"}, {"VTExtensionPointName", "n.point"}};
    const Dict oldAttributes{{"ovaro.identifier", "o.id"}, {"ovaro.protocol", "o.point"}};
    const Dict ownPoint{{"VTExtensionAttributes", Dict{{"VTExtensionPointName", "own"}}}};
    const Dict oldOwnPoint{{"Attributes", Dict{{"ovaro.protocol", "own"}}}};
    auto info = [](const char* top, Dict topDictionary) {
        return Dict{{"MRBundleIdentifier", "bundle.id"}, {top, std::move(topDictionary)}};
    };
    using Declared = std::vector<std::pair<std::string, std::optional<std::string>>>;  // identifier, point
    const std::tuple<const char*, Value, Declared> cases[] = {
        {"new style", info("VTExtension", {{"VTExtensionAttributes", newAttributes}}), {{"n.id", "n.point"}}},
        {"old style", info("Quamber", {{"Attributes", oldAttributes}}), {{"o.id", "o.point"}}},
        {"old keys in a new top are not read", info("VTExtension", {{"Attributes", oldAttributes}}), {{"bundle.id", {}}}},
        {"both: the new one wins",
         info("Quamber", {{"Attributes", oldAttributes}}).changing("VTExtension", Dict{{"VTExtensionAttributes", newAttributes}}),
         {{"n.id", "n.point"}}},
        {"multiple, new style",
         info("VTExtension", {{"VTExtensionAttributes", newAttributes}, {"Multiple", Dict{{"m.2", ownPoint}, {"m.1", Dict{}}}}}),
         {{"m.1", "n.point"}, {"m.2", "own"}}},
        {"multiple, old style", info("Quamber", {{"Attributes", oldAttributes}, {"Multiple", Dict{{"m.1", oldOwnPoint}}}}),
         {{"m.1", "own"}}},
        {"multiple that is no dictionary", info("VTExtension", {{"Multiple", "x"}}), {{"bundle.id", {}}}},
        {"top that is no dictionary", Dict{{"MRBundleIdentifier", "b"}, {"VTExtension", 3}}, {{"b", {}}}},
        {"nothing identifies it", Dict{{"VTExtension", Dict{}}}, {}},
        {"no plug-in at all", Dict{{"MRBundleIdentifier", "b"}}, {}},
    };
    for (const auto& [name, declaring, expected] : cases) {
        Declared got;
        for (const auto& declared : qm::declaredPlugIns(declaring)) {
            got.emplace_back(declared.identifier, declared.extensionPoint);
        }
        EXPECT_EQ(got, expected) << name;
    }
}

TEST(DataContainer, NamedByTheBundleIdentifierForCodePlugInsOnly) {
    qmtest::TempDir dir;
    // {identifier, names an executable, a container is made}
    const std::tuple<std::optional<std::string>, bool, bool> cases[] = {
        {"com.ok", true, true}, {"com.ok", false, false}, {"", true, false},       {"a/b", true, false},
        {".hidden", true, false}, {"..", true, false},    {std::nullopt, true, false},
    };
    for (const auto& [identifier, executable, made] : cases) {
        Dict info;
        if (identifier) {
            info.set("MRBundleIdentifier", *identifier);
        }
        if (executable) {
            info.set("MRBundleExecutable", "run");
        }
        LogCapture log;
        auto container = qm::makeDataContainer(dir.file("Containers"), info, "/b");
        EXPECT_EQ(container.has_value(), made) << identifier.value_or("(none)");
        EXPECT_EQ(log.lines().size(), made || !executable ? 0u : 1u) << log.text();
        EXPECT_TRUE(!container || fs::is_directory(*container + "/tmp"));
    }
}

TEST_F(AppCatalogTest, BundlesThatCannotBeStoredAreRefusedAlone) {
    // A date past what a property list can write: readable, not storable.
    std::string odd = base + "/elsewhere/Odd.bundle";
    qmtest::writeFile(odd + "/Info.plist",
                      "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict>"
                      "<key>MRBundleIdentifier</key><string>odd</string><key>VTExtension</key><dict/>"
                      "<key>When</key><date>2150-01-01T00:00:00Z</date></dict></plist>");
    fs::create_directories(userRoot + "/S.app/PlugIns");
    fs::copy(odd, userRoot + "/S.app/PlugIns/Odd.bundle", fs::copy_options::recursive);
    writeBundle(userRoot + "/S.app/PlugIns/Fine.bundle", plugInInfo("fine", "p"));
    open();
    EXPECT_EQ(identifiers(recorder->installed()), std::set<std::string>{"fine"});
    auto error = catalog->registerPlugIn(odd);
    ASSERT_TRUE(error);
    EXPECT_EQ(qm::appCatalogErrorOf(*error), qm::AppCatalogError::notAPlugIn);
    EXPECT_NE(error->text().find("cannot be stored"), std::string::npos) << error->text();
}

TEST_F(AppCatalogTest, UntrustedEntitlementsAreLoggedOncePerRegistration) {
    std::string bundle = writeBundle(userRoot + "/T.app/PlugIns/T.bundle", plugInInfo("t", "p"));
    writePlist(bundle + "/Entitlements.plist", Dict{{"e", true}});
    ASSERT_EQ(::chmod((bundle + "/Entitlements.plist").c_str(), 0666), 0);
    LogCapture log;
    open();
    EXPECT_FALSE(byIdentifier("t")->entitlements);
    EXPECT_EQ(log.countContaining("entitlements not honoured"), 1u) << log.text();
    open();
    ASSERT_FALSE(catalog->registerPlugIn(bundle));
    EXPECT_EQ(log.countContaining("entitlements not honoured"), 1u) << log.text();
}

}  // namespace
